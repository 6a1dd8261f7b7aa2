// A client of many threads whose service is ended and started again under it, as often as
// OSTREL_RESTARTS says: no request stays open, none gets another's reply, and nothing of
// a connection that was lost stays.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <iterator>
#include <map>
#include <memory>
#include <mutex>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "ostrel/OstrelReportingClient.h"
#include "tests/integration/ServiceUnderTest.h"

namespace ostrel::reporting {
namespace {

using namespace std::chrono_literals;
using std::chrono::steady_clock;
using testing::HasSubstr;
using testing::Not;

constexpr int kThreads = 64;
constexpr ReporterID kKept{7};  // No thread's.

#ifdef OSTREL_SANITIZED
constexpr int kUsualRestarts = 5;
#else
constexpr int kUsualRestarts = 20;
#endif

// From the end of the service until all its requests have ended.
constexpr auto kLongest = 1s;

std::size_t entriesOf(const char* directory) {
  return static_cast<std::size_t>(
      std::distance(std::filesystem::directory_iterator(directory), {}));
}

/// What this process has, which is to be the same in the end.
struct Holdings {
  std::size_t descriptors = entriesOf("/proc/self/fd");
  std::size_t threads = entriesOf("/proc/self/task");
};

/// Counts a signal that would end a program that does not expect it.
class BrokenPipes {
 public:
  BrokenPipes() {
    count_ = 0;
    struct sigaction action {};
    action.sa_handler = [](int) { ++count_; };
    ::sigaction(SIGPIPE, &action, &before_);
  }
  ~BrokenPipes() { ::sigaction(SIGPIPE, &before_, /*oact=*/nullptr); }

  int count() const { return count_; }

 private:
  static inline std::atomic<int> count_ = 0;
  struct sigaction before_ {};
};

/// When the service was told to end, and when it was gone.
struct End {
  steady_clock::time_point begin;
  steady_clock::time_point gone;
};

/// One request, from the call to its end.
struct Call {
  steady_clock::time_point asked;
  steady_clock::time_point ended{};
  Status status{};
  int ends = 0;

  /// How long after the service was gone it ended, if that is why.
  steady_clock::duration lateness(const std::vector<End>& all) const {
    auto why = std::ranges::upper_bound(all, asked, {}, &End::begin);
    if (why == all.end() || why->begin > ended) {
      // That had begun already, and the client did not know.
      if (why == all.begin()) return steady_clock::duration::max();
      --why;
    }
    return std::max(ended - why->gone, steady_clock::duration::zero());
  }
};

/// Calls in a row, and how they ended.
class Calls : public std::enable_shared_from_this<Calls> {
 public:
  /// What to hand to the next call. It waits for ever; `check` sees what is replied.
  template <typename T, typename Check>
  OnReply<T> next(Check check) {
    return {[self = shared_from_this(), index = begin(), check](const Reply<T>& reply) {
              if (reply) check(reply.value);
              self->end(index, reply.status);
            },
            /*toWait=*/0ms};
  }
  template <typename T>
  OnReply<T> next() {
    return {[self = shared_from_this(), index = begin()](const Reply<T>& reply) {
              self->end(index, reply.status);
            },
            /*toWait=*/0ms};
  }

  /// All, once each has ended or it takes too long.
  std::vector<Call> wait() {
    std::unique_lock lock(mutex_);
    changed_.wait_for(lock, 60s, [&] { return open_ == 0; });
    return calls_;
  }

 private:
  std::size_t begin() {
    const std::lock_guard lock(mutex_);
    ++open_;
    calls_.push_back({steady_clock::now()});
    return calls_.size() - 1;
  }
  void end(std::size_t index, Status status) {
    const std::lock_guard lock(mutex_);
    Call& call = calls_[index];
    if (++call.ends > 1) return;
    call.ended = steady_clock::now();
    call.status = status;
    if (--open_ == 0) changed_.notify_all();
  }

  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<Call> calls_;
  std::size_t open_ = 0;
};

/// What became of all calls, and of their sessions.
struct Figures {
  std::atomic<std::uint64_t> replied = 0;
  std::atomic<std::uint64_t> wrong = 0;   // That can only be the reply of another call.
  std::atomic<std::uint64_t> found = 0;   // Sessions, by who made them just before.
  std::atomic<std::uint64_t> undead = 0;  // Sessions of a lost connection.
};

/// One thread: makes a session, starts it, sends to it, asks for it and drops it, all
/// without a wait; and then again with another.
class Worker {
 public:
  Worker(Client& client, int number, Figures& figures)
      : client_(client),
        type_{static_cast<std::uint16_t>(100 + number)},
        next_((std::int64_t{1} + number) << 32),
        figures_(figures),
        thread_([this] { run(); }) {}
  ~Worker() { finish(); }

  void finish() {
    isDone_ = true;
    if (thread_.joinable()) thread_.join();
  }

  /// Those that are answered when their session ends: some are only when the connection
  /// does.
  Calls& starts() { return *starts_; }
  /// Of all others, after `finish`: how many there were, and those that did not end with
  /// one reply.
  std::size_t count() const { return count_; }
  const std::vector<Call>& unanswered() const { return unanswered_; }

 private:
  void run() {
    for (bool isLost = false; !isDone_;) {
      const auto round = std::make_shared<Calls>();
      const ReporterID before{next_};
      if (!isLost) client_.destroyReportingSession(before, expectTrue(*round));
      // Dropped, or gone with its connection: nobody has made it anew.
      client_.reporterIDValid(before, round->next<ReporterValidity>([this](auto& it) {
        ++(it.reporterID == ReporterID{} ? figures_.replied : figures_.undead);
      }));
      askAll(*round, ReporterID{++next_});
      const std::vector<Call> calls = round->wait();
      // Then the session is lost too: it was asked for before.
      isLost = calls.back().status == Status::kConnectionLost;
      for (const Call& call : calls) {
        ++count_;
        if (call.ends != 1 || call.status != Status::kReplied)
          unanswered_.push_back(call);
      }
    }
  }
  void askAll(Calls& round, ReporterID session) {
    client_.createReportingSession(session, expectTrue(round));
    client_.setServiceType(type_, session, expectTrue(round));
    client_.startReportingSessionForID(session, starts_->next<bool>());
    client_.sendMessage({{"n", next_}}, Category{1}, MessageType{1}, {{session}},
                        round.next<void>());
    // It is not there where its connection was lost in between.
    client_.reporterIDValid(
        session, round.next<ReporterValidity>([this, session](auto& it) {
          ++figures_.replied;
          if (it.reporterID == session) ++figures_.found;
          if (it.reporterID != session && it.reporterID != ReporterID{}) ++figures_.wrong;
        }));
    client_.getServiceNameForReporterID(
        session, round.next<ServiceType>([this](ServiceType type) {
          ++figures_.replied;
          const bool isSome = type == type_ || type == kServiceTypeUnknown;
          if (!isSome && type != ServiceType{}) ++figures_.wrong;
        }));
  }
  OnReply<bool> expectTrue(Calls& calls) {
    return calls.next<bool>(
        [this](bool value) { ++(value ? figures_.replied : figures_.wrong); });
  }

  Client& client_;
  const ServiceType type_;
  std::int64_t next_;
  Figures& figures_;
  const std::shared_ptr<Calls> starts_ = std::make_shared<Calls>();
  std::size_t count_ = 0;
  std::vector<Call> unanswered_;
  std::atomic<bool> isDone_ = false;
  std::thread thread_;
};

/// A client that has its session made anew, and asks for it all the time.
class Keeper {
 public:
  explicit Keeper(const std::string& socketPath) : client_(optionsFor(socketPath)) {
    client_.createReportingSession(kKept);
    thread_ = std::thread([this] {
      while (!isDone_) {
        const auto call = std::make_shared<Calls>();
        client_.reporterIDValid(kKept, call->next<ReporterValidity>([this](auto& it) {
          ++(it.reporterID == kKept ? found_ : missed_);
        }));
        call->wait();
        std::this_thread::sleep_for(1ms);
      }
    });
  }
  ~Keeper() { finish(); }

  void finish() {
    isDone_ = true;
    if (thread_.joinable()) thread_.join();
  }

  std::uint64_t found() const { return found_; }
  std::uint64_t missed() const { return missed_; }

 private:
  static Options optionsFor(const std::string& socketPath) {
    Options options;
    options.socketPath = socketPath;
    options.restoreSessions = true;
    return options;
  }

  Client client_;
  std::atomic<std::uint64_t> found_ = 0;
  std::atomic<std::uint64_t> missed_ = 0;
  std::atomic<bool> isDone_ = false;
  std::thread thread_;
};

/// What a client says of the service that it lost.
class Losses {
 public:
  void add(const std::string& reason) {
    const std::lock_guard lock(mutex_);
    ++reasons_[reason];
  }
  std::map<std::string, int> reasons() const {
    const std::lock_guard lock(mutex_);
    return reasons_;
  }

 private:
  mutable std::mutex mutex_;
  std::map<std::string, int> reasons_;
};

class RestartedService : public testing::Test {
 protected:
  Options options() {
    Options options;
    options.socketPath = service.socketPath();
    options.onConnection = [this](bool isConnected, const std::string& reason) {
      if (!isConnected) losses.add(reason);
    };
    return options;
  }

  /// Starts the service and waits until all are at work with it.
  void start(const Keeper& keeper) {
    // One for each thread, and one of the keeper, may be of the service before.
    const std::uint64_t found = figures.found + 2 * kThreads;
    const std::uint64_t kept = keeper.found() + 2;
    service.start({programBeside("ostrelreportingd")}, {"OSTREL_LOG_LEVEL=error"});
    ASSERT_TRUE(eventually([&] {
      return figures.found >= found && keeper.found() >= kept;
    })) << service.read("log.txt").substr(0, 10'000);
  }

  /// In turn by a signal that leaves the service no time, by one that does, and by a
  /// client.
  void end(int turn) {
    const auto begin = steady_clock::now();
    switch (turn % 3) {
      case 0:
        service.kill();
        break;
      case 1:
        EXPECT_EQ(service.terminate(), 0);
        break;
      default:
        Client client(options());
        client.killService();
        EXPECT_EQ(service.process().wait(), 2);
    }
    ends.push_back({begin, steady_clock::now()});
  }

  /// Starts and ends it, and ends it a last time when nobody asks for more.
  void restart(int restarts) {
    std::mt19937 random(20260131);
    Client client(options());
    Keeper keeper(service.socketPath());
    std::vector<std::unique_ptr<Worker>> workers;
    for (int i = 0; i < kThreads; ++i) {
      workers.push_back(std::make_unique<Worker>(client, i, figures));
    }
    for (int turn = 0; turn <= restarts; ++turn) {
      start(keeper);
      ASSERT_FALSE(HasFailure()) << "after " << turn << " restarts";
      std::this_thread::sleep_for(std::chrono::microseconds(random() % 20'000));
      if (turn < restarts) end(turn);
    }
    keeper.finish();
    for (const auto& worker : workers) worker->finish();
    end(/*turn=*/0);
    for (const auto& worker : workers) {
      calls += worker->count();
      for (const Call& call : worker->unanswered()) expectLoss(call);
      for (const Call& call : worker->starts().wait()) {
        ++calls;
        if (call.ends == 0 || call.status != Status::kReplied) expectLoss(call);
      }
    }
    EXPECT_EQ(keeper.missed(), 0u);
    EXPECT_EQ(client.counts().timedOutRequests, 0u);
    EXPECT_GT(client.counts().connections, static_cast<std::uint64_t>(restarts));
  }

  void expectLoss(const Call& call) {
    ASSERT_EQ(call.ends, 1);
    ASSERT_EQ(call.status, Status::kConnectionLost);
    ++lostCalls;
    slowest = std::max(slowest, call.lateness(ends));
  }

  ServiceUnderTest service;
  Losses losses;
  Figures figures;
  std::vector<End> ends;
  std::uint64_t calls = 0;
  std::uint64_t lostCalls = 0;
  steady_clock::duration slowest{0};
};

TEST_F(RestartedService, LeavesItsClientsThreadsNoCallOpenAndNothingBehind) {
  const char* const told = std::getenv("OSTREL_RESTARTS");
  const int restarts = told != nullptr ? std::atoi(told) : kUsualRestarts;
  const BrokenPipes brokenPipes;
  // A sanitizer has one of its own from the first thread on.
  std::thread([] {}).join();
  const Holdings before;

  restart(restarts);

  const Holdings after;
  std::printf(
      "%d restarts, %llu calls; %llu ended with an error, %.1f ms after the service was "
      "gone at the latest\n",
      restarts, static_cast<unsigned long long>(calls),
      static_cast<unsigned long long>(lostCalls),
      std::chrono::duration<double, std::milli>(slowest).count());
  EXPECT_GT(lostCalls, static_cast<std::uint64_t>(restarts));
  EXPECT_LT(slowest, kLongest);
  EXPECT_EQ(figures.wrong, 0u);
  EXPECT_EQ(figures.undead, 0u) << "sessions that nobody made anew";
  EXPECT_EQ(after.descriptors, before.descriptors);
  EXPECT_EQ(after.threads, before.threads);
  EXPECT_EQ(brokenPipes.count(), 0);
  for (const auto& [reason, times] : losses.reasons()) {
    EXPECT_THAT(reason, Not(HasSubstr("the service sent"))) << times << " times";
  }
}

}  // namespace
}  // namespace ostrel::reporting
