#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/ErrorObject.h"
#include "platform/linux/Limits.h"
#include "platform/linux/store/StoreCounters.h"
#include "platform/linux/store/StoreOperation.h"
#include "platform/linux/store/StoreWriter.h"

namespace ostrel {

struct StoreOptions {
  /// The longest that an accepted message waits for others to share its commit.
  /// 100 ms keep the promise of 250 ms with room for a slow disk, and mean 10
  /// commits a second at most under a load that needs no more.
  std::chrono::milliseconds commitWindow{100};

  /// A flush makes durable at once, so many times; then the next does so after this
  /// pause each, and those between wait together, never past the commit window. Keeps
  /// a client that stops sessions all the time from wearing out the flash.
  int flushBurst = 20;
  std::chrono::milliseconds flushPause{100};

  /// Memory of what waits for the writer, and analytics events that wait. More is
  /// refused or dropped.
  std::size_t queuedBytes = limits::kStoreQueuedBytes;
  std::size_t queuedEvents = limits::kStoreQueuedEvents;

  StoreRetention retention;

  /// Pauses between attempts during a fault.
  std::chrono::milliseconds firstRetry{100};
  std::chrono::milliseconds longestRetry{5000};

  /// What others count, for `service_status`.
  StatusCounts otherCounts;

  /// Microseconds since 1970; empty: the system's clock.
  std::function<std::int64_t()> now;

  /// The layer below SQLite; none: the system's.
  const char* vfs = nullptr;
};

/// The embedded store: one SQLite file and the thread that writes it. Callers of
/// any thread only append to a queue in memory. The thread gathers what comes
/// within the commit window, or as much as makes a large batch, into one
/// transaction. It sleeps when there is nothing to do.
///
/// A file that cannot be used is tried again and again; meanwhile messages are
/// refused, and what was accepted before is kept.
class Store {
 public:
  /// Gets true when the store can be used.
  using Answer = std::function<void(bool isUsable)>;

  /// Never fails: the file is opened on the writer's thread.
  static std::shared_ptr<Store> open(std::string path);
  static std::shared_ptr<Store> open(std::string path, StoreOptions options);

  /// Shuts down, however long it takes.
  ~Store();
  Store(const Store&) = delete;
  Store& operator=(const Store&) = delete;

  /// Refuses everything from now on, makes durable what was accepted and closes
  /// the file. False, with an error logged, when the deadline came first.
  bool shutdown(std::chrono::steady_clock::time_point deadline);

  /// Queues a message or the steps of a session. An error when it is refused.
  std::optional<ErrorObject> addMessage(StoreSession* session, std::uint16_t category,
                                        std::uint16_t type, const Dictionary& payload);
  std::optional<ErrorObject> addLoneMessage(LoneMessage message);
  StoreSession* beginSession(const Dictionary& sessionInfo, const Dictionary& userInfo);
  /// The session's last call; it is gone afterwards.
  void endSession(StoreSession* session);

  /// Calls `completion` once on the writer's thread when all that was queued is
  /// durable, or with the error that prevents it.
  void flush(StoreSession* session, TelemetrySession::FlushCallback completion);

  /// Queue an event, or drop and count it.
  void addAnalyticsEvent(std::string name, AnalyticsSink::PayloadProvider provider);
  void addPowerEvent(PowerEvent event);

  /// Others' counts have changed: they are written with the next commit, for which
  /// this is a reason.
  void noteStatusChange();

  /// Calls `answer` once: at once when it is known whether the store can be used,
  /// else on the writer's thread as soon as it is.
  void whenKnown(Answer answer);

  const StoreCounters& counters() const { return counters_; }

 private:
  enum class State { kOpening, kUsable, kFaulty, kStopped };
  using Clock = std::chrono::steady_clock;

  Store(std::string path, StoreOptions options);

  bool takesReports() const;
  std::optional<ErrorObject> pushMessage(StoreOperation operation);
  void pushEvent(StoreOperation operation, std::atomic<std::uint64_t>& dropped);
  bool push(StoreOperation operation);
  void wakeWriter() { workIsThere_.notify_one(); }

  void runWriter();
  bool waitForWork();
  void work();
  void handOver();
  Clock::time_point flushAt() const;
  bool isCommitDue() const;
  void commit();
  void publishState();
  void finish();

  // Constant.
  const StoreOptions options_;
  StoreCounters counters_;

  // The writer thread's.
  StoreWriter writer_;
  Clock::time_point commitAt_{};
  bool isFlushWaiting_ = false;
  Clock::time_point flushesPaidUntil_{};  // Ahead of now by a pause for each flush.
  Clock::time_point retryAt_{};
  std::chrono::milliseconds retryPause_;

  // Guarded by `mutex_`, the state read without it too.
  std::mutex mutex_;
  std::condition_variable workIsThere_;
  std::condition_variable writerEnded_;
  std::atomic<State> state_{State::kOpening};
  ErrorObject faultError_;
  StoreQueue queue_;
  std::size_t queuedEvents_ = 0;
  Clock::time_point firstQueuedAt_{};
  bool isUrgent_ = false;
  bool writerIsIdle_ = false;  // It waits without a deadline.
  bool isStopping_ = false;
  bool hasEnded_ = false;
  std::vector<Answer> waitingAnswers_;
  bool isAnswering_ = false;

  std::thread thread_;  // Last, so that it starts after the rest.
};

}  // namespace ostrel
