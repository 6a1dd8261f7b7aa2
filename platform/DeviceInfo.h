#pragma once

#include <cstdint>
#include <optional>
#include <string_view>

#include "platform/Value.h"

namespace ostrel {

class DeviceInfo {
 public:
  virtual ~DeviceInfo() = default;

  /// The answer to a question by key, such as "InternalBuild". None: not known.
  virtual std::optional<Value> answer(std::string_view key) const = 0;

  /// 0 unknown, 1 handset, 2 tablet, 3 laptop, 4 desktop, 5 convertible,
  /// 6 watch, 7 embedded.
  virtual std::int32_t deviceClass() const = 0;
};

}  // namespace ostrel
