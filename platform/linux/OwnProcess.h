// What this process has, for tests that count it.
#pragma once

#include <cstddef>
#include <filesystem>
#include <iterator>

namespace ostrel::testing_support {

inline std::size_t entriesIn(const std::filesystem::path& directory) {
  return static_cast<std::size_t>(
      std::distance(std::filesystem::directory_iterator(directory),
                    std::filesystem::directory_iterator()));
}
inline std::size_t openDescriptors() { return entriesIn("/proc/self/fd"); }
inline std::size_t threadsOfProcess() { return entriesIn("/proc/self/task"); }

}  // namespace ostrel::testing_support
