#include "platform/fake/FakeDeviceInfo.h"

#include <utility>

namespace ostrel {

FakeDeviceInfo::FakeDeviceInfo(SharedEventLog events) : events_(std::move(events)) {}

std::optional<Value> FakeDeviceInfo::answer(std::string_view key) const {
  events_->add("device.answer " + std::string(key));
  const std::lock_guard lock(mutex_);
  const auto found = answers_.find(key);
  if (found == answers_.end()) return std::nullopt;
  return found->second;
}

std::int32_t FakeDeviceInfo::deviceClass() const {
  events_->add("device.class");
  const std::lock_guard lock(mutex_);
  return deviceClass_;
}

void FakeDeviceInfo::setAnswer(std::string_view key, std::optional<Value> value) {
  const std::lock_guard lock(mutex_);
  if (value) {
    answers_.insert_or_assign(std::string(key), std::move(*value));
  } else if (const auto found = answers_.find(key); found != answers_.end()) {
    answers_.erase(found);
  }
}

void FakeDeviceInfo::setDeviceClass(std::int32_t deviceClass) {
  const std::lock_guard lock(mutex_);
  deviceClass_ = deviceClass;
}

}  // namespace ostrel
