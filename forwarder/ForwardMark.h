#pragma once

#include <cstdint>
#include <string>

#include "platform/Outcome.h"

namespace ostrel {

/// How far a store was forwarded, and what became of its messages, all stores together.
struct ForwardMark {
  std::string store;         // Its name; empty before the first.
  std::int64_t through = 0;  // The ID up to which everything was dealt with.

  std::int64_t forwarded = 0;  // Taken by the collector.
  std::int64_t parked = 0;     // Refused by it one by one, and passed over.
  std::int64_t rejected = 0;   // Taken out by it from requests that it took.
  std::int64_t dropped = 0;    // Gone from the store before their turn.

  friend bool operator==(const ForwardMark&, const ForwardMark&) = default;
};

/// Keeps the mark across restarts. One thread.
class MarkKeeper {
 public:
  virtual ~MarkKeeper() = default;

  /// Durable when it returns. The error is a sentence for people.
  virtual Success save(const ForwardMark& mark) = 0;
};

}  // namespace ostrel
