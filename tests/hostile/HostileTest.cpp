// The service among clients that misbehave: it goes on, serves whoever behaves, stays
// small, and keeps nothing of them.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <future>
#include <iostream>
#include <limits>

#include "ostrel/OstrelReportingClient.h"
#include "tests/hostile/Behaviours.h"
#include "tests/hostile/ProcessUsage.h"
#include "tests/integration/ServiceUnderTest.h"

namespace ostrel {
namespace {

using namespace std::chrono_literals;
using hostile::kMemoryIsBounded;
using hostile::kMostResidentKiB;
using hostile::numberIn;
using hostile::Usage;
using hostile::usageOf;
using std::chrono::steady_clock;
using testing::HasSubstr;
using testing::Not;
using testing_support::ChildProcess;

constexpr std::string_view kMakesStarts = "leaves-while-starting";

// Those of the pools are made when they are first needed and stay.
#ifdef OSTREL_THREAD_SANITIZED
constexpr std::size_t kMostThreads = 17;  // One is the sanitizer's.
#else
constexpr std::size_t kMostThreads = 16;
#endif

// Of a reply to a client that behaves, on a machine that is busy with other tests too.
constexpr auto kLongestReply = 10s;

/// How long everything at once goes on, and each behaviour alone.
double secondsAtOnce() { return numberIn("OSTREL_HOSTILE_SECONDS", 1); }
/// What 99 of 100 replies take at most beside all at once, in milliseconds; of an
/// optimised build on a machine with nothing else to do, as `scripts/longrun hostile`
/// runs it.
double mostMilliseconds() {
  return numberIn("OSTREL_HOSTILE_P99_MS", std::numeric_limits<double>::infinity());
}
double secondsAlone() { return numberIn("OSTREL_HOSTILE_SECONDS_ALONE", 0.1); }

/// A client that behaves: one request at a time, each answered before the next.
class GoodClient {
 public:
  struct Result {
    std::size_t replies = 0;
    std::size_t unanswered = 0;
    std::vector<double> milliseconds;  // Sorted.

    double quantile(double share) const {
      if (milliseconds.empty()) return 0;
      const double at = share * static_cast<double>(milliseconds.size());
      return milliseconds[std::min(static_cast<std::size_t>(at),
                                   milliseconds.size() - 1)];
    }
  };

  explicit GoodClient(const std::string& socketPath) : client_(optionsFor(socketPath)) {
    ask<bool>([&](auto reply) { client_.createReportingSession(kSession, reply); });
    thread_ = std::thread([this] { run(); });
  }
  ~GoodClient() {
    isDone_ = true;
    if (thread_.joinable()) thread_.join();
  }

  Result finish() {
    isDone_ = true;
    thread_.join();
    std::ranges::sort(result_.milliseconds);
    return result_;
  }

 private:
  // Nobody else's.
  static constexpr reporting::ReporterID kSession{0x600d'600d'600d};

  static reporting::Options optionsFor(const std::string& socketPath) {
    reporting::Options options;
    options.socketPath = socketPath;
    options.replyTimeout = 2min;
    return options;
  }

  template <typename T, typename Call>
  void ask(Call call) {
    // The service may have gone, and each wait is long.
    if (result_.unanswered != 0) return;
    const auto answered = std::make_shared<std::promise<bool>>();
    const auto begin = steady_clock::now();
    call([answered](const reporting::Reply<T>& reply) {
      answered->set_value(static_cast<bool>(reply));
    });
    const bool isReply = answered->get_future().get();
    const std::chrono::duration<double, std::milli> time = steady_clock::now() - begin;
    isReply ? ++result_.replies : ++result_.unanswered;
    result_.milliseconds.push_back(time.count());
  }

  void run() {
    while (!isDone_) {
      ask<bool>([&](auto reply) {
        client_.setServiceType(reporting::ServiceType{1}, kSession, reply);
      });
      client_.startReportingSessionForID(kSession);
      ask<void>([&](auto reply) {
        client_.sendMessage({{"route", "Speaker"}}, reporting::Category{1},
                            reporting::MessageType{2}, {{kSession}}, reply);
      });
      ask<reporting::ServiceType>(
          [&](auto reply) { client_.getServiceNameForReporterID(kSession, reply); });
      ask<bool>([&](auto reply) {
        client_.setConfiguration({{"a", 1}}, kSession, reply);
      });
      ask<reporting::ReporterValidity>(
          [&](auto reply) { client_.reporterIDValid(kSession, reply); });
      ask<bool>([&](auto reply) { client_.stopReportingSessionForID(kSession, reply); });
      std::this_thread::sleep_for(1ms);
    }
  }

  reporting::Client client_;
  std::atomic<bool> isDone_ = false;
  Result result_;  // The thread's until it ended.
  std::thread thread_;
};

std::ostream& operator<<(std::ostream& out, const GoodClient::Result& result) {
  return out << result.replies << " replies, p50 " << result.quantile(0.5) << " ms, p99 "
             << result.quantile(0.99) << " ms, longest " << result.quantile(1) << " ms";
}

/// A service that writes session logs, and what became of it.
class AttackedService : public ServiceUnderTest {
 public:
  enum class Build { kInternal, kReleased };

  explicit AttackedService(Build build = Build::kInternal) {
    if (build == Build::kInternal) {
      write("machine-info", "CHASSIS=handset\nDEPLOYMENT=development\n");
    }
    write("logs/victim", "");
    std::filesystem::create_directories(*this / "logs/Audio/Reporting");
    write("logs/Audio/victim", "untouched");
    startAndUse();
  }

  /// Ready, with the threads that usual work takes.
  void startAndUse() {
    start();
    GoodClient client(socketPath());
    std::this_thread::sleep_for(100ms);
    EXPECT_EQ(client.finish().unanswered, 0u);
    EXPECT_EQ(attack("mixed-operations", 0.2).wait(), 0);
    EXPECT_TRUE(
        eventually([&] { return rows("SELECT id FROM telemetry_messages").size() > 0; }));
    atFirst_ = usage();
  }

  Usage usage() { return usageOf(process().pid()); }

  /// The peak begins anew where the system allows it; else it is that of all before.
  void forgetPeak() {
    std::ofstream("/proc/" + std::to_string(process().pid()) + "/clear_refs") << "5";
  }

  ChildProcess attack(const std::string& name, double seconds) {
    // The processor is nothing that the service can share out.
    return ChildProcess(
        {"nice", "-n", "19", programBeside("hostile_client"), name, "--socket",
         socketPath(), "--logs", *this / "logs/Audio/Reporting", "--seconds",
         std::to_string(seconds)},
        *this / "attack.txt");
  }

  bool isAlive() { return ::kill(process().pid(), /*sig=*/0) == 0 && !hasEnded(); }

  /// Alive, with the descriptors that it had and the threads that it may have.
  void expectItIsAsItWas() {
    ASSERT_TRUE(isAlive()) << read("log.txt").substr(0, 20'000);
    // A client that has alarms waiting is let go when they are gone, after a minute.
    // What is still under way opens and closes files meanwhile.
    const auto end = steady_clock::now() + 2min;
    std::size_t descriptors = 0;
    do {
      std::this_thread::sleep_for(5ms);
      descriptors = usage().descriptors;
    } while (descriptors > atFirst_.descriptors && steady_clock::now() < end);
    EXPECT_LE(descriptors, atFirst_.descriptors);
    EXPECT_LE(usage().threads, kMostThreads);
  }

  /// No sanitizer's word, and no line that only a client can have written.
  void expectAnHonestLog() {
    std::ifstream log(*this / "log.txt", std::ios::binary);
    for (std::string line; std::getline(log, line);) {
      const bool isOurs = line.size() > 3 && line[0] == '<' && line[1] >= '0' &&
                          line[1] <= '7' && line[2] == '>';
      const bool isPlain = std::ranges::none_of(line, [](char c) {
        return static_cast<unsigned char>(c) < ' ' || c == '\x7f';
      });
      if (isOurs && isPlain) continue;
      ADD_FAILURE() << "an odd line in the log: " << line.substr(0, 1000);
      return;
    }
  }

 private:
  bool hasEnded() const {
    std::ifstream stat(
        "/proc/" + std::to_string(const_cast<AttackedService*>(this)->process().pid()) +
        "/stat");
    std::string pid, name, state;
    stat >> pid >> name >> state;
    return state.empty() || state == "Z";
  }

  Usage atFirst_;
};

/// One after the other, on one service.
class HostileBehaviour : public testing::TestWithParam<hostile::Behaviour> {
 protected:
  static void SetUpTestSuite() { service_ = std::make_unique<AttackedService>(); }
  static void TearDownTestSuite() {
    service_->expectAnHonestLog();
    service_.reset();
  }
  void SetUp() override {
    if (!service_->isAlive()) service_->startAndUse();
    service_->forgetPeak();
  }

  void TearDown() override {
    // What it left behind is not the next one's.
    if (GetParam().name == kMakesStarts) service_ = std::make_unique<AttackedService>();
  }

  static inline std::unique_ptr<AttackedService> service_;
};

TEST_P(HostileBehaviour, AloneHarmsNobody) {
  GoodClient good(service_->socketPath());
  const int status =
      service_->attack(std::string(GetParam().name), secondsAlone()).wait();
  const GoodClient::Result result = good.finish();

  EXPECT_EQ(status, 0) << service_->read("attack.txt");
  EXPECT_EQ(result.unanswered, 0u);
  EXPECT_GT(result.replies, 0u);
  EXPECT_LT(result.quantile(1), std::chrono::milliseconds(kLongestReply).count())
      << result;
  service_->expectItIsAsItWas();
  std::cout << result << "; peak of resident memory "
            << service_->usage().peakResidentKiB / 1024 << " MiB\n";
  if (kMemoryIsBounded) {
    EXPECT_LT(service_->usage().peakResidentKiB, kMostResidentKiB);
  }
}

std::vector<hostile::Behaviour> thoseThatDoNotEndTheService() {
  std::vector<hostile::Behaviour> found;
  for (const hostile::Behaviour& each : hostile::behaviours()) {
    if (!each.endsTheService) found.push_back(each);
  }
  return found;
}

std::string nameOf(const testing::TestParamInfo<hostile::Behaviour>& info) {
  std::string name(info.param.name);
  std::ranges::replace(name, '-', '_');
  return name;
}

INSTANTIATE_TEST_SUITE_P(Each, HostileBehaviour,
                         testing::ValuesIn(thoseThatDoNotEndTheService()), nameOf);

TEST(HostileBehaviours, AllAtOnceHarmNobody) {
  AttackedService service(AttackedService::Build::kReleased);
  GoodClient good(service.socketPath());
  const int status = service.attack("all", secondsAtOnce()).wait();
  const GoodClient::Result result = good.finish();

  std::cout << "beside all at once: " << result << "; peak of resident memory "
            << service.usage().peakResidentKiB / 1024 << " MiB\n";
  EXPECT_EQ(status, 0) << service.read("attack.txt");
  EXPECT_EQ(result.unanswered, 0u);
  EXPECT_GT(result.replies, 0u);
  EXPECT_LT(result.quantile(0.99), mostMilliseconds());
  EXPECT_LT(result.quantile(1), std::chrono::milliseconds(kLongestReply).count());
  service.expectItIsAsItWas();
  if (kMemoryIsBounded) {
    EXPECT_LT(service.usage().peakResidentKiB, kMostResidentKiB);
  }
  service.expectAnHonestLog();
  EXPECT_EQ(service.terminate(), 0);
}

TEST(HostileBehaviours, PlantedLinksAndPipesAreNeverFollowed) {
  AttackedService service;
  EXPECT_EQ(service.attack("planted-logs", 2.5).wait(), 0);
  EXPECT_EQ(service.terminate(), 0);

  EXPECT_EQ(service.read("logs/Audio/victim"), "untouched");
  // A log of a session stands where the links and pipes were, and only there.
  std::size_t logs = 0;
  for (const auto& entry :
       std::filesystem::recursive_directory_iterator(service / "logs")) {
    const std::string path = entry.path();
    if (path.ends_with("victim") || entry.is_directory()) continue;
    EXPECT_THAT(path, HasSubstr("/logs/Audio/Reporting/"));
    if (entry.is_regular_file() && !entry.is_symlink()) ++logs;
  }
  EXPECT_GT(logs, 0u);
  EXPECT_FALSE(std::filesystem::exists("/tmp/escaped"));
  EXPECT_THAT(service.read("log.txt"), HasSubstr("jsonOutput writeToURL"));
  service.expectAnHonestLog();
}

TEST(HostileBehaviours, OneThatKillsTheServiceFindsItBackEachTime) {
  constexpr int kKills = 5;
  AttackedService service;
  ChildProcess killer = service.attack("kill", 60);
  for (int i = 0; i < kKills; ++i) {
    EXPECT_EQ(service.process().wait(), 2);
    service.start();
  }
  RecordingClient client(service.socketPath());
  service.kill();
}

TEST(HostileBehaviours, ThoseThatStayDoNotHoldTheEndUp) {
  AttackedService service;
  ChildProcess stayer = service.attack("stays", 60);
  const auto started = [&] {
    return service.rows("SELECT id FROM telemetry_messages").size() > 1000;
  };
  ASSERT_TRUE(eventually(started));
  const auto begin = steady_clock::now();
  EXPECT_EQ(service.terminate(), 0);
  EXPECT_LT(steady_clock::now() - begin, 10s);
  service.expectAnHonestLog();
}

}  // namespace
}  // namespace ostrel
