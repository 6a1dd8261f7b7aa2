#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string_view>

#include "platform/Value.h"

namespace ostrel::wire {

/// What a payload may cost, checked before memory is taken for it.
struct PayloadLimits {
  std::size_t nesting;   // Arrays and dictionaries within one another.
  std::size_t nodes;     // Values in all, keys included.
  std::size_t keyBytes;  // Of one text key.
};

/// No `PayloadLimits` allow more nesting than this: a check keeps its place in
/// each open array and dictionary on the stack.
inline constexpr std::size_t kDeepestNesting = 64;

/// Why bytes are not a value. A static sentence; none: they are.
using DecodeError = std::optional<std::string_view>;

/// Checks one item at the start of `bytes`; `size` becomes its length in bytes.
/// `hasRepeatedKeys` becomes true when a dictionary in it holds a key twice.
/// Takes time in proportion to the bytes, and no memory while no dictionary has
/// more than 16 entries; larger ones cost 8 bytes a key until the call returns,
/// and a sort. On an error neither result means anything. `readableEnd` says up to where
/// bytes behind `bytes` may be read, which makes it faster whatever they are; null: none.
DecodeError checkItem(std::span<const std::uint8_t> bytes, const PayloadLimits& limits,
                      std::size_t& size, bool& hasRepeatedKeys,
                      const std::uint8_t* readableEnd = nullptr);

/// Whether `text` is well-formed UTF-8: no overlong form, no surrogate, nothing
/// above U+10FFFF.
bool isUTF8(std::span<const std::uint8_t> text);

struct DecodedDictionary {
  std::optional<Dictionary> dictionary;
  DecodeError error;
  std::size_t size = 0;  // Of the encoding that was decoded.
};

/// A payload at the start of `bytes`: checked, and of entries with one key the last one
/// kept. When `bytes` lie in `owner` it is left there. With `owner` none, and when an
/// entry went, it is copied; the copy is charged to the account of `owner`. Bytes behind
/// the payload are left alone.
DecodedDictionary decodeDictionary(std::span<const std::uint8_t> bytes,
                                   const PayloadLimits& limits, const ValueBuffer& owner);

}  // namespace ostrel::wire
