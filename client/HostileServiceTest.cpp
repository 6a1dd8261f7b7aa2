// The client library at a service that does wrong: whatever it says or does not say, each
// open request ends with an error within a second of the loss, and the client goes on.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <future>
#include <memory>
#include <mutex>
#include <string_view>

#include "client/ClientSocket.h"
#include "ostrel/OstrelReportingClient.h"
#include "platform/linux/Limits.h"
#include "platform/linux/TestSockets.h"
#include "platform/linux/TestSupport.h"
#include "platform/linux/wire/Frame.h"

namespace ostrel::reporting {
namespace {

using namespace std::chrono_literals;
using namespace std::string_view_literals;
using std::chrono::steady_clock;
using testing::Each;
using testing::SizeIs;

constexpr ReporterID kSession{7};

// From the end of the connection until all requests have ended, on a busy machine too.
constexpr auto kLongest = 1s;

std::string frameOf(std::string_view item) {
  std::string frame(wire::kFrameHeaderSize, '\0');
  frame[0] = static_cast<char>(item.size());
  return frame.append(item);
}

/// A service that says what it is told to.
class ScriptedService {
 public:
  ScriptedService() { EXPECT_TRUE(listener_); }

  std::string path() const { return directory_ / "socket"; }

  /// Takes the next connection.
  void accept() {
    client_ = FileDescriptor(::accept4(listener_.get(), nullptr, nullptr, SOCK_CLOEXEC));
    EXPECT_TRUE(client_);
  }
  /// Reads until as many frames are there, as whole as they come.
  void read(int frames) {
    wire::FrameReader reader(limits::kFrameBytes);
    std::span<const std::uint8_t> item;
    while (frames > 0) {
      const auto room = reader.room(/*size=*/4096);
      const ssize_t count = ::recv(client_.get(), room.data(), room.size(), 0);
      ASSERT_GT(count, 0);
      reader.added(static_cast<std::size_t>(count));
      while (reader.next(item) == wire::FrameReader::Next::kFrame) --frames;
    }
  }
  void say(std::string_view bytes) {
    EXPECT_EQ(::send(client_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL),
              static_cast<ssize_t>(bytes.size()));
  }
  void hangUp() { client_.reset(); }

 private:
  const testing_support::TemporaryDirectory directory_;
  const FileDescriptor listener_ = testing_support::listeningSocket(path());
  FileDescriptor client_;
};

/// How requests ended.
class Endings {
 public:
  auto taken() {
    return [this](const ReplyStatus& reply) {
      const std::lock_guard lock(mutex_);
      all_.push_back(reply.status);
      changed_.notify_all();
    };
  }
  /// All so far, once there are `count` or it takes too long.
  std::vector<Status> wait(std::size_t count) {
    std::unique_lock lock(mutex_);
    changed_.wait_for(lock, 30s, [&] { return all_.size() >= count; });
    return all_;
  }
  std::size_t count(Status status) {
    const std::lock_guard lock(mutex_);
    return static_cast<std::size_t>(std::ranges::count(all_, status));
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<Status> all_;
};

class ClientOfAHostileService : public testing::Test {
 protected:
  static constexpr int kRequests = 7;

  static Options optionsFor(const ScriptedService& service) {
    Options options;
    options.socketPath = service.path();
    options.closeTimeout = 0ms;
    return options;
  }

  /// Asks everything that is answered, as requests 1 to 7, and has the service read it.
  void askEverything() {
    client.createReportingSession(kSession, endings.taken());
    client.getServiceNameForReporterID(kSession, endings.taken());
    client.startReportingSessionForID(kSession, endings.taken());
    client.sendMessage({{"a", 1}}, Category{1}, MessageType{2}, {{kSession}},
                       endings.taken());
    client.reporterIDValid(kSession, endings.taken());
    client.getAllReporters(endings.taken());
    client.stopReportingSessionForID(kSession, endings.taken());
    service.accept();
    service.read(kRequests);
  }

  /// Says this, after which the client must give the service up.
  void expectLoss(std::string_view bytes, std::size_t answered = 0) {
    askEverything();
    const auto begin = steady_clock::now();
    service.say(bytes);
    expectAllEnd(begin, answered);
  }
  void expectAllEnd(steady_clock::time_point begin, std::size_t answered = 0) {
    EXPECT_THAT(endings.wait(kRequests), SizeIs(kRequests));
    EXPECT_LT(steady_clock::now() - begin, kLongest);
    EXPECT_EQ(endings.count(Status::kReplied), answered);
    EXPECT_EQ(endings.count(Status::kConnectionLost), kRequests - answered);
    expectItGoesOn();
  }
  /// The next connection is served as if nothing had been.
  void expectItGoesOn() {
    Endings next;
    service.accept();
    client.getServiceNameForReporterID(kSession, next.taken());
    service.read(1);
    // The number goes on: it is the eighth request.
    service.say(frameOf("\x82\x08\x0b"sv));
    EXPECT_THAT(next.wait(1), testing::ElementsAre(Status::kReplied));
  }

  ScriptedService service;
  Endings endings;
  Client client{optionsFor(service)};
};

TEST_F(ClientOfAHostileService, GivesGarbageUp) { expectLoss(std::string(1000, '\xff')); }

TEST_F(ClientOfAHostileService, GivesAnEmptyFrameUp) { expectLoss("\0\0\0\0"sv); }

TEST_F(ClientOfAHostileService, GivesAFrameThatIsTooLargeUp) {
  expectLoss("\x01\x00\x05\x00"sv);
}

TEST_F(ClientOfAHostileService, GivesAReplyToANumberThatItNeverUsedUp) {
  expectLoss(frameOf("\x82\x18\x63\xf5"sv));
}

TEST_F(ClientOfAHostileService, GivesAReplyOfAnotherKindUp) {
  expectLoss(frameOf("\x82\x06\xf5"sv));  // Of the IDs, a boolean.
}

TEST_F(ClientOfAHostileService, GivesAReplyThatIsNotOneUp) {
  expectLoss(frameOf("\xa1\x01\xf5"sv));
}

TEST_F(ClientOfAHostileService, GivesAPayloadBeyondTheLimitsUp) {
  expectLoss(
      frameOf("\x82\x05\xa1\x61"
              "a" +
              std::string(40, '\x81') + '\x01'));
}

TEST_F(ClientOfAHostileService, GivesAValidityWithoutItsKeysUp) {
  expectLoss(frameOf("\x82\x05\xa0"sv));
}

TEST_F(ClientOfAHostileService, KeepsTheRepliesThatCameBeforeTheLoss) {
  expectLoss(frameOf("\x82\x01\xf5"sv) + frameOf("\x82\x02\x0b"sv) + "\xff\xff\xff\xff",
             /*answered=*/2);
}

TEST_F(ClientOfAHostileService, TakesTheClosingForALoss) {
  expectLoss(frameOf("\x82\x00\x63why"sv));
}

TEST_F(ClientOfAHostileService, EndsAllWhenItHangsUpWithinAReply) {
  askEverything();
  service.say("\x03\x00\x00\x00\x82"sv);
  const auto begin = steady_clock::now();
  service.hangUp();
  expectAllEnd(begin);
}

TEST_F(ClientOfAHostileService, EndsAllWhenItHangsUpWithoutAWord) {
  askEverything();
  const auto begin = steady_clock::now();
  service.hangUp();
  expectAllEnd(begin);
}

TEST_F(ClientOfAHostileService, TakesRepliesInPiecesAndInAnyOrder) {
  askEverything();
  for (const char byte : frameOf("\x82\x07\xf5"sv) + frameOf("\x82\x04\xf6"sv) +
                             frameOf("\x82\x06\x81\x07"sv)) {
    service.say({&byte, 1});
  }
  EXPECT_THAT(endings.wait(3), Each(Status::kReplied));
  const auto begin = steady_clock::now();
  service.hangUp();
  expectAllEnd(begin, /*answered=*/3);
}

TEST_F(ClientOfAHostileService, HearsASecondReplyToARequestThatHasOneOnlyOnce) {
  askEverything();
  service.say(frameOf("\x82\x01\xf5"sv) + frameOf("\x82\x01\xf5"sv) +
              frameOf("\x82\x07\xf5"sv));
  EXPECT_THAT(endings.wait(2), SizeIs(2));
  const auto begin = steady_clock::now();
  service.hangUp();
  expectAllEnd(begin, /*answered=*/2);
}

TEST_F(ClientOfAHostileService, EndsItsRequestsAtTheirTimeWhenItNeverAnswers) {
  client.getAllReporters({endings.taken(), /*toWait=*/20ms});
  client.startReportingSessionForID(kSession, {endings.taken(), /*toWait=*/20ms});
  service.accept();
  EXPECT_THAT(endings.wait(2),
              testing::ElementsAre(Status::kTimedOut, Status::kTimedOut));
}

TEST_F(ClientOfAHostileService, ClosesWhileItNeverReads) {
  // More than a socket holds.
  const Message large{{"filling", std::string(200'000, 'x')}};
  for (int i = 0; i < 20; ++i) {
    client.sendMessage(large, Category{1}, MessageType{2}, {{kSession}}, endings.taken());
  }
  service.accept();
  client.close();
  EXPECT_THAT(endings.wait(20), testing::AllOf(SizeIs(20), Each(Status::kClosed)));
}

// The client's own thread, which a handler holds up, cannot tell the others any more.
TEST_F(ClientOfAHostileService, EndsAllByTheTimeThatItIsClosedThoughAHandlerHangs) {
  struct Hang {
    std::promise<void> isEntered;
    std::promise<void> mayGo;
  };
  const auto hang = std::make_shared<Hang>();
  client.getServiceNameForReporterID(kSession, [hang](const Reply<ServiceType>&) {
    hang->isEntered.set_value();
    hang->mayGo.get_future().wait();
  });
  client.startReportingSessionForID(kSession, endings.taken());
  client.getAllReporters(endings.taken());
  client.stopReportingSessionForID(kSession, endings.taken());
  service.accept();
  service.read(4);
  service.say(frameOf("\x82\x01\x0b"sv));
  hang->isEntered.get_future().wait();

  client.close();
  EXPECT_THAT(endings.wait(0), testing::AllOf(SizeIs(3), Each(Status::kClosed)));
  hang->mayGo.set_value();
}

}  // namespace
}  // namespace ostrel::reporting
