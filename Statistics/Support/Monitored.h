#pragma once

#include <mutex>
#include <utility>

#include "platform/SmallMutex.h"

namespace ostrel {

/// A value with its own lock. The only way to the value is `lock()`, which holds
/// the lock as long as what it returns lives.
template <typename T>
class Monitored {
 public:
  template <typename Owner, typename Object>
  class Access {
   public:
    explicit Access(Owner& owner) : lock_(owner.mutex_), object_(owner.value_) {}
    Object* operator->() const { return &object_; }
    Object& operator*() const { return object_; }

   private:
    std::unique_lock<SmallMutex> lock_;
    Object& object_;
  };

  template <typename... Arguments>
  explicit Monitored(Arguments&&... arguments)
      : value_(std::forward<Arguments>(arguments)...) {}

  Access<Monitored, T> lock() { return Access<Monitored, T>(*this); }
  Access<const Monitored, const T> lock() const {
    return Access<const Monitored, const T>(*this);
  }

 private:
  mutable SmallMutex mutex_;
  T value_;
};

}  // namespace ostrel
