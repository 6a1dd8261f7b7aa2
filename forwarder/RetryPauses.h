#pragma once

#include <chrono>
#include <optional>
#include <string_view>

#include "platform/Date.h"
#include "platform/Random.h"

namespace ostrel {

/// What the header "Retry-After" of a reply asks for, at `now`: a number of seconds or
/// a date. A moment that is past is 0; nothing is more than `RetryPauses::kLongestAsked`.
/// None when it is neither.
std::optional<std::chrono::milliseconds> pauseAsked(std::string_view retryAfter,
                                                    Date now);

/// How long to wait between attempts: about 5 s, half as much more each time, up to 15
/// minutes. A part of it is drawn, so that a fleet does not come back all at once.
class RetryPauses {
 public:
  static constexpr std::chrono::milliseconds kFirst{5'000};
  static constexpr std::chrono::milliseconds kLongest{15 * 60'000};
  static constexpr std::chrono::milliseconds kLongestAsked{24 * 3'600'000};

  /// `random` outlives this.
  explicit RetryPauses(Random& random) : random_(random) {}

  /// From half of the current pause to all of it. When the collector asked for more,
  /// that and up to a tenth of it, a minute at most, besides.
  std::chrono::milliseconds next(std::optional<std::chrono::milliseconds> asked);

  /// An attempt succeeded.
  void reset() { pause_ = kFirst; }

 private:
  std::chrono::milliseconds upTo(std::chrono::milliseconds most);

  Random& random_;
  std::chrono::milliseconds pause_ = kFirst;
};

}  // namespace ostrel
