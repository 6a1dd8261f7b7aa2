// What the fuzzers share.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <span>
#include <string>
#include <string_view>

#include "platform/Logging.h"
#include "platform/linux/Limits.h"
#include "platform/linux/wire/PayloadDecoder.h"

namespace ostrel::fuzzing {

/// Ends the program unless it is so: that is how a fuzzer says what it found.
inline void expect(bool condition) {
  if (!condition) std::abort();
}

/// A payload of the input, under the limits of the service; no account is kept.
inline constexpr wire::PayloadLimits kPayloadLimits{limits::kNesting, limits::kNodes,
                                                    limits::kKeyBytes};

/// From the first call on, every line of the log is made and none is printed.
inline void silenceLog() {
  struct SilentLog final : ScopedLog {
    int verbosity(std::string_view) const override { return 9; }
    LogLevel lowestLevel() const override { return LogLevel::kDebug; }
    void write(const LogLine&) override {}
  };
  static const bool isSilent = [] {
    setSystemLog(std::make_shared<SilentLog>());
    return true;
  }();
  static_cast<void>(isSilent);
}

/// The input, read from its beginning; zeros behind its end.
class Input {
 public:
  Input(const std::uint8_t* data, std::size_t size) : rest_(data, size) {}

  bool isOver() const { return rest_.empty(); }
  std::uint8_t byte() {
    if (rest_.empty()) return 0;
    const std::uint8_t first = rest_[0];
    rest_ = rest_.subspan(1);
    return first;
  }
  /// Fewer at the end.
  std::string bytes(std::size_t count) {
    const auto taken = rest_.first(std::min(count, rest_.size()));
    rest_ = rest_.subspan(taken.size());
    return {taken.begin(), taken.end()};
  }

 private:
  std::span<const std::uint8_t> rest_;
};

}  // namespace ostrel::fuzzing
