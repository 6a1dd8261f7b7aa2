#pragma once

#include <cstddef>
#include <cstdint>

namespace ostrel {

// Memory that is needed soon is asked for, and comes while something else is done. Any
// address will do, null too: nothing is read or written that anybody could notice.

/// The lines of the cache from `address` on.
template <int kForWriting>
[[gnu::always_inline]] inline void fetchLines(const void* address, std::size_t bytes) {
  constexpr std::size_t kLine = 64;
  const auto at = reinterpret_cast<std::uintptr_t>(address);
  for (std::size_t i = 0; i < bytes; i += kLine) {
    __builtin_prefetch(reinterpret_cast<const void*>(at + i), kForWriting);
  }
  __builtin_prefetch(reinterpret_cast<const void*>(at + bytes - 1), kForWriting);
}

/// For who will only read them.
inline void fetchToRead(const void* address, std::size_t bytes) {
  fetchLines</*kForWriting=*/0>(address, bytes);
}

/// For who will write them: they come once, and not twice.
inline void fetchToWrite(const void* address, std::size_t bytes) {
  fetchLines</*kForWriting=*/1>(address, bytes);
}

}  // namespace ostrel
