// What the tests of the codec share.
#pragma once

#include <cstdint>
#include <cstring>
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

/// A copy in memory of exactly its size, so that a read past its end is seen by
/// the address sanitizer.
class ExactBytes {
 public:
  explicit ExactBytes(std::string_view bytes)
      : bytes_(std::make_unique<std::uint8_t[]>(bytes.size())), size_(bytes.size()) {
    std::memcpy(bytes_.get(), bytes.data(), size_);
  }
  std::span<const std::uint8_t> span() const { return {bytes_.get(), size_}; }

 private:
  std::unique_ptr<std::uint8_t[]> bytes_;
  std::size_t size_;
};

struct Checked {
  DecodeError error;
  std::size_t size = 0;
  bool hasRepeatedKeys = false;
};

inline Checked check(std::string_view bytes, const PayloadLimits& limits = kTestLimits) {
  Checked checked;
  const ExactBytes exact(bytes);
  checked.error = checkItem(exact.span(), limits, checked.size, checked.hasRepeatedKeys);
  return checked;
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
