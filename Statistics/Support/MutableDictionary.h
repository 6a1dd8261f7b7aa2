#pragma once

#include <mutex>

#include "platform/SmallMutex.h"
#include "platform/Value.h"

namespace ostrel {

/// A dictionary that grows by merging, from any thread. Readers take a snapshot
/// that no later merge changes.
class MutableDictionary {
 public:
  Dictionary snapshot() const {
    const std::lock_guard lock(mutex_);
    return value_;
  }

  /// Adds the entries of `other`; equal keys are replaced, none is removed.
  void merge(const Dictionary& other) {
    const std::lock_guard lock(mutex_);
    value_ = DictionaryBuilder(value_).merge(other).build();
  }

 private:
  mutable SmallMutex mutex_;
  Dictionary value_;
};

}  // namespace ostrel
