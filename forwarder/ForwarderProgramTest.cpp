// The program against a collector on this machine, with stores that the service's own
// code writes.
#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <mutex>
#include <random>
#include <thread>

#include "forwarder/ForwarderTesting.h"
#include "forwarder/ScriptedServer.h"
#include "platform/linux/ChildProcess.h"
#include "platform/linux/store/StoreTelemetryBackend.h"
#include "platform/linux/store/StoreTesting.h"

namespace ostrel {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using std::chrono::steady_clock;
using testing_support::ChildProcess;
using testing_support::eventually;
using testing_support::ReceivedRequest;
using testing_support::ScriptedServer;
using testing_support::TakenRecords;
using Peer = ScriptedServer::Peer;
using Request = ScriptedServer::Request;

std::string contentOf(const std::string& path) {
  std::ifstream file(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(file), {}};
}

/// A store that is written to as the service does.
class RecordedStore {
 public:
  explicit RecordedStore(std::string path) : path_(std::move(path)) { open(); }

  void open() {
    store_ = Store::open(path_);
    backend_ = std::make_unique<StoreTelemetryBackend>(store_);
  }
  void close() {
    backend_.reset();
    store_.reset();
  }
  /// So many messages of a session, one without, and a summary; durable.
  void record(int count) {
    auto session = backend_->createSession(sessionInfo(77), userInfo(), {});
    for (int i = 0; i < count; ++i) {
      session->sendMessage(2, 7, Dictionary{{"number", Value(++number_)}});
    }
    backend_->sendOneMessage(sessionInfo(-1), userInfo(), 9, 0, Dictionary());
    session->sendMessage(0xFFFF, 0xFFFF,
                         Dictionary{{"Ostrel_Session_Summary_Event", Value("2")}});
    EXPECT_EQ(flushed(*session), std::nullopt);
  }
  /// The IDs of the records of all that it holds.
  std::vector<std::string> uids() const {
    return OtherConnection(path_).rows(
        "SELECT (SELECT value FROM service_status WHERE key = 'store_id') || '-' || id "
        "|| "
        "'-' || created_at FROM telemetry_messages");
  }

 private:
  const std::string path_;
  std::shared_ptr<Store> store_;
  std::unique_ptr<StoreTelemetryBackend> backend_;
  std::int64_t number_ = 0;
};

class ForwarderProgramTest : public ::testing::Test {
 protected:
  std::string operator/(const std::string& name) const { return directory_ / name; }
  std::string storePath() const { return *this / "state/reports.db"; }

  std::unique_ptr<ChildProcess> start(const std::vector<std::string>& arguments,
                                      const std::string& endpoint) {
    std::vector<std::string> command{
        std::filesystem::read_symlink("/proc/self/exe").parent_path() /
        "ostrelforwarder"};
    command.insert(command.end(), arguments.begin(), arguments.end());
    std::vector<std::string> all{"STATE_DIRECTORY=" + *this / "own",
                                 "OSTREL_STORE=" + storePath(),
                                 "OTEL_EXPORTER_OTLP_ENDPOINT=" + endpoint};
    all.insert(all.end(), variables_.begin(), variables_.end());
    return std::make_unique<ChildProcess>(command, *this / "output.txt", all);
  }
  int runOnce(const std::string& endpoint) { return start({"--once"}, endpoint)->wait(); }
  int run(const std::vector<std::string>& arguments, const std::string& endpoint) {
    return start(arguments, endpoint)->wait();
  }
  static int terminate(ChildProcess& process) {
    ::kill(process.pid(), SIGTERM);
    return process.wait();
  }
  std::string output() const { return contentOf(*this / "output.txt"); }

  ScriptedServer::Script taking() {
    return [this](const Request& request, const Peer& peer) {
      take(request);
      peer.reply("200 OK");
      return true;
    };
  }
  void take(const Request& request) {
    const std::lock_guard lock(mutex_);
    taken_.take(ReceivedRequest(request.body));
  }
  std::size_t takenCount() const {
    const std::lock_guard lock(mutex_);
    return taken_.size();
  }
  void expectAllTaken(const RecordedStore& store) const {
    const std::lock_guard lock(mutex_);
    const auto uids = store.uids();
    for (const std::string& uid : uids) EXPECT_TRUE(taken_.has(uid)) << uid;
    EXPECT_EQ(taken_.size(), uids.size());
  }

  const testing_support::TemporaryDirectory directory_;
  std::vector<std::string> variables_;
  mutable std::mutex mutex_;
  TakenRecords taken_;  // Guarded by `mutex_`.
};

TEST_F(ForwarderProgramTest, ForwardsWhatWasRecordedOnce) {
  RecordedStore store(storePath());
  store.record(1000);
  const ScriptedServer server(taking());
  EXPECT_EQ(runOnce(server.url()), 0) << output();
  expectAllTaken(store);
  const std::size_t requests = server.requests().size();
  EXPECT_EQ(runOnce(server.url()), 0) << output();
  EXPECT_EQ(server.requests().size(), requests);
}

TEST_F(ForwarderProgramTest, ForwardsTheStoreOfAServiceThatEnded) {
  RecordedStore store(storePath());
  store.record(10);
  store.close();
  const ScriptedServer server(taking());
  EXPECT_EQ(runOnce(server.url()), 0) << output();
  expectAllTaken(store);
}

TEST_F(ForwarderProgramTest, ForwardsWhatComesWhileItRuns) {
  const ScriptedServer server(taking());
  const auto forwarder = start({}, server.url());
  RecordedStore store(storePath());  // It was not there before.
  store.record(10);
  EXPECT_TRUE(eventually([&] { return takenCount() == 12; }));
  store.record(20);
  EXPECT_TRUE(eventually([&] { return takenCount() == 34; }));
  EXPECT_EQ(terminate(*forwarder), 0);
  expectAllTaken(store);
  EXPECT_EQ(taken_.repeated(), 0u);
}

TEST_F(ForwarderProgramTest, ForwardsAStoreThatTakesThePlaceOfAnother) {
  const ScriptedServer server(taking());
  std::size_t before = 0;
  {
    RecordedStore store(storePath());
    store.record(20);
    EXPECT_EQ(runOnce(server.url()), 0) << output();
    before = takenCount();
  }
  std::filesystem::rename(*this / "state", *this / "aside");
  RecordedStore store(storePath());
  store.record(30);
  EXPECT_EQ(runOnce(server.url()), 0) << output();
  EXPECT_EQ(takenCount(), before + store.uids().size());
}

TEST_F(ForwarderProgramTest, LosesNothingWhenItIsKilled) {
  RecordedStore store(storePath());
  const ScriptedServer server([this](const Request& request, const Peer& peer) {
    // So that there are many requests, and kills between a request and its reply.
    if (request.body.size() > 20'000) {
      peer.reply("413 Too Large");
      return true;
    }
    take(request);
    std::this_thread::sleep_for(milliseconds(1));
    peer.reply("200 OK");
    return true;
  });
  std::mt19937 random(20261121);
  for (int i = 0; i < 30; ++i) {
    store.record(60);
    const auto forwarder = start({}, server.url());
    const std::size_t enough = server.requests().size() + random() % 4;
    EXPECT_TRUE(eventually([&] { return server.requests().size() >= enough; }));
    std::this_thread::sleep_for(std::chrono::microseconds(random() % 3000));
  }  // Each is killed here.
  EXPECT_EQ(runOnce(server.url()), 0) << output();
  expectAllTaken(store);
}

TEST_F(ForwarderProgramTest, DoesNothingAsLongAsNothingHappens) {
  RecordedStore store(storePath());
  store.record(10);
  const ScriptedServer server(taking());
  const auto forwarder = start({}, server.url());
  EXPECT_TRUE(eventually([&] { return takenCount() == 12; }));
  const std::string status = "/proc/" + std::to_string(forwarder->pid()) + "/status";
  const auto switches = [&] {
    const std::string text = contentOf(status);
    return text.substr(text.find("voluntary_ctxt_switches"));
  };
  EXPECT_TRUE(eventually([&] {
    const std::string before = switches();
    std::this_thread::sleep_for(milliseconds(700));
    return switches() == before;
  }));
  EXPECT_EQ(terminate(*forwarder), 0);
}

TEST_F(ForwarderProgramTest, EndsAtOnceWhileTheCollectorHangs) {
  RecordedStore store(storePath());
  store.record(10);
  const ScriptedServer server([](const Request&, const Peer& peer) {
    peer.hang();
    return false;
  });
  const auto forwarder = start({}, server.url());
  EXPECT_TRUE(eventually([&] { return server.requests().size() == 1; }));
  const auto asked = steady_clock::now();
  EXPECT_EQ(terminate(*forwarder), 0);
  EXPECT_LT(steady_clock::now() - asked, seconds(10));  // It would hang for 30.
}

TEST_F(ForwarderProgramTest, SaysWhyNotAllWasForwarded) {
  RecordedStore store(storePath());
  store.record(10);
  const ScriptedServer server([](const Request&, const Peer& peer) {
    peer.reply("401 Unauthorized");
    return true;
  });
  variables_ = {"OTEL_EXPORTER_OTLP_HEADERS=authorization=Bearer%20hunter2"};
  EXPECT_EQ(runOnce(server.url()), 1);
  EXPECT_NE(server.requests().at(0).head.find("authorization: Bearer hunter2\r\n"),
            std::string::npos);
  EXPECT_NE(output().find("ostrelforwarder: the collector does not take anything now: it "
                          "answers with status 401\n"),
            std::string::npos)
      << output();
  EXPECT_EQ(output().find("hunter2"), std::string::npos);
}

TEST_F(ForwarderProgramTest, SaysThatNoCollectorIsNamed) {
  EXPECT_EQ(run({}, ""), 0);
  EXPECT_EQ(output(),
            "ostrelforwarder: no collector is named by "
            "OTEL_EXPORTER_OTLP_ENDPOINT: nothing is sent\n");
}

TEST_F(ForwarderProgramTest, SaysWhichSettingIsWrong) {
  EXPECT_EQ(run({}, "http://collector.example"), 2);
  EXPECT_EQ(output(),
            "ostrelforwarder: OTEL_EXPORTER_OTLP_ENDPOINT: it is on another "
            "machine, to which only https is spoken\n");
}

TEST_F(ForwarderProgramTest, TakesThreeOptionsAndNoOther) {
  EXPECT_EQ(run({"--help"}, ""), 0);
  EXPECT_NE(output().find("usage: ostrelforwarder [--once]\n"), std::string::npos);
  EXPECT_EQ(run({"--version"}, ""), 0);
  EXPECT_EQ(run({"--twice"}, ""), 2);
  EXPECT_EQ(run({"--once", "--once"}, ""), 2);
}

/// A collector that speaks TLS, with certificates that are made for the test.
class ForwarderOverTLS : public ForwarderProgramTest {
 protected:
  ForwarderOverTLS() {
    store_ = std::make_unique<RecordedStore>(storePath());
    store_->record(10);
    makeAuthority("ca");
    directory_.write("localhost.ext", "subjectAltName=DNS:localhost");
    directory_.write("other.ext", "subjectAltName=DNS:collector.example");
    variables_ = {"OTEL_EXPORTER_OTLP_CERTIFICATE=" + *this / "ca.pem"};
  }

  void openssl(const std::string& arguments) const {
    const std::string command =
        "cd " + directory_.path() + " && openssl " + arguments + " 2>> openssl.log";
    ASSERT_EQ(std::system(command.c_str()), 0) << contentOf(*this / "openssl.log");
  }
  static std::string newKey(const std::string& name) {
    return "-newkey ec -pkeyopt ec_paramgen_curve:P-256 -nodes -keyout " + name +
           ".key -subj /CN=localhost ";
  }
  void makeAuthority(const std::string& name) const {
    openssl("req -x509 -days 1 " + newKey(name) + "-out " + name + ".pem");
  }
  void makeCertificate(const std::string& authority, const std::string& names,
                       int days) const {
    openssl("req " + newKey("server") + "-out server.csr");
    openssl("x509 -req -in server.csr -out server.pem -CA " + authority + ".pem -CAkey " +
            authority + ".key -days " + std::to_string(days) + " -extfile " + names +
            ".ext");
  }
  /// Sends to a server with this certificate; gives the exit status.
  int sendTo(const std::string& certificate) {
    const ChildProcess server(
        {"python3", std::string(OSTREL_FORWARDER_SOURCES) + "/tls_server.py",
         *this / (certificate + ".pem"), *this / (certificate + ".key"), *this / "port",
         *this / "received"},
        *this / "server.txt");
    EXPECT_TRUE(eventually([&] { return std::filesystem::exists(*this / "port"); }))
        << contentOf(*this / "server.txt");
    return runOnce("https://localhost:" + contentOf(*this / "port"));
  }
  /// Nothing that is sent inside of TLS: no body, no head, no secret.
  void expectNothingReceived(const std::string& reason) const {
    EXPECT_EQ(contentOf(*this / "received"), "");
    EXPECT_NE(output().find(reason), std::string::npos) << output();
  }

  std::unique_ptr<RecordedStore> store_;
};

TEST_F(ForwarderOverTLS, SendsToACollectorThatItTrusts) {
  makeCertificate("ca", "localhost", /*days=*/1);
  EXPECT_EQ(sendTo("server"), 0) << output();
  EXPECT_NE(contentOf(*this / "received").find("com.orbisk.ostrel.SessionSummary"),
            std::string::npos);
}

TEST_F(ForwarderOverTLS, SendsNothingToOneThatVouchesForItself) {
  makeAuthority("self");
  EXPECT_EQ(sendTo("self"), 1);
  expectNothingReceived("self");
}

TEST_F(ForwarderOverTLS, SendsNothingToOneOfAnUnknownAuthority) {
  makeAuthority("stranger");
  makeCertificate("stranger", "localhost", /*days=*/1);
  EXPECT_EQ(sendTo("server"), 1);
  expectNothingReceived("SSL certificate problem");
}

TEST_F(ForwarderOverTLS, SendsNothingToOneOfAnotherName) {
  makeCertificate("ca", "other", /*days=*/1);
  EXPECT_EQ(sendTo("server"), 1);
  expectNothingReceived("no alternative certificate subject name matches");
}

TEST_F(ForwarderOverTLS, SendsNothingToOneWhoseTimeIsOver) {
  makeCertificate("ca", "localhost", /*days=*/-1);
  EXPECT_EQ(sendTo("server"), 1);
  expectNothingReceived("certificate has expired");
}

TEST_F(ForwarderOverTLS, SendsNothingToOneThatDoesNotEncrypt) {
  const ScriptedServer server(taking());
  variables_.push_back("OTEL_EXPORTER_OTLP_TIMEOUT=300");
  EXPECT_EQ(runOnce("https://localhost" + server.url().substr(server.url().rfind(':'))),
            1);
  EXPECT_TRUE(server.requests().empty());
}

}  // namespace
}  // namespace ostrel
