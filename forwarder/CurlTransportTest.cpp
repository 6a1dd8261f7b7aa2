#include "forwarder/CurlTransport.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>

#include "forwarder/ScriptedServer.h"

namespace ostrel {
namespace {

using std::chrono::milliseconds;
using testing_support::ScriptedServer;
using Peer = ScriptedServer::Peer;
using Request = ScriptedServer::Request;

class CurlTransportTest : public ::testing::Test {
 protected:
  /// The reply of a server to one request.
  Reply post(const ScriptedServer::Script& script) {
    const ScriptedServer server(script);
    return postTo(server.url());
  }
  Reply postTo(const std::string& url) {
    CurlTransport transport(settingsFor(url), end_.get());
    return transport.post("{\"x\":1}");
  }
  ForwarderSettings settingsFor(const std::string& url) {
    settings_.logs = *endpointFrom(url, "v1/logs").value;
    return settings_;
  }

  ForwarderSettings settings_;
  FileDescriptor end_{::eventfd(0, EFD_CLOEXEC)};
};

bool answer200(const Request&, const Peer& peer) {
  peer.reply("200 OK");
  return true;
}

TEST_F(CurlTransportTest, PostsJSONWithTheHeaders) {
  settings_.headers = {{"api-key", "a b"}, {"x-empty", ""}};
  const ScriptedServer server(answer200);
  const Reply reply = postTo(server.url());
  EXPECT_EQ(reply.status, 200);
  EXPECT_EQ(reply.body, "{}");
  const auto requests = server.requests();
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(requests[0].body, "{\"x\":1}");
  EXPECT_TRUE(requests[0].head.starts_with("POST /v1/logs HTTP/1.1\r\n"))
      << requests[0].head;
  for (const char* line : {"\r\nContent-Type: application/json\r\n",
                           "\r\napi-key: a b\r\n", "\r\nx-empty:\r\n"}) {
    EXPECT_NE(requests[0].head.find(line), std::string::npos) << requests[0].head;
  }
  EXPECT_EQ(requests[0].head.find("Expect"), std::string::npos);
}

TEST_F(CurlTransportTest, KeepsItsConnection) {
  const ScriptedServer server(answer200);
  CurlTransport transport(settingsFor(server.url()), end_.get());
  for (int i = 0; i < 3; ++i) EXPECT_EQ(transport.post("{}").status, 200);
  EXPECT_EQ(server.connections(), 1);
}

TEST_F(CurlTransportTest, SendsALargeBodyAtOnce) {
  const ScriptedServer server(answer200);
  CurlTransport transport(settingsFor(server.url()), end_.get());
  const std::string body(3'000'000, 'x');
  EXPECT_EQ(transport.post(body).status, 200);
  EXPECT_EQ(server.requests().at(0).body, body);
}

TEST_F(CurlTransportTest, GivesTheStatusAndTheTimeToRetryAt) {
  const Reply reply = post([](const Request&, const Peer& peer) {
    peer.reply("503 Busy", "RETRY-after:  Sun, 06 Nov 1994 08:49:37 GMT \r\n", "later");
    return true;
  });
  EXPECT_EQ(reply.status, 503);
  EXPECT_EQ(reply.body, "later");
  EXPECT_EQ(reply.retryAfter, "Sun, 06 Nov 1994 08:49:37 GMT");
}

TEST_F(CurlTransportTest, DoesNotFollowRedirects) {
  const ScriptedServer other(answer200);
  const Reply reply = post([&](const Request&, const Peer& peer) {
    peer.reply("307 Elsewhere", "Location: " + other.url() + "/\r\n", "");
    return true;
  });
  EXPECT_EQ(reply.status, 307);
  EXPECT_EQ(other.connections(), 0);
}

TEST_F(CurlTransportTest, ReadsNoMoreThan64KiBOfAReply) {
  std::atomic<std::size_t> sent{0};
  const Reply reply = post([&](const Request&, const Peer& peer) {
    peer.send("HTTP/1.1 200 OK\r\nContent-Length: 1073741824\r\n\r\n");
    const std::string piece(1 << 20, 'x');
    // Ends when the other side does: much earlier, but for what buffers hold.
    for (int i = 0; i < 64; ++i) {
      peer.send(piece);
      sent += piece.size();
    }
    return false;
  });
  EXPECT_EQ(reply.status, 200);
  EXPECT_EQ(reply.body.size(), Transport::kMostReplyBytes);
}

TEST_F(CurlTransportTest, TakesARepliesBodyOf64KiBWhole) {
  const Reply reply = post([](const Request&, const Peer& peer) {
    peer.reply("200 OK", "", std::string(Transport::kMostReplyBytes, 'x'));
    return true;
  });
  EXPECT_EQ(reply.body.size(), Transport::kMostReplyBytes);
}

TEST_F(CurlTransportTest, GivesAHungServerUp) {
  settings_.timeout = milliseconds(100);
  const Reply reply = post([](const Request&, const Peer& peer) {
    peer.hang();
    return false;
  });
  EXPECT_EQ(reply.status, 0);
  EXPECT_NE(reply.failure.find("timed out"), std::string::npos) << reply.failure;
}

TEST_F(CurlTransportTest, KnowsTheStatusOfAReplyThatDoesNotEnd) {
  settings_.timeout = milliseconds(300);
  const Reply reply = post([](const Request&, const Peer& peer) {
    peer.send("HTTP/1.1 200 OK\r\nContent-Length: 100\r\n\r\n{");
    peer.hang();
    return false;
  });
  EXPECT_EQ(reply.status, 200);
  EXPECT_EQ(reply.body, "{");
}

TEST_F(CurlTransportTest, SaysWhyThereIsNoReply) {
  std::string url;
  {
    const ScriptedServer gone(answer200);
    url = gone.url();
  }
  const Reply reply = postTo(url);
  EXPECT_EQ(reply.status, 0);
  EXPECT_NE(reply.failure.find("connect"), std::string::npos) << reply.failure;

  const Reply cut = post([](const Request&, const Peer&) { return false; });
  EXPECT_EQ(cut.status, 0);
  EXPECT_NE(cut.failure, "");
}

TEST_F(CurlTransportTest, DoesNotTakeAnswersOfAnotherKind) {
  const Reply reply = post([](const Request&, const Peer& peer) {
    peer.send("SSH-2.0-OpenSSH_9.2\r\n\r\n");
    return false;
  });
  EXPECT_EQ(reply.status, 0);
}

TEST_F(CurlTransportTest, IsInterruptedAtOnce) {
  const Reply reply = post([this](const Request&, const Peer& peer) {
    const std::uint64_t one = 1;
    EXPECT_EQ(::write(end_.get(), &one, sizeof one), 8);
    peer.hang();
    return false;
  });
  EXPECT_TRUE(reply.isInterrupted);
}

TEST_F(CurlTransportTest, SendsNothingOnceItIsToEnd) {
  const std::uint64_t one = 1;
  ASSERT_EQ(::write(end_.get(), &one, sizeof one), 8);
  const ScriptedServer server(answer200);
  EXPECT_TRUE(postTo(server.url()).isInterrupted);
  EXPECT_EQ(server.connections(), 0);
}

TEST_F(CurlTransportTest, AsksNoProxyForThisMachine) {
  const ScriptedServer proxy(answer200);
  const ScriptedServer server(answer200);
  ::setenv("http_proxy", proxy.url().c_str(), /*replace=*/1);
  const Reply reply = postTo(server.url());
  ::unsetenv("http_proxy");
  EXPECT_EQ(reply.status, 200);
  EXPECT_EQ(proxy.connections(), 0);
}

}  // namespace
}  // namespace ostrel
