// Calls of the service below the platform fail, the n-th once or all from the n-th on,
// while it starts on a store that a kill left behind, while it serves, and while it
// ends. It goes on, or ends with a sentence and status 1 at its start; a well-behaved
// client is served once the fault is over; and what was durable stays.
//
// OSTREL_FAULTS_OF_CALL says for how many n of each call that is tried, 0: for all.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/wait.h>

#include <csignal>
#include <fstream>

#include "platform/linux/FileDescriptor.h"
#include "tests/crash/FaultPlan.h"
#include "tests/crash/LoadedService.h"

namespace ostrel::crash {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

constexpr int kMessages = 5;
constexpr ReporterID kReporter{7};

struct FailingCall {
  const char* name;
  std::vector<Call> kinds;
  std::vector<int> errors;  // The n-th fault takes the n-th of them, and so on.
  bool mayEndIt = false;    // By a signal: no memory, no thread.
  bool canLast = true;      // No wait is interrupted for ever.
};

std::ostream& operator<<(std::ostream& out, const FailingCall& call) {
  return out << call.name;
}

const FailingCall kFailingCalls[] = {
    {"Accept", {Call::kAccept}, {EMFILE, ENFILE, ENOMEM, ECONNABORTED, EINTR}},
    {"Receive", {Call::kReceive}, {ENOMEM, ECONNRESET, EINTR}},
    {"Send", {Call::kSend}, {ENOBUFS, EPIPE, EINTR, EAGAIN}},
    {"Read", {Call::kRead}, {EIO, EINTR}},
    {"Write", {Call::kWrite}, {ENOSPC, EIO, EDQUOT, EINTR}},
    {"Open", {Call::kOpen}, {EMFILE, ENFILE, EIO, ENOSPC, EROFS}},
    {"Sync", {Call::kSync}, {EIO, ENOSPC, EDQUOT}},
    {"Rename", {Call::kRename}, {ENOSPC, EIO, EROFS}},
    {"Truncate", {Call::kTruncate}, {EIO, ENOSPC}},
    {"Map", {Call::kMap}, {ENOMEM}},
    {"Lock", {Call::kLock}, {ENOLCK, EIO}},
    {"Status", {Call::kStatus}, {EIO, ENOMEM}},
    {"Directory", {Call::kDirectory}, {ENOSPC, EROFS}},
    {"Poll", {Call::kPoll}, {EINTR}, /*mayEndIt=*/false, /*canLast=*/false},
    {"PollControl", {Call::kPollControl}, {ENOMEM, ENOSPC}},
    {"Event", {Call::kEvent}, {EMFILE, ENOMEM}},
    {"Watch", {Call::kWatch}, {EMFILE, ENOSPC}},
    {"Socket", {Call::kSocket}, {EMFILE, ENOMEM}},
    {"Thread", {Call::kThread}, {EAGAIN}, /*mayEndIt=*/true},
    {"Allocate", {Call::kAllocate}, {ENOMEM}, /*mayEndIt=*/true},
    {"SQLiteAllocate", {Call::kSQLiteAllocate}, {ENOMEM}},
    {"KillInAFileCall",
     {Call::kWrite, Call::kSync, Call::kTruncate, Call::kRename, Call::kOpen, Call::kMap,
      Call::kLock},
     {SharedFaults::kKill},
     /*mayEndIt=*/true},
};

class FaultyService : public ::testing::TestWithParam<FailingCall> {
 protected:
  // A store of one session and its messages as a kill leaves it: some of it is in the
  // log alone.
  static void SetUpTestSuite() {
    killed_ = new ServiceUnderTest;
    killed_->start();
    sendAndStop(killed_->socketPath(), /*first=*/0);
    ASSERT_TRUE(killed_->waitForRows(kNumbers, kMessages));
    killed_->kill();
  }
  static void TearDownTestSuite() {
    delete killed_;
    killed_ = nullptr;
  }

  enum class Phase { kStart, kServing, kEnd };

  // Runs the service through a phase in which the calls fail, then checks it. Gives how
  // many failed.
  std::int64_t run(Phase phase, std::int64_t after, bool isForEver) {
    service_ = std::make_unique<ServiceUnderTest>();
    fs::copy(*killed_ / "state", *service_ / "state", fs::copy_options::recursive);
    makeFaults();
    faults_->isForEver = isForEver;
    faults_->after = after;
    const FailingCall& call = GetParam();
    int error = call.errors[static_cast<std::size_t>(after) % call.errors.size()];
    if (isForEver && error == EINTR) error = call.errors.front();
    faults_->error = error;
    stored_ = kMessages;
    sent_ = kMessages;
    switch (phase) {
      case Phase::kStart:
        startUnderFaults();
        break;
      case Phase::kServing:
        serveUnderFaults();
        break;
      case Phase::kEnd:
        endUnderFaults();
        break;
    }
    const std::int64_t failed = faults_->failed;
    expectToBeServed();
    if (!HasFailure()) expectSoundStore();
    releaseFaults();
    return failed;
  }

  // For some n, or all.
  void runThrough(Phase phase) {
    const std::int64_t most = timesFrom("OSTREL_FAULTS_OF_CALL", /*usual=*/2);
    std::mt19937_64 random(seedFrom(/*usual=*/20260131));
    std::int64_t runs = 0;
    endsWithASentence_ = endsBySignal_ = 0;
    for (const bool isForEver : {false, true}) {
      if (isForEver && !GetParam().canLast) break;
      std::int64_t n = 0;
      for (std::int64_t i = 0; most == 0 || i < most; ++i) {
        SCOPED_TRACE("n = " + std::to_string(n) + (isForEver ? ", for ever" : ", once"));
        const std::int64_t failed = run(phase, n, isForEver);
        ASSERT_FALSE(HasFailure());
        if (failed == 0) break;
        ++runs;
        n += most == 0 ? 1 : 1 + static_cast<std::int64_t>(random() % 12);
      }
    }
    std::printf(
        "%lld faults: it went on after %lld, said why it did not start after %lld, "
        "was ended by %lld\n",
        static_cast<long long>(runs),
        static_cast<long long>(runs - endsWithASentence_ - endsBySignal_),
        static_cast<long long>(endsWithASentence_),
        static_cast<long long>(endsBySignal_));
  }

 private:
  static constexpr const char* kNumbers =
      "SELECT json_extract(payload, '$.i') FROM telemetry_messages WHERE category = 1 "
      "ORDER BY id";

  void makeFaults() {
    const std::string path = *service_ / "faults";
    std::ofstream(path).close();
    fs::resize_file(path, sizeof(SharedFaults));
    const FileDescriptor file(::open(path.c_str(), O_RDWR | O_CLOEXEC));
    void* memory = ::mmap(nullptr, sizeof(SharedFaults), PROT_READ | PROT_WRITE,
                          MAP_SHARED, file.get(), /*offset=*/0);
    ASSERT_NE(memory, MAP_FAILED);
    faults_ = new (memory) SharedFaults;
  }
  void releaseFaults() {
    ::munmap(faults_, sizeof(SharedFaults));
    faults_ = nullptr;
  }
  void beginFaults() {
    std::uint32_t kinds = 0;
    for (const Call kind : GetParam().kinds) kinds |= 1U << static_cast<unsigned>(kind);
    faults_->kinds = kinds;
  }
  void endFaults() { faults_->kinds = 0; }

  void start() {
    service_->start({programBeside("ostrelreportingd_with_faults")},
                    {"OSTREL_FAULTS=" + *service_ / "faults"});
  }

  bool hasEnded() {
    siginfo_t ended{};
    return ::waitid(P_PID, static_cast<id_t>(service_->process().pid()), &ended,
                    WEXITED | WNOHANG | WNOWAIT) == 0 &&
           ended.si_pid != 0;
  }

  // Whether a request is answered within `patience`.
  bool isAnswered(std::chrono::milliseconds patience) {
    const auto begin = SteadyClock::now();
    while (since(begin) < patience && !hasEnded()) {
      if (const auto connected = ServiceConnection::connect(service_->socketPath());
          connected.value) {
        Awaited<bool> isAnswered;
        (*connected.value)->setClosedHandler([&](const std::string&) {
          isAnswered.set(false);
        });
        (*connected.value)->getAllReporters([&](const ReporterIDs&) {
          isAnswered.set(true);
        });
        while (since(begin) < patience && isAnswered.times() == 0) {
          std::this_thread::sleep_for(1ms);
        }
        const bool isThere = isAnswered.times() != 0 && *isAnswered.get();
        (*connected.value)->abort();
        if (isThere) return true;
      }
      std::this_thread::sleep_for(1ms);
    }
    return false;
  }

  static void sendAndStop(const std::string& socket, int first) {
    RecordingClient client(socket);
    client->createReportingSession(kReporter, nullptr);
    client->setServiceType(ServiceType{3}, kReporter, nullptr);
    client->startReportingSessionForID(kReporter, nullptr);
    for (int i = first; i < first + kMessages; ++i) {
      client->sendMessage({{"i", Value(i)}}, MessageCategory{1}, MessageType{1},
                          ReporterIDs{kReporter}, nullptr);
    }
    client->stopReportingSessionForID(kReporter, nullptr);
    client.takeReplies();
  }

  void startUnderFaults() {
    beginFaults();
    start();
    isAnswered(100ms);
    endFaults();
  }

  void startAndSend() {
    start();
    ASSERT_TRUE(isAnswered(5s));
    sendAndStop(service_->socketPath(), sent_);
    sent_ += kMessages;
  }

  // Clients come, send and go; none waits for long.
  void serveUnderFaults() {
    ASSERT_NO_FATAL_FAILURE(startAndSend());
    ASSERT_TRUE(service_->waitForRows(kNumbers, static_cast<std::size_t>(sent_)));
    stored_ = sent_;
    beginFaults();
    for (int i = 0; i < 2; ++i) {
      auto connected = ServiceConnection::connect(service_->socketPath());
      if (!connected.value) continue;
      ServiceConnection& client = **connected.value;
      client.createReportingSession(kReporter, nullptr);
      client.startReportingSessionForID(kReporter, nullptr);
      for (int j = 0; j < kMessages; ++j) {
        client.sendMessage({{"i", Value(sent_++)}}, MessageCategory{1}, MessageType{1},
                           ReporterIDs{kReporter}, nullptr);
      }
      client.stopReportingSessionForID(kReporter, nullptr);
      isAnswered(10ms);
      client.abort();
    }
    endFaults();
  }

  void endUnderFaults() {
    ASSERT_NO_FATAL_FAILURE(startAndSend());
    beginFaults();
    const auto begin = SteadyClock::now();
    ::kill(service_->process().pid(), SIGTERM);
    EXPECT_TRUE(eventually([&] { return hasEnded(); }));
    EXPECT_LT(since(begin), 2s) << service_->read("log.txt");
    endFaults();
    const int status = service_->process().wait();
    if (status == -1) ++endsBySignal_;
    if (!GetParam().mayEndIt) {
      EXPECT_EQ(status, 0) << service_->read("log.txt");
    }
    start();
  }

  // A client that does everything right gets its messages into the store.
  void expectToBeServed() {
    // One that a fault ends may answer once more before it has ended.
    if (!(isAnswered(5s) && isAnswered(5s)) && hasEnded()) {
      const int status = service_->process().wait();
      ++(status == -1 ? endsBySignal_ : endsWithASentence_);
      if (!GetParam().mayEndIt || status != -1) {
        EXPECT_EQ(status, 1);
        EXPECT_THAT(service_->read("log.txt"),
                    ::testing::HasSubstr("ostrelreportingd: "));
      }
      start();
    }
    ASSERT_TRUE(isAnswered(5s)) << service_->read("log.txt");
    // The store tries again after a while.
    const bool isStored = eventually([&] {
      sendAndStop(service_->socketPath(), sent_);
      sent_ += kMessages;
      const std::string last = std::to_string(sent_ - 1);
      const auto begin = SteadyClock::now();
      while (since(begin) < 200ms) {
        const auto numbers = service_->rows(kNumbers);
        if (!numbers.empty() && numbers.back() == last) return true;
        std::this_thread::sleep_for(1ms);
      }
      return false;
    });
    ASSERT_TRUE(isStored) << service_->read("log.txt");
    ASSERT_EQ(service_->terminate(), 0) << service_->read("log.txt");
  }

  void expectSoundStore() {
    EXPECT_EQ(service_->rows("PRAGMA integrity_check"), ServiceUnderTest::Rows{"ok"});
    const auto numbers = service_->rows(kNumbers);
    ASSERT_GE(numbers.size(), static_cast<std::size_t>(stored_));
    for (int i = 0; i < stored_; ++i) {
      EXPECT_EQ(numbers[static_cast<std::size_t>(i)], std::to_string(i))
          << "lost, though it was durable";
    }
    EXPECT_EQ(service_->rows("SELECT count(*) - count(DISTINCT json_extract(payload, "
                             "'$.i')) FROM telemetry_messages WHERE category = 1"),
              ServiceUnderTest::Rows{"0"})
        << "twice";
    EXPECT_EQ(service_->rows(
                  "SELECT count(*) FROM telemetry_messages a JOIN telemetry_messages b "
                  "USING (telemetry_session_id, category) WHERE category = 1 AND "
                  "a.id < b.id AND json_extract(a.payload, '$.i') > "
                  "json_extract(b.payload, '$.i')"),
              ServiceUnderTest::Rows{"0"})
        << "not in the order of their session";
    for (const auto& entry : fs::directory_iterator(*service_ / "state")) {
      EXPECT_EQ(entry.path().string().find("damaged"), std::string::npos);
    }
  }

  static ServiceUnderTest* killed_;
  std::unique_ptr<ServiceUnderTest> service_;
  SharedFaults* faults_ = nullptr;
  std::int64_t endsWithASentence_ = 0;
  std::int64_t endsBySignal_ = 0;
  int stored_ = 0;  // Messages that are durable.
  int sent_ = 0;
};

ServiceUnderTest* FaultyService::killed_ = nullptr;

TEST_P(FaultyService, StartsOrSaysWhyNot) { runThrough(Phase::kStart); }

TEST_P(FaultyService, ServesOnceTheFaultIsOver) { runThrough(Phase::kServing); }

TEST_P(FaultyService, EndsInTime) { runThrough(Phase::kEnd); }

INSTANTIATE_TEST_SUITE_P(, FaultyService, ::testing::ValuesIn(kFailingCalls),
                         [](const auto& tested) { return tested.param.name; });

}  // namespace
}  // namespace ostrel::crash
