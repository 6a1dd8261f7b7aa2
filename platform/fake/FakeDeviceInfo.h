#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>

#include "platform/DeviceInfo.h"
#include "platform/fake/EventLog.h"

namespace ostrel {

/// Knows what the test says, and is of class 0 until told. Adds
/// "device.answer KEY" and "device.class" to the events.
class FakeDeviceInfo final : public DeviceInfo {
 public:
  explicit FakeDeviceInfo(SharedEventLog events);

  std::optional<Value> answer(std::string_view key) const override;
  std::int32_t deviceClass() const override;

  void setAnswer(std::string_view key, std::optional<Value> value);
  void setDeviceClass(std::int32_t deviceClass);

 private:
  const SharedEventLog events_;
  mutable std::mutex mutex_;
  std::map<std::string, Value, std::less<>> answers_;
  std::int32_t deviceClass_ = 0;
};

}  // namespace ostrel
