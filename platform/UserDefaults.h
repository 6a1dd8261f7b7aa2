#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Value.h"

namespace ostrel {

/// The values of one suite as they were when it was opened.
class UserDefaultsSuite {
 public:
  virtual ~UserDefaultsSuite() = default;

  virtual std::optional<Value> objectForKey(std::string_view key) const = 0;

  /// The value as text: a string as it is, a number in decimal, none for
  /// anything else.
  virtual std::optional<std::string> stringForKey(std::string_view key) const = 0;

  /// The value as a boolean: a number is true unless 0; a text is true when it
  /// reads as "yes", "true" or a number other than 0; anything else is false.
  virtual bool boolForKey(std::string_view key) const = 0;
};

class UserDefaults {
 public:
  virtual ~UserDefaults() = default;

  /// Reads the suite afresh. One that is missing or cannot be read has no
  /// values; the latter is logged.
  virtual std::unique_ptr<UserDefaultsSuite> openSuite(std::string_view name) = 0;
};

}  // namespace ostrel
