// IDs and keys that meet in tables whose hash has no seed, for the tests.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>
#include <vector>

namespace ostrel::testing_support {

/// The `number`-th ID of those whose hash, if it had the seed 0, had no bit in its lower
/// half: they meet in each table of up to 2^32 places.
inline std::int64_t meetingID(std::uint32_t number) {
  constexpr std::uint64_t kInverse = 0xCFEE444D8B59A89B;  // Of the hash's factor.
  std::uint64_t id = std::uint64_t{number} << 32;
  id ^= id >> 32;
  id = id * kInverse;
  id ^= id >> 32;
  id = id * kInverse;
  return static_cast<std::int64_t>(id ^ (id >> 32));
}

/// Encoded text keys of 23 letters each that all have one hash by the standard library's
/// (Murmur's of 64 bits), whatever the size of the table.
inline std::vector<std::string> meetingKeys(std::size_t count) {
  constexpr std::uint64_t kFactor = 0xC6A4A7935BD1E995;
  constexpr std::uint64_t kInverse = 0x5F7A0EA7E59B19BD;
  constexpr std::uint64_t kAllASCII = 0x8080808080808080;
  constexpr char kHead = 0x77;  // Of a text of 23 bytes.
  constexpr std::size_t kSize = 24;
  const auto mixed = [](std::uint64_t bits) { return bits ^ (bits >> 47); };
  const std::uint64_t start = 0xC70F6907 ^ (kSize * kFactor);
  std::vector<std::string> keys;
  std::uint64_t meeting = 0;
  for (std::uint64_t i = 0; keys.size() < count; ++i) {
    std::string key(kSize, 'k');
    key[0] = kHead;
    for (std::size_t at = 0; at < 7; ++at) {
      key[at + 1] = static_cast<char>('A' + (i >> (4 * at)) % 16);
    }
    std::uint64_t first;
    std::memcpy(&first, key.data(), sizeof first);
    const std::uint64_t hash = (start ^ (mixed(first * kFactor) * kFactor)) * kFactor;
    std::uint64_t second;
    if (keys.empty()) {
      std::memcpy(&second, key.data() + 8, sizeof second);
      meeting = hash ^ (mixed(second * kFactor) * kFactor);
    } else {
      second = mixed((hash ^ meeting) * kInverse) * kInverse;
      if ((second & kAllASCII) != 0) continue;
      std::memcpy(key.data() + 8, &second, sizeof second);
    }
    keys.push_back(std::move(key));
  }
  return keys;
}

}  // namespace ostrel::testing_support
