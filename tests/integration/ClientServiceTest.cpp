// The client library against the real service, which is stopped, killed and started
// again under it.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <ctime>
#include <filesystem>
#include <mutex>
#include <thread>

#include "ostrel/OstrelReportingClient.h"
#include "platform/linux/ChildProcess.h"
#include "platform/linux/TestSupport.h"

namespace ostrel::reporting {
namespace {

using namespace std::chrono_literals;
using testing::ElementsAre;
using testing_support::ChildProcess;
using testing_support::TemporaryDirectory;

constexpr ReporterID kSession{7};
constexpr auto kSoon = 20s;

/// How requests ended, in order.
class Answers {
 public:
  template <typename T>
  auto expect(std::string name) {
    return [this, name = std::move(name)](const Reply<T>& reply) {
      std::string text = name + " " + std::to_string(static_cast<int>(reply.status));
      if constexpr (std::is_same_v<T, bool>) text += reply.value ? " true" : " false";
      if constexpr (std::is_same_v<T, ServiceType>) {
        text += " " + std::to_string(static_cast<int>(reply.value));
      }
      const std::lock_guard lock(mutex_);
      texts_.push_back(std::move(text));
      changed_.notify_all();
    };
  }
  std::vector<std::string> wait(std::size_t count) {
    std::unique_lock lock(mutex_);
    changed_.wait_for(lock, kSoon, [&] { return texts_.size() >= count; });
    return texts_;
  }
  /// The last one then; empty when there is none.
  std::string waitForLast(std::size_t count) {
    const auto texts = wait(count);
    return texts.empty() ? "" : texts.back();
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<std::string> texts_;
};

class ClientOfTheService : public testing::Test {
 protected:
  void startService() {
    const std::string program =
        std::filesystem::read_symlink("/proc/self/exe").parent_path() /
        "ostrelreportingd";
    service = std::make_unique<ChildProcess>(
        std::vector<std::string>{program}, directory / "log.txt",
        std::vector<std::string>{"RUNTIME_DIRECTORY=" + directory / "run",
                                 "STATE_DIRECTORY=" + directory / "state",
                                 "LOGS_DIRECTORY=" + directory / "logs"});
  }
  /// Asks, each time once the answer before has come, until `answer` comes. What is asked
  /// while the loss of a service is not noticed yet may be lost with it.
  template <typename Ask>
  void askUntil(const std::string& answer, const Ask& ask) {
    std::size_t answered = answers.wait(0).size();
    EXPECT_TRUE(testing_support::eventually([&] {
      ask();
      return answers.waitForLast(++answered) == answer;
    })) << answers.waitForLast(0);
  }
  /// Without a word to anybody.
  void killService() { service.reset(); }

  Options options() const {
    Options options;
    options.socketPath = directory / "run/reporting.sock";
    return options;
  }

  TemporaryDirectory directory;
  std::unique_ptr<ChildProcess> service;
  Answers answers;
};

TEST_F(ClientOfTheService, IsAnsweredByEveryOperation) {
  startService();
  Client client(options());

  client.createReportingSession(kSession, answers.expect<bool>("create"));
  client.setServiceType(ServiceType{2}, kSession, answers.expect<bool>("type"));
  client.setConfiguration({{"a", 1}}, kSession, answers.expect<bool>("configure"));
  client.getAllReporters(answers.expect<ReporterIDs>("reporters"));
  client.reporterIDValid(kSession, answers.expect<ReporterValidity>("valid"));
  client.sendMessage({{"a", 1}}, Category{1}, MessageType{1}, {{kSession}},
                     answers.expect<void>("send"));
  client.stopReportingSessionForID(kSession, answers.expect<bool>("stop"));
  client.destroyReportingSession(kSession, answers.expect<bool>("destroy"));

  EXPECT_THAT(answers.wait(8), ElementsAre("create 0 true", "type 0 true",
                                           "configure 0 true", "reporters 0", "valid 0",
                                           "send 0", "stop 0 true", "destroy 0 true"));
}

TEST_F(ClientOfTheService, IsAnsweredAStartAtEachStopOfTheSession) {
  startService();
  Client client(options());
  client.createReportingSession(kSession);
  client.startReportingSessionForID(kSession, answers.expect<bool>("start"));
  client.sendMessage({{"a", 1}}, Category{1}, MessageType{1}, {{kSession}});

  client.stopReportingSessionForID(kSession);

  EXPECT_THAT(answers.wait(1), ElementsAre("start 0 true"));
}

TEST_F(ClientOfTheService, IsAnsweredTwiceForIDZero) {
  startService();
  Client client(options());

  client.getServiceNameForReporterID(ReporterID{0}, answers.expect<ServiceType>("type"));

  EXPECT_THAT(answers.wait(2), ElementsAre("type 0 65535", "type 0 65535"));
}

TEST_F(ClientOfTheService, EndsARequestThatIsNeverAnsweredAtItsDeadline) {
  startService();
  Client client(options());

  client.stopReportingSessionForID(ReporterID{0}, {answers.expect<bool>("stop"), 100ms});

  EXPECT_THAT(answers.wait(1), ElementsAre("stop 2 false"));
  EXPECT_EQ(client.counts().timedOutRequests, 1u);
}

TEST_F(ClientOfTheService, EndsOpenRequestsWithinASecondOfALoss) {
  startService();
  Client client(options());
  client.createReportingSession(kSession, answers.expect<bool>("create"));
  ASSERT_THAT(answers.wait(1), ElementsAre("create 0 true"));
  client.startReportingSessionForID(kSession, {answers.expect<bool>("start"), 0ms});
  client.flush(kSoon);

  const auto killed = std::chrono::steady_clock::now();
  killService();

  EXPECT_EQ(answers.wait(2).back(), "start 3 false");
  EXPECT_LT(std::chrono::steady_clock::now() - killed, 1s);
}

TEST_F(ClientOfTheService, ReachesItAgainAfterAKill) {
  startService();
  Client client(options());
  client.createReportingSession(kSession, answers.expect<bool>("create"));
  answers.wait(1);
  killService();
  startService();

  askUntil("again 0 true", [&] {
    client.createReportingSession(kSession, answers.expect<bool>("again"));
  });
  // A dying service may still have a socket to connect to for a moment.
  EXPECT_GE(client.counts().connections, 2u);
}

TEST_F(ClientOfTheService, MakesItsSessionsAnewWhenAskedTo) {
  startService();
  Options restoring = options();
  restoring.restoreSessions = true;
  Client client(restoring);
  client.createReportingSession(kSession);
  client.setServiceType(ServiceType{3}, kSession, answers.expect<bool>("type"));
  answers.wait(1);
  killService();
  startService();

  // The type is set on the session's own queue, a moment after the session is there.
  askUntil("type 0 3", [&] {
    client.getServiceNameForReporterID(kSession, answers.expect<ServiceType>("type"));
  });
}

TEST_F(ClientOfTheService, QueuesWhatIsAskedBeforeItIsThere) {
  Client client(options());
  client.createReportingSession(kSession, answers.expect<bool>("create"));

  startService();

  EXPECT_THAT(answers.wait(1), ElementsAre("create 0 true"));
}

TEST_F(ClientOfTheService, DropsAndCountsWhatItsQueueCannotHold) {
  Options small = options();
  small.queueBytes = 10'000;
  small.closeTimeout = 0ms;
  Client client(small);
  const Message message{{"text", std::string(1000, 'x')}};

  int queued = 0;
  for (int i = 0; i < 100; ++i) {
    const Submission sent =
        client.sendMessage(message, Category{1}, MessageType{1}, std::nullopt);
    if (sent == Submission::kQueued) ++queued;
  }

  EXPECT_GE(queued, 8);
  EXPECT_LE(queued, 10);
  EXPECT_EQ(client.counts().droppedRequests, static_cast<std::uint64_t>(100 - queued));
}

TEST_F(ClientOfTheService, ServesManyThreadsAtOnce) {
  startService();
  Client client(options());
  client.createReportingSession(kSession);
  constexpr int kThreads = 64;
  constexpr int kMessages = 100;
  std::atomic<int> answered{0};

  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([&] {
      for (int j = 0; j < kMessages; ++j) {
        client.sendMessage({{"a", j}}, Category{1}, MessageType{1}, {{kSession}},
                           [&](const Reply<void>& reply) {
                             if (reply) ++answered;
                           });
      }
    });
  }
  for (std::thread& thread : threads) thread.join();

  testing_support::eventually([&] { return answered == kThreads * kMessages; });
  EXPECT_EQ(answered, kThreads * kMessages);
  EXPECT_EQ(client.counts().droppedRequests, 0u);
}

// It once went on looking for audio threads without a pause.
TEST_F(ClientOfTheService, IsAsleepAfterAFlush) {
  startService();
  Client client(options());
  client.createReportingSession(kSession, answers.expect<bool>("create"));
  ASSERT_TRUE(client.flush(kSoon));
  answers.wait(1);
  const std::clock_t before = std::clock();
  std::this_thread::sleep_for(500ms);
  EXPECT_LT(std::clock() - before, CLOCKS_PER_SEC / 10) << "of processor time";
}

TEST_F(ClientOfTheService, HandsOverEveryMessageOfAnAudioThread) {
  startService();
  Client client(options());
  client.createReportingSession(kSession);
  client.startReportingSessionForID(kSession);
  AudioSender sender = client.makeAudioSender(/*ringBytes=*/1 << 20, 1ms);
  PreparedMessage message(Message{{"n", 0}}, Category{1}, MessageType{1},
                          ReporterIDs{kSession});
  const auto number = message.field("n");

  constexpr int kMessages = 5000;
  for (int i = 0; i < kMessages; ++i) {
    message.set(number, i);
    ASSERT_TRUE(sender.send(message));
  }
  ASSERT_TRUE(client.flush(kSoon));
  client.stopReportingSessionForID(kSession, answers.expect<bool>("stop"));
  ASSERT_THAT(answers.wait(1), ElementsAre("stop 0 true"));
  client.close();
  ASSERT_EQ(::kill(service->pid(), SIGTERM), 0);
  ASSERT_EQ(service->wait(), 0);

  const std::string ctl =
      std::filesystem::read_symlink("/proc/self/exe").parent_path() / "ostrelctl";
  ChildProcess query({ctl, "query", "--json",
                      "SELECT count(DISTINCT json_extract(payload,'$.n')) AS n FROM "
                      "telemetry_messages WHERE category = 1"},
                     directory / "query.txt", {"STATE_DIRECTORY=" + directory / "state"});
  ASSERT_EQ(query.wait(), 0);
  std::ifstream file(directory / "query.txt");
  std::string text((std::istreambuf_iterator<char>(file)), {});
  EXPECT_THAT(text, testing::HasSubstr("5000"));
}

TEST_F(ClientOfTheService, IsLeftAloneByAForkedChild) {
  startService();
  Client client(options());
  client.createReportingSession(kSession, answers.expect<bool>("create"));
  answers.wait(1);

  const pid_t child = ::fork();
  if (child == 0) {
    const bool isRefused =
        client.createReportingSession(ReporterID{8}) == Submission::kClosed;
    ::_exit(isRefused ? 0 : 1);
  }
  int status = 0;
  ::waitpid(child, &status, 0);
  client.getAllReporters(answers.expect<ReporterIDs>("reporters"));

  EXPECT_EQ(WEXITSTATUS(status), 0);
  EXPECT_EQ(answers.wait(2).back(), "reporters 0");
}

TEST_F(ClientOfTheService, EndsTheServiceWithStatus2) {
  startService();
  Client client(options());
  client.createReportingSession(kSession, answers.expect<bool>("create"));
  answers.wait(1);

  client.killService();

  EXPECT_EQ(service->wait(), 2);
}

TEST_F(ClientOfTheService, ClosesSoonWithoutAService) {
  const auto begin = std::chrono::steady_clock::now();
  {
    Client client(options());
    client.createReportingSession(kSession, answers.expect<bool>("create"));
  }

  EXPECT_THAT(answers.wait(1), ElementsAre("create 4 false"));
  EXPECT_LT(std::chrono::steady_clock::now() - begin, 3s);
}

}  // namespace
}  // namespace ostrel::reporting
