#pragma once

#include <mutex>
#include <utility>

#include "platform/SmallMutex.h"

namespace ostrel {

/// A property that any thread may read and replace; a reader gets a copy of one
/// whole value. The value that is replaced is torn down after the lock is
/// released (it is the argument then), so its teardown may use the property.
template <typename T>
class AtomicProperty {
 public:
  AtomicProperty() = default;
  explicit AtomicProperty(T value) : value_(std::move(value)) {}

  T get() const {
    const std::lock_guard lock(mutex_);
    return value_;
  }

  void set(T value) {
    const std::lock_guard lock(mutex_);
    std::swap(value_, value);
  }

 private:
  mutable SmallMutex mutex_;
  T value_{};
};

}  // namespace ostrel
