#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>

#include "forwarder/Transport.h"
#include "platform/Date.h"

namespace ostrel {

/// What a reply means for the batch that it answers.
struct Verdict {
  enum class Kind {
    kTaken,
    kRefused,   // Something in it will never be taken.
    kTooLarge,  // The same; less at once may be.
    kBroken,    // The collector failed, and what in the batch it failed on is not told.
    kLater,     // It may be taken at another time, or when somebody mended something.
    kInterrupted,
  };

  Kind kind = Kind::kLater;
  /// Of those taken, how many the collector took out.
  std::int64_t rejected = 0;
  /// What the collector asks for with `kLater`.
  std::optional<std::chrono::milliseconds> pauseAsked;
  /// A phrase for people, of nothing that was sent.
  std::string reason;
};

/// `now` is for a "Retry-After" that is a date.
Verdict verdictOn(const Reply& reply, Date now);

}  // namespace ostrel
