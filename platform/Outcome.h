#pragma once

#include <optional>

#include "platform/ErrorObject.h"

namespace ostrel {

/// What a platform call hands back. Value and error are independent: a call
/// may fail without an error object, or give both, and callers tell these
/// apart.
template <typename T>
struct Outcome {
  std::optional<T> value;
  std::optional<ErrorObject> error;
};

/// As `Outcome`, for calls that only say whether they succeeded.
struct Success {
  bool succeeded = false;
  std::optional<ErrorObject> error;
};

}  // namespace ostrel
