#pragma once

#include <cstddef>

namespace ostrel {

// Memory that is needed soon is asked for, and comes while something else is done. Any
// address will do: nothing is read or written that anybody could notice.

/// The lines of the cache from `address` on, for who will only read them.
inline void fetchToRead(const void* address, std::size_t bytes) {
  constexpr std::size_t kLine = 64;
  const auto* const at = static_cast<const char*>(address);
  for (std::size_t i = 0; i < bytes; i += kLine) __builtin_prefetch(at + i, /*rw=*/0);
  __builtin_prefetch(at + bytes - 1, /*rw=*/0);
}

/// The same for who will write them: they come once, and not twice.
inline void fetchToWrite(const void* address, std::size_t bytes) {
  constexpr std::size_t kLine = 64;
  const auto* const at = static_cast<const char*>(address);
  for (std::size_t i = 0; i < bytes; i += kLine) __builtin_prefetch(at + i, /*rw=*/1);
  __builtin_prefetch(at + bytes - 1, /*rw=*/1);
}

}  // namespace ostrel
