#pragma once

#include <cstddef>
#include <cstdint>
#include <string_view>
#include <type_traits>

namespace ostrel {

/// A hash of the IDs and the keys that clients choose, for tables that look them up: in
/// each process another one, so that nobody can choose some that all meet in one place of
/// a table and make every look-up a walk over them. All of its bits are good. Any thread.
class SpreadHash {
 public:
  template <typename ID>
  requires(std::is_integral_v<ID> || std::is_enum_v<ID>) std::size_t operator()(
      ID id) const noexcept {
    std::uint64_t hash = static_cast<std::uint64_t>(id) ^ kSeed;
    hash = (hash ^ (hash >> 32)) * kFactor;
    hash = (hash ^ (hash >> 32)) * kFactor;
    return static_cast<std::size_t>(hash ^ (hash >> 32));
  }
  std::size_t operator()(std::string_view text) const noexcept {
    return static_cast<std::size_t>(ofText(text, kSeed));
  }

  /// Of a text in a process with this seed: texts that meet under one seed do not under
  /// others. (SipHash with one round a block and three at the end.)
  static std::uint64_t ofText(std::string_view text, std::uint64_t seed) noexcept;

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
