#include "platform/fake/ManualWorkQueue.h"

#include <algorithm>
#include <map>
#include <utility>

#include "platform/fake/FakeUse.h"

namespace ostrel {
namespace {

thread_local const ManualWorkQueue* currentQueue = nullptr;

class CurrentQueueScope {
 public:
  explicit CurrentQueueScope(const ManualWorkQueue* queue)
      : before_(std::exchange(currentQueue, queue)) {}
  ~CurrentQueueScope() { currentQueue = before_; }
  CurrentQueueScope(const CurrentQueueScope&) = delete;
  CurrentQueueScope& operator=(const CurrentQueueScope&) = delete;

 private:
  const ManualWorkQueue* const before_;
};

}  // namespace

struct ManualWorkQueue::Shared {
  std::mutex mutex;
  std::uint64_t lastOrder = 0;
  // By the order of its first step, each queue that can run. It is kept alive
  // as long as it has steps.
  std::map<std::uint64_t, std::shared_ptr<ManualWorkQueue>> ready;
  std::vector<std::weak_ptr<ManualWorkQueue>> queues;
  std::vector<std::chrono::nanoseconds> backgroundDelays;
  bool isRunning = false;
};

ManualWorkQueue::ManualWorkQueue(std::shared_ptr<Shared> shared, std::size_t number,
                                 std::string label, QualityOfService qualityOfService,
                                 int relativePriority)
    : shared_(std::move(shared)),
      number_(number),
      label_(std::move(label)),
      qualityOfService_(qualityOfService),
      relativePriority_(relativePriority) {}

void ManualWorkQueue::updateReady() {
  const std::uint64_t wanted =
      steps_.empty() || isSuspended_ || isRunning_ ? 0 : steps_.front().order;
  if (wanted == readyAt_) return;
  // Own references are moved, never dropped here: the caller holds one.
  if (readyAt_ != 0) shared_->ready.erase(readyAt_);
  readyAt_ = wanted;
  if (wanted != 0) shared_->ready.emplace(wanted, shared_from_this());
}

void ManualWorkQueue::async(Task step) {
  const std::lock_guard lock(shared_->mutex);
  steps_.push_back({++shared_->lastOrder, std::move(step)});
  updateReady();
}

void ManualWorkQueue::suspend() {
  checkFakeUse(isCurrent(), "suspend is called on the queue");
  const std::lock_guard lock(shared_->mutex);
  checkFakeUse(!isSuspended_, "one resume for each suspend");
  isSuspended_ = true;
  updateReady();
}

void ManualWorkQueue::resume(Task first) {
  const std::lock_guard lock(shared_->mutex);
  checkFakeUse(isSuspended_, "one suspend for each resume");
  isSuspended_ = false;
  steps_.push_front({++shared_->lastOrder, std::move(first)});
  updateReady();
}

bool ManualWorkQueue::isCurrent() const { return currentQueue == this; }

bool ManualWorkQueue::isSuspended() const {
  const std::lock_guard lock(shared_->mutex);
  return isSuspended_;
}

std::size_t ManualWorkQueue::waitingCount() const {
  const std::lock_guard lock(shared_->mutex);
  return steps_.size();
}

void ManualWorkQueue::runAs(const std::function<void()>& action) {
  const std::shared_ptr<ManualWorkQueue> self = shared_from_this();
  {
    const std::lock_guard lock(shared_->mutex);
    checkFakeUse(!isRunning_, "one step of a queue at a time");
    checkFakeUse(!isSuspended_, "a suspended queue runs nothing");
    isRunning_ = true;
    updateReady();
  }
  {
    const CurrentQueueScope scope(this);
    action();
  }
  const std::lock_guard lock(shared_->mutex);
  isRunning_ = false;
  updateReady();
}

ManualWorkQueueFactory::ManualWorkQueueFactory(std::shared_ptr<ManualClock> clock)
    : clock_(std::move(clock)),
      shared_(std::make_shared<ManualWorkQueue::Shared>()),
      background_(std::shared_ptr<ManualWorkQueue>(
          new ManualWorkQueue(shared_, /*number=*/0, "background",
                              QualityOfService::kBackground, /*relativePriority=*/0))) {}

ManualWorkQueueFactory::~ManualWorkQueueFactory() { releaseCallbacks(); }

std::shared_ptr<WorkQueue> ManualWorkQueueFactory::makeSerialQueue(
    std::string_view label, QualityOfService qualityOfService, int relativePriority) {
  checkFakeUse(relativePriority <= 0, "relative priorities are 0 or below");
  const std::lock_guard lock(shared_->mutex);
  const std::shared_ptr<ManualWorkQueue> queue(
      new ManualWorkQueue(shared_, shared_->queues.size() + 1, std::string(label),
                          qualityOfService, relativePriority));
  shared_->queues.push_back(queue);
  return queue;
}

void ManualWorkQueueFactory::asyncAfter(std::chrono::nanoseconds delay, Task step) {
  checkFakeUse(delay.count() >= 0, "a delay is 0 or more");
  {
    const std::lock_guard lock(shared_->mutex);
    shared_->backgroundDelays.push_back(delay);
  }
  if (delay.count() == 0) {
    background_->async(std::move(step));
    return;
  }
  clock_->scheduleAt(clock_->monotonicNow() + delay,
                     [background = std::weak_ptr(background_),
                      held = std::make_shared<Task>(std::move(step))] {
                       if (auto queue = background.lock()) queue->async(std::move(*held));
                     });
}

bool ManualWorkQueueFactory::runOne() {
  std::unique_lock lock(shared_->mutex);
  checkFakeUse(!shared_->isRunning, "steps are not run from inside a step");
  if (shared_->ready.empty()) return false;
  runStepOf(shared_->ready.begin()->second, /*position=*/0, std::move(lock));
  return true;
}

void ManualWorkQueueFactory::runStepOf(std::shared_ptr<ManualWorkQueue> queue,
                                       std::size_t position,
                                       std::unique_lock<std::mutex> lock) {
  const auto at = queue->steps_.begin() + static_cast<std::ptrdiff_t>(position);
  Task step = std::move(at->task);
  queue->steps_.erase(at);
  queue->isRunning_ = true;
  queue->updateReady();
  shared_->isRunning = true;
  lock.unlock();
  {
    const CurrentQueueScope scope(queue.get());
    step();
    step = Task();
  }
  lock.lock();
  shared_->isRunning = false;
  queue->isRunning_ = false;
  queue->updateReady();
  lock.unlock();  // Before the last reference to the queue may go.
}

std::vector<std::size_t> ManualWorkQueueFactory::readyQueues() const {
  std::vector<std::size_t> numbers;
  const std::lock_guard lock(shared_->mutex);
  for (const auto& [order, queue] : shared_->ready) numbers.push_back(queue->number_);
  std::sort(numbers.begin(), numbers.end());
  return numbers;
}

void ManualWorkQueueFactory::runOneOf(std::size_t number, std::size_t position) {
  std::unique_lock lock(shared_->mutex);
  checkFakeUse(!shared_->isRunning, "steps are not run from inside a step");
  const auto ready =
      std::find_if(shared_->ready.begin(), shared_->ready.end(),
                   [&](const auto& entry) { return entry.second->number_ == number; });
  checkFakeUse(ready != shared_->ready.end(), "the queue is ready");
  checkFakeUse(position == 0 || (number == 0 && position < ready->second->steps_.size()),
               "only steps of the background queue have no order");
  runStepOf(ready->second, position, std::move(lock));
}

std::size_t ManualWorkQueueFactory::runUntilIdle() {
  std::size_t count = 0;
  while (runOne()) ++count;
  return count;
}

std::vector<std::shared_ptr<ManualWorkQueue>> ManualWorkQueueFactory::queues() const {
  std::vector<std::shared_ptr<ManualWorkQueue>> alive;
  const std::lock_guard lock(shared_->mutex);
  for (const auto& weak : shared_->queues) {
    if (auto queue = weak.lock()) alive.push_back(std::move(queue));
  }
  return alive;
}

std::shared_ptr<ManualWorkQueue> ManualWorkQueueFactory::queue(
    std::string_view label) const {
  for (auto& queue : queues()) {
    if (queue->label() == label) return queue;
  }
  checkFakeUse(false, "no queue of that label is alive");
  return nullptr;
}

std::vector<std::chrono::nanoseconds> ManualWorkQueueFactory::backgroundDelays() const {
  const std::lock_guard lock(shared_->mutex);
  return shared_->backgroundDelays;
}

void ManualWorkQueueFactory::releaseCallbacks() {
  auto alive = queues();
  alive.push_back(background_);
  for (const auto& queue : alive) {
    std::deque<ManualWorkQueue::Step> dropped;  // Destroyed without the lock.
    const std::lock_guard lock(shared_->mutex);
    dropped.swap(queue->steps_);
    queue->updateReady();
  }
}

}  // namespace ostrel
