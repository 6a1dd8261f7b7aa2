// What the tests of the codec share.
#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/linux/wire/PayloadDecoder.h"

namespace ostrel::wire {

inline constexpr PayloadLimits kTestLimits{
    .nesting = 32, .nodes = 65536, .keyBytes = 1024};

inline std::string bytesOf(std::initializer_list<int> values) {
  std::string bytes;
  for (const int value : values) bytes.push_back(static_cast<char>(value));
  return bytes;
}

inline std::span<const std::uint8_t> spanOf(std::string_view bytes) {
  return {reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size()};
}

/// A copy in memory of exactly its size, and of `behind` where there is something, so
/// that a read past its end is seen by the address sanitizer.
class ExactBytes {
 public:
  explicit ExactBytes(std::string_view bytes, std::string_view behind = {})
      : bytes_(std::make_unique<std::uint8_t[]>(bytes.size() + behind.size())),
        size_(bytes.size()),
        readable_(bytes.size() + behind.size()) {
    std::copy(bytes.begin(), bytes.end(), bytes_.get());
    std::copy(behind.begin(), behind.end(), bytes_.get() + size_);
  }
  std::span<const std::uint8_t> span() const { return {bytes_.get(), size_}; }
  const std::uint8_t* readableEnd() const { return bytes_.get() + readable_; }

 private:
  std::unique_ptr<std::uint8_t[]> bytes_;
  std::size_t size_;
  std::size_t readable_;
};

struct Checked {
  DecodeError error;
  std::size_t size = 0;
  bool hasRepeatedKeys = false;
};

/// What the check says of `bytes` while `behind` lies behind them.
inline Checked checkBefore(std::string_view behind, std::string_view bytes,
                           const PayloadLimits& limits = kTestLimits) {
  Checked checked;
  const ExactBytes exact(bytes, behind);
  checked.error = checkItem(exact.span(), limits, checked.size, checked.hasRepeatedKeys,
                            exact.readableEnd());
  return checked;
}

/// Checks `bytes` with nothing behind them. Whatever may be read there, a little or much,
/// more of the same item or what no item holds, nothing else is found.
inline Checked check(std::string_view bytes, const PayloadLimits& limits = kTestLimits) {
  const Checked alone = checkBefore({}, bytes, limits);
  for (const std::string& behind : {std::string(40, 'a'), std::string(100, 'a'),
                                    std::string(100, '\0'), std::string(100, '\xFF')}) {
    const Checked other = checkBefore(behind, bytes, limits);
    EXPECT_EQ(other.error, alone.error);
    if (alone.error) continue;
    EXPECT_EQ(other.size, alone.size);
    EXPECT_EQ(other.hasRepeatedKeys, alone.hasRepeatedKeys);
  }
  return alone;
}

/// The dictionary that `bytes` are from the first to the last.
inline DecodedDictionary decodeWhole(std::span<const std::uint8_t> bytes,
                                     const PayloadLimits& limits) {
  DecodedDictionary decoded = decodeDictionary(bytes, limits, /*owner=*/{});
  if (!decoded.error && decoded.size != bytes.size()) {
    return {std::nullopt, "bytes follow the payload"};
  }
  return decoded;
}

}  // namespace ostrel::wire
