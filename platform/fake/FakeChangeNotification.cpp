#include "platform/fake/FakeChangeNotification.h"

#include <utility>

#include "platform/fake/FakeUse.h"

namespace ostrel {

FakeChangeNotification::FakeChangeNotification(SharedEventLog events)
    : events_(std::move(events)) {}

ChangeNotification::Registration FakeChangeNotification::registerDispatch(
    std::string_view name, std::shared_ptr<WorkQueue> queue, Handler handler) {
  checkFakeUse(queue != nullptr && handler != nullptr,
               "a registration has a queue and a handler");
  events_->add("notify.registerDispatch " + std::string(name));
  const std::lock_guard lock(mutex_);
  if (failure_ != 0) return {failure_, /*token=*/-1};
  const int token = static_cast<int>(observers_.size()) + 1;
  observers_.push_back({std::string(name), token, std::move(queue), std::move(handler)});
  return {/*status=*/0, token};
}

std::vector<FakeChangeNotification::Observer> FakeChangeNotification::observers(
    std::string_view name) const {
  std::vector<Observer> found;
  const std::lock_guard lock(mutex_);
  for (const Observer& observer : observers_) {
    if (observer.name == name) found.push_back(observer);
  }
  return found;
}

void FakeChangeNotification::post(std::string_view name) {
  for (const Observer& observer : observers(name)) {
    observer.queue->async(
        [handler = observer.handler, token = observer.token] { handler(token); });
  }
}

void FakeChangeNotification::postWithToken(std::string_view name, int token) {
  for (const Observer& observer : observers(name)) {
    observer.queue->async([handler = observer.handler, token] { handler(token); });
  }
}

void FakeChangeNotification::failRegistrations(int status) {
  const std::lock_guard lock(mutex_);
  failure_ = status;
}

std::size_t FakeChangeNotification::registrationCount() const {
  const std::lock_guard lock(mutex_);
  return observers_.size();
}

void FakeChangeNotification::releaseCallbacks() {
  std::vector<Observer> dropped;  // Destroyed without the lock.
  const std::lock_guard lock(mutex_);
  dropped.swap(observers_);
}

}  // namespace ostrel
