// The head of a CBOR item: its major type and argument (RFC 8949, section 3).
#pragma once

#include <cstdint>
#include <cstring>
#include <string_view>

namespace ostrel::wire {

enum MajorType : std::uint8_t {
  kUnsignedInteger = 0,
  kNegativeInteger = 1,
  kByteString = 2,
  kTextString = 3,
  kArrayItem = 4,
  kMapItem = 5,
  kTagItem = 6,
  kSimpleItem = 7,
};

// Additional information of a head.
inline constexpr std::uint8_t kOneByteFollows = 24;
inline constexpr std::uint8_t kTwoBytesFollow = 25;
inline constexpr std::uint8_t kFourBytesFollow = 26;
inline constexpr std::uint8_t kEightBytesFollow = 27;
inline constexpr std::uint8_t kIndefinite = 31;

// Whole items of one byte.
inline constexpr std::uint8_t kFalseItem = 0xF4;
inline constexpr std::uint8_t kTrueItem = 0xF5;
inline constexpr std::uint8_t kNullItem = 0xF6;

/// The item of major type 7 with a double of 16, 32 or 64 bits has the same
/// additional information as an integer of that width.
inline constexpr std::uint8_t kHalfFloat = kTwoBytesFollow;
inline constexpr std::uint8_t kDoubleFloat = kEightBytesFollow;

struct Head {
  std::uint8_t majorType;
  std::uint8_t additional;
  std::uint64_t argument;
};

inline constexpr std::string_view kTruncated = "the item ends in its middle";
inline constexpr std::string_view kIndefiniteLength = "a length is indefinite";
inline constexpr std::string_view kReservedHead = "a head is reserved";

template <typename T>
inline T loadBigEndian(const std::uint8_t* at) {
  T value;
  std::memcpy(&value, at, sizeof value);
  if constexpr (sizeof(T) == 2) return __builtin_bswap16(value);
  if constexpr (sizeof(T) == 4) return __builtin_bswap32(value);
  if constexpr (sizeof(T) == 8) return __builtin_bswap64(value);
  return value;
}

/// Reads the head at `at` and moves `at` behind it. Null on success, else why
/// there is none.
[[gnu::always_inline]] inline const char* readHead(const std::uint8_t*& at,
                                                   const std::uint8_t* end, Head& head) {
  if (at == end) return kTruncated.data();
  const std::uint8_t first = *at++;
  head.majorType = first >> 5;
  head.additional = first & 0x1F;
  if (head.additional < kOneByteFollows) [[likely]] {
    head.argument = head.additional;
    return nullptr;
  }
  const auto left = static_cast<std::size_t>(end - at);
  switch (head.additional) {
    case kOneByteFollows:
      if (left < 1) return kTruncated.data();
      head.argument = *at;
      at += 1;
      return nullptr;
    case kTwoBytesFollow:
      if (left < 2) return kTruncated.data();
      head.argument = loadBigEndian<std::uint16_t>(at);
      at += 2;
      return nullptr;
    case kFourBytesFollow:
      if (left < 4) return kTruncated.data();
      head.argument = loadBigEndian<std::uint32_t>(at);
      at += 4;
      return nullptr;
    case kEightBytesFollow:
      if (left < 8) return kTruncated.data();
      head.argument = loadBigEndian<std::uint64_t>(at);
      at += 8;
      return nullptr;
    case kIndefinite:
      return kIndefiniteLength.data();
    default:
      return kReservedHead.data();
  }
}

}  // namespace ostrel::wire
