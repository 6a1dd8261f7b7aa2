#pragma once

#include <array>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <string_view>
#include <utility>

#include "Statistics/OstrelReportingTypes.h"

namespace ostrel {

/// What clients were cut short of, and what they may do and others might want to know:
/// counted each time, logged once a minute for each user. Any thread.
class MisuseLog {
 public:
  using Clock = std::chrono::steady_clock;

  enum class Kind : std::size_t {
    kCutOff,
    kConnectionRefused,
    kSessionRefused,
    kUserInfoRefused,
    kUseOfOthers
  };
  static constexpr std::size_t kKinds = 5;

  /// Of a session of another user's client.
  struct UseOfOthers {
    std::string_view deed;  // As "stops".
    ReporterID session{};
    std::uint32_t maker = 0;  // The user.
  };

  using Counts = std::array<std::uint64_t, kKinds>;

  /// `counted` is called after each, on the thread that noted it; may be none.
  explicit MisuseLog(std::function<void()> counted = nullptr)
      : counted_(std::move(counted)) {}

  /// `reason` is a few words that continue the kind's sentence.
  void note(std::uint32_t user, Kind kind, std::string_view reason,
            Clock::time_point now);

  /// `count` uses by a client of `user`, the first of which was `use`.
  void noteUses(std::uint32_t user, std::uint64_t count, const UseOfOthers& use,
                Clock::time_point now);

  /// By kind, since the service began.
  Counts counts() const;

  /// How many kinds of users it holds back from the log, or has not looked at since.
  std::size_t heldBack() const;

  /// How a kind is called in the service's status.
  static std::string_view keyOf(Kind kind);

 private:
  /// Whether it is time to log it.
  bool count(std::uint32_t user, Kind kind, std::uint64_t count, Clock::time_point now);

  const std::function<void()> counted_;

  mutable std::mutex mutex_;
  // Guarded by `mutex_`.
  Counts counts_{};
  std::map<std::pair<std::uint32_t, Kind>, Clock::time_point> mayLogAgain_;
  std::size_t mostHeldBack_ = 0;  // Then it is looked through.
};

}  // namespace ostrel
