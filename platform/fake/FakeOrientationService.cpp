#include "platform/fake/FakeOrientationService.h"

#include <utility>

#include "platform/fake/FakeUse.h"

namespace ostrel {
namespace {

template <typename Map>
std::vector<std::string> keys(const Map& map) {
  std::vector<std::string> keys;
  for (const auto& [key, value] : map) keys.push_back(key);
  return keys;
}

}  // namespace

FakeOrientationService::FakeOrientationService(SharedEventLog events)
    : events_(std::move(events)) {}

void FakeOrientationService::registerDeviceOrientationObserver(const std::string& id,
                                                               Callback callback) {
  checkFakeUse(callback != nullptr, "an observer has a callback");
  events_->add("orientation.registerDevice " + id);
  const std::lock_guard lock(mutex_);
  std::swap(device_[id], callback);  // The replaced one ends without the lock.
}

void FakeOrientationService::registerInterfaceOrientationObserver(const std::string& id,
                                                                  Callback callback) {
  checkFakeUse(callback != nullptr, "an observer has a callback");
  events_->add("orientation.registerInterface " + id);
  const std::lock_guard lock(mutex_);
  std::swap(interface_[id], callback);
}

void FakeOrientationService::unregisterDeviceOrientationObserver(const std::string& id) {
  events_->add("orientation.unregisterDevice " + id);
  Observers::node_type dropped;  // Destroyed without the lock.
  const std::lock_guard lock(mutex_);
  dropped = device_.extract(id);
}

void FakeOrientationService::unregisterInterfaceOrientationObserver(
    const std::string& id) {
  events_->add("orientation.unregisterInterface " + id);
  Observers::node_type dropped;  // Destroyed without the lock.
  const std::lock_guard lock(mutex_);
  dropped = interface_.extract(id);
}

std::string FakeOrientationService::orientationName(OrientationCode code) const {
  switch (code) {
    case 0:
      return "undefined";
    case 1:
    case 10:
      return "normal";
    case 2:
      return "bottom-up";
    case 3:
      return "left-up";
    case 4:
      return "right-up";
    case 11:
      return "90";
    case 12:
      return "180";
    case 13:
      return "270";
    case 14:
      return "flipped";
    default:
      return "unknown";
  }
}

void FakeOrientationService::turn(const Observers& observers, OrientationCode code) {
  for (const auto& [id, callback] : observers) callback(code);
}

void FakeOrientationService::turnDevice(OrientationCode code) {
  Observers observers;
  {
    const std::lock_guard lock(mutex_);
    observers = device_;
  }
  turn(observers, code);
}

void FakeOrientationService::turnInterface(OrientationCode code) {
  Observers observers;
  {
    const std::lock_guard lock(mutex_);
    observers = interface_;
  }
  turn(observers, code);
}

std::vector<std::string> FakeOrientationService::deviceObservers() const {
  const std::lock_guard lock(mutex_);
  return keys(device_);
}

std::vector<std::string> FakeOrientationService::interfaceObservers() const {
  const std::lock_guard lock(mutex_);
  return keys(interface_);
}

OrientationService::Callback FakeOrientationService::deviceCallback(
    const std::string& id) const {
  const std::lock_guard lock(mutex_);
  const auto found = device_.find(id);
  return found == device_.end() ? Callback() : found->second;
}

OrientationService::Callback FakeOrientationService::interfaceCallback(
    const std::string& id) const {
  const std::lock_guard lock(mutex_);
  const auto found = interface_.find(id);
  return found == interface_.end() ? Callback() : found->second;
}

void FakeOrientationService::releaseCallbacks() {
  Observers device;  // Destroyed without the lock.
  Observers interface;
  const std::lock_guard lock(mutex_);
  device.swap(device_);
  interface.swap(interface_);
}

}  // namespace ostrel
