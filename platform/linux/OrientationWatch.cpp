#include "platform/linux/OrientationWatch.h"

#include <poll.h>
#include <sys/eventfd.h>

#include <algorithm>
#include <cstdlib>
#include <system_error>
#include <utility>
#include <vector>

#include "platform/Logging.h"
#include "platform/linux/Threads.h"

namespace ostrel {

bool waitForStop(int stopDescriptor, std::chrono::milliseconds time) {
  pollfd stop = {stopDescriptor, POLLIN, 0};
  return ::poll(&stop, 1, static_cast<int>(time.count())) > 0;
}

OrientationWatch::OrientationWatch(std::string threadName,
                                   std::unique_ptr<OrientationSource> source,
                                   std::size_t mostObservers)
    : threadName_(std::move(threadName)),
      mostObservers_(mostObservers),
      source_(std::move(source)),
      stopEvent_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {}

OrientationWatch::~OrientationWatch() {
  decltype(observers_) dropped;
  std::unique_lock lock(mutex_);
  dropped.swap(observers_);
  const std::uint64_t one = 1;
  if (::write(stopEvent_.get(), &one, sizeof one) < 0) std::abort();
  ended_.wait(lock, [this] { return !isRunning_; });
}

void OrientationWatch::add(const std::string& id, Callback callback) {
  auto added = std::make_shared<const Callback>(std::move(callback));
  std::shared_ptr<const Callback> oldest;  // Ends after the lock, as the replaced one.
  const std::lock_guard lock(mutex_);
  Observer& observer = observers_[id];
  if (observer.callback) byOrder_.erase(observer.order);
  observer.callback.swap(added);
  observer.order = nextOrder_++;
  byOrder_.emplace(observer.order, id);
  if (observers_.size() > mostObservers_) oldest = takeOldest();
  if (!isRunning_ && source_->isConfigured()) startThread();
}

// A session that is left while it starts stays with its observer for ever: clients that
// make such on purpose push one another out, and the memory stays theirs.
std::shared_ptr<const OrientationWatch::Callback> OrientationWatch::takeOldest() {
  const auto first = byOrder_.begin();
  const auto found = observers_.find(first->second);
  std::shared_ptr<const Callback> callback = std::move(found->second.callback);
  observers_.erase(found);
  byOrder_.erase(first);
  const auto now = std::chrono::steady_clock::now();
  if (now - crowdLoggedAt_ >= kShortestLogInterval) {
    crowdLoggedAt_ = now;
    OSTREL_LOG_ERROR(processLogScope,
                     "more than %lu sessions watch the orientation: the oldest stop",
                     mostObservers_);
  }
  return callback;
}

void OrientationWatch::remove(const std::string& id) {
  std::shared_ptr<const Callback> removed;  // Ends after the lock.
  const std::lock_guard lock(mutex_);
  const auto found = observers_.find(id);
  if (found == observers_.end()) return;
  removed = std::move(found->second.callback);
  byOrder_.erase(found->second.order);
  observers_.erase(found);
  if (!observers_.empty() || !isRunning_) return;
  const std::uint64_t one = 1;
  if (::write(stopEvent_.get(), &one, sizeof one) < 0) std::abort();
}

void OrientationWatch::startThread() {
  try {
    ostrel::startThread(threadName_, /*niceness=*/0, [this] { run(); }).detach();
    isRunning_ = true;
  } catch (const std::system_error& error) {
    OSTREL_LOG_ERROR(processLogScope, "cannot watch the orientation: %@",
                     std::string(error.what()));
  }
}

void OrientationWatch::run() {
  std::unique_lock lock(mutex_);
  while (!observers_.empty()) {
    // A stop that was meant for observers who have been replaced since.
    std::uint64_t stops = 0;
    while (::read(stopEvent_.get(), &stops, sizeof stops) > 0) {
    }
    lock.unlock();
    last_.reset();
    source_->run(stopEvent_.get(), [this](Code code) { report(code); });
    lock.lock();
  }
  isRunning_ = false;
  ended_.notify_all();
}

void OrientationWatch::report(Code code) {
  if (last_ == code) return;
  if (!last_) {
    last_ = code;
    return;
  }
  if (!mayHandOn()) return;
  last_ = code;
  std::vector<std::shared_ptr<const Callback>> callbacks;
  {
    const std::lock_guard lock(mutex_);
    for (const auto& [id, observer] : observers_) callbacks.push_back(observer.callback);
  }
  for (const auto& callback : callbacks) (*callback)(code);
}

bool OrientationWatch::mayHandOn() {
  const auto now = std::chrono::steady_clock::now();
  const std::chrono::duration<double> passed = now - allowanceAt_;
  allowanceAt_ = now;
  allowance_ = std::min(allowance_ + passed.count() * kMostChangesPerSecond,
                        double{kMostChangesPerSecond});
  if (allowance_ < 1) {
    ++dropped_;
    return false;
  }
  allowance_ -= 1;
  if (dropped_ != 0 && now - droppedLoggedAt_ >= kShortestLogInterval) {
    droppedLoggedAt_ = now;
    OSTREL_LOG_ERROR(processLogScope,
                     "%llu orientation changes were dropped: there are too many",
                     std::exchange(dropped_, 0));
  }
  return true;
}

}  // namespace ostrel
