#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
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

/// Why bytes are not a value. A static sentence; none: they are.
using DecodeError = std::optional<std::string_view>;

/// Checks one item at the start of `bytes`; `size` becomes its length in bytes.
/// `hasRepeatedKeys` becomes true when a dictionary in it holds a key twice.
DecodeError checkItem(std::span<const std::uint8_t> bytes,
                      const PayloadLimits& limits, std::size_t& size,
                      bool& hasRepeatedKeys);

struct DecodedDictionary {
  std::optional<Dictionary> dictionary;
  DecodeError error;
};

/// A payload from outside: checked, copied once, and of repeated keys the later
/// one kept. The memory is charged to `account`, which may be none.
DecodedDictionary decodeDictionary(std::span<const std::uint8_t> bytes,
                                   const PayloadLimits& limits,
                                   std::shared_ptr<PayloadAccount> account);

}  // namespace ostrel::wire
