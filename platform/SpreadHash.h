#pragma once

#include <cstddef>
#include <cstdint>

namespace ostrel {

/// A hash of the IDs that clients choose, for tables that look them up: in each process
/// another one, so that nobody can choose IDs that all meet in one place of a table and
/// make every look-up a walk over them. All of its bits are good. Any thread.
class SpreadHash {
 public:
  /// `ID` is an integer, or an enumeration of integers.
  template <typename ID>
  std::size_t operator()(ID id) const noexcept {
    std::uint64_t hash = static_cast<std::uint64_t>(id) ^ kSeed;
    hash = (hash ^ (hash >> 32)) * kFactor;
    hash = (hash ^ (hash >> 32)) * kFactor;
    return static_cast<std::size_t>(hash ^ (hash >> 32));
  }

 private:
  static constexpr std::uint64_t kFactor = 0xD6E8FEB86659FD93;

  // The system puts stack and data at another place in each process.
  static std::uint64_t makeSeed() noexcept {
    static const char data = 0;
    const char stack = 0;
    return reinterpret_cast<std::uintptr_t>(&data) * 0x9E3779B97F4A7C15 ^
           reinterpret_cast<std::uintptr_t>(&stack);
  }

  static inline const std::uint64_t kSeed = makeSeed();
};

}  // namespace ostrel
