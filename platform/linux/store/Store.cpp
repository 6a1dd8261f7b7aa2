#include "platform/linux/store/Store.h"

#include <algorithm>
#include <utility>

#include "platform/Logging.h"
#include "platform/linux/Limits.h"
#include "platform/linux/Threads.h"

namespace ostrel {
namespace {

// Operations that make it worth writing before the commit is due.
constexpr std::size_t kWriteAhead = 512;

// What is not durable keeps memory, of which clients have a bounded share: half of
// one connection's (`limits::kQueuedBytes`) makes it worth committing early, so that
// the other half is filled meanwhile.
constexpr std::size_t kCommitBytes = limits::kQueuedBytes / 2;

// While there are fewer operations they are a burden to nobody: a client need not wait
// for the commit, only for one that is late.
constexpr std::size_t kUnburdened = 4096;

// Codes of errors that are not SQLite's, which are positive.
constexpr int kQueueIsFull = -1;
constexpr int kStopped = -2;

ErrorObject makeError(int code, std::string_view description) {
  return {std::string(kOstrelErrorDomain), code, std::string(description)};
}

std::int64_t systemMicroseconds() {
  return std::chrono::duration_cast<std::chrono::microseconds>(
             std::chrono::system_clock::now().time_since_epoch())
      .count();
}

StoreOptions complete(StoreOptions options) {
  if (!options.now) options.now = systemMicroseconds;
  return options;
}

}  // namespace

std::shared_ptr<Store> Store::open(std::string path) {
  return open(std::move(path), StoreOptions());
}

std::shared_ptr<Store> Store::open(std::string path, StoreOptions options) {
  return std::shared_ptr<Store>(new Store(std::move(path), complete(std::move(options))));
}

Store::Store(std::string path, StoreOptions options)
    : options_(std::move(options)),
      writer_(std::move(path), options_.vfs, options_.retention, counters_,
              options_.otherCounts),
      retryPause_(options_.firstRetry),
      thread_(startThread("ostrel-store", /*niceness=*/0, [this] { runWriter(); })) {}

Store::~Store() {
  shutdown(Clock::time_point::max());
  if (thread_.joinable()) thread_.join();
}

bool Store::shutdown(Clock::time_point deadline) {
  std::unique_lock lock(mutex_);
  isStopping_ = true;
  state_ = State::kStopped;
  faultError_ = makeError(kStopped, "the store is closed");
  wakeWriter();
  const auto hasEnded = [this] { return hasEnded_; };
  if (deadline == Clock::time_point::max()) {
    writerEnded_.wait(lock, hasEnded);
  } else if (!writerEnded_.wait_until(lock, deadline, hasEnded)) {
    OSTREL_LOG_ERROR(processLogScope, "the store was not written in time");
    return false;
  }
  return true;
}

std::optional<ErrorObject> Store::addMessage(StoreSession* session,
                                             std::uint16_t category, std::uint16_t type,
                                             const Dictionary& payload) {
  return pushMessage({options_.now(), SessionMessage{session, category, type, payload}});
}

std::optional<ErrorObject> Store::addLoneMessage(LoneMessage message) {
  return pushMessage({options_.now(), std::move(message)});
}

StoreSession* Store::beginSession(const Dictionary& sessionInfo,
                                  const Dictionary& userInfo) {
  auto* session = new StoreSession;
  session->sessionInfo = sessionInfo;
  session->userInfo = userInfo;
  session->startedAt = options_.now();
  session->user = Burden::currentUser();
  push({session->startedAt, SessionBegin{session}});
  return session;
}

void Store::endSession(StoreSession* session) {
  push({options_.now(), SessionEnd{std::unique_ptr<StoreSession>(session)}});
}

void Store::flush(StoreSession* session, TelemetrySession::FlushCallback completion) {
  {
    const std::lock_guard lock(mutex_);
    if (!isStopping_) {
      if (queue_.empty()) firstQueuedAt_ = Clock::now();
      queue_.push({options_.now(), SessionFlush{session, std::move(completion)}});
      isUrgent_ = true;
      wakeWriter();
      return;
    }
  }
  completion(makeError(kStopped, "the store is closed"));
}

void Store::addAnalyticsEvent(std::string name, AnalyticsSink::PayloadProvider provider) {
  pushEvent({options_.now(),
             AnalyticsEvent{std::move(name), std::move(provider), std::nullopt}},
            counters_.droppedAnalytics);
}

void Store::addPowerEvent(PowerEvent event) {
  pushEvent({options_.now(), std::move(event)}, counters_.droppedPower);
}

void Store::noteStatusChange() { push({options_.now(), StatusChange{}}); }

void Store::whenKnown(Answer answer) {
  bool isUsable;
  {
    const std::lock_guard lock(mutex_);
    if (state_ == State::kOpening || isAnswering_) {
      waitingAnswers_.push_back(std::move(answer));
      return;
    }
    isUsable = state_ == State::kUsable;
  }
  answer(isUsable);
}

bool Store::takesReports() const {
  const State state = state_.load(std::memory_order_relaxed);
  return state == State::kUsable || state == State::kOpening;
}

std::optional<ErrorObject> Store::pushMessage(StoreOperation operation) {
  if (takesReports()) {
    if (push(std::move(operation))) return std::nullopt;
    counters_.refused.fetch_add(1, std::memory_order_relaxed);
    return makeError(kQueueIsFull, "too much waits to be stored");
  }
  counters_.refused.fetch_add(1, std::memory_order_relaxed);
  const std::lock_guard lock(mutex_);
  return faultError_;
}

void Store::pushEvent(StoreOperation operation, std::atomic<std::uint64_t>& dropped) {
  if (takesReports() && push(std::move(operation))) return;
  dropped.fetch_add(1, std::memory_order_relaxed);
}

// False when there is no room; the store's own steps always find room: what is queued
// points to the session that a step begins or ends.
bool Store::push(StoreOperation operation) {
  const bool isOwnStep = std::holds_alternative<SessionBegin>(operation.what) ||
                         std::holds_alternative<SessionEnd>(operation.what) ||
                         std::holds_alternative<StatusChange>(operation.what);
  const bool isEvent = std::holds_alternative<AnalyticsEvent>(operation.what);
  BurdenShare burden = std::exchange(operation.burden, BurdenShare());
  bool mustWake;
  {
    const std::lock_guard lock(mutex_);
    if (!isOwnStep && (isStopping_ || queue_.bytes() >= options_.queuedBytes)) {
      return false;
    }
    if (isEvent && queuedEvents_ >= options_.queuedEvents) return false;
    if (queue_.empty()) firstQueuedAt_ = Clock::now();
    // A writer that sleeps until something is due needs no call for a few more.
    mustWake = writerIsIdle_ || queue_.size() == kWriteAhead - 1;
    if (isEvent) ++queuedEvents_;
    if (!isOwnStep) counters_.accepted.fetch_add(1, std::memory_order_relaxed);
    if (queue_.size() >= kUnburdened) operation.burden = std::move(burden);
    queue_.push(std::move(operation));
  }
  if (mustWake) wakeWriter();
  return true;
}

void Store::runWriter() {
  work();
  while (waitForWork()) work();
  finish();
}

// Returns when there is something to do; false when the store is to end.
bool Store::waitForWork() {
  std::unique_lock lock(mutex_);
  for (;;) {
    if (isStopping_) return false;
    if (isUrgent_ && (writer_.fault() || Clock::now() >= flushAt())) return true;
    std::optional<Clock::time_point> due;
    if (writer_.fault()) {
      due = retryAt_;
    } else if (queue_.size() >= kWriteAhead) {
      return true;
    } else if (writer_.hasUncommitted()) {
      due = commitAt_;
    } else if (!queue_.empty()) {
      due = firstQueuedAt_ + options_.commitWindow;
    }
    if (due && !writer_.fault() && (isUrgent_ || isFlushWaiting_)) {
      due = std::min(*due, flushAt());
    }
    if (!due) {
      writerIsIdle_ = true;
      workIsThere_.wait(lock);
      writerIsIdle_ = false;
    } else if (Clock::now() >= *due) {
      return true;
    } else {
      workIsThere_.wait_until(lock, *due);
    }
  }
}

// Hands what is queued to the writer.
void Store::handOver() {
  std::vector<StoreBatch> batches;
  {
    const std::lock_guard lock(mutex_);
    if (!writer_.hasUncommitted()) commitAt_ = firstQueuedAt_ + options_.commitWindow;
    isFlushWaiting_ |= std::exchange(isUrgent_, false);
    queuedEvents_ = 0;
    batches = queue_.take();
  }
  writer_.add(std::move(batches));
}

void Store::work() {
  handOver();
  bool isUrgent = isFlushWaiting_ && Clock::now() >= flushAt();
  // A fault that is new gets a second attempt at once: a file that was removed or
  // damaged is replaced by then.
  for (int attempt = 0; attempt < 2; ++attempt) {
    if (writer_.fault() && Clock::now() >= retryAt_) {
      writer_.recover();
      publishState();
      isUrgent = true;
    }
    if (!writer_.fault() && (isUrgent || isCommitDue())) commit();
    if (!writer_.fault()) break;
  }
  if (!writer_.fault()) {
    retryPause_ = options_.firstRetry;
    retryAt_ = {};
    return;
  }
  if (Clock::now() >= retryAt_) {
    retryAt_ = Clock::now() + retryPause_;
    retryPause_ = std::min(retryPause_ * 2, options_.longestRetry);
  }
  publishState();  // Before a caller learns of it from its flush.
  writer_.failFlushes();
  writer_.keepAtMost(limits::kStoreKeptThroughFault);
}

Store::Clock::time_point Store::flushAt() const {
  return flushesPaidUntil_ - options_.flushBurst * options_.flushPause;
}

bool Store::isCommitDue() const {
  return writer_.uncommittedBytes() >= kCommitBytes || Clock::now() >= commitAt_;
}

void Store::commit() {
  if (std::exchange(isFlushWaiting_, false)) {
    flushesPaidUntil_ = std::max(flushesPaidUntil_, Clock::now()) + options_.flushPause;
  }
  std::vector<StoreBatch> done = writer_.commit();
  const std::lock_guard lock(mutex_);
  for (StoreBatch& batch : done) queue_.recycle(std::move(batch));
}

void Store::publishState() {
  std::vector<Answer> answers;
  const bool isUsable = !writer_.fault();
  {
    const std::lock_guard lock(mutex_);
    if (isStopping_) return;
    state_ = isUsable ? State::kUsable : State::kFaulty;
    if (!isUsable) faultError_ = StoreWriter::errorOf(*writer_.fault());
    answers.swap(waitingAnswers_);
    isAnswering_ = !answers.empty();
  }
  // Answers are given in the order of the questions, also to those asked meanwhile.
  while (!answers.empty()) {
    for (const Answer& answer : answers) answer(isUsable);
    answers.clear();
    const std::lock_guard lock(mutex_);
    answers.swap(waitingAnswers_);
    isAnswering_ = !answers.empty();
  }
}

void Store::finish() {
  handOver();
  if (writer_.fault()) writer_.recover();
  if (!writer_.fault()) writer_.commit();
  if (writer_.hasUncommitted()) {
    OSTREL_LOG_ERROR(processLogScope, "the end of the reports was not stored");
  }
  writer_.failFlushes();
  writer_.close();
  std::vector<Answer> answers;
  {
    const std::lock_guard lock(mutex_);
    answers.swap(waitingAnswers_);
  }
  for (const Answer& answer : answers) answer(/*isUsable=*/false);
  const std::lock_guard lock(mutex_);
  hasEnded_ = true;
  writerEnded_.notify_all();
}

}  // namespace ostrel
