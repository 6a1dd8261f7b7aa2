#pragma once

#include <fcntl.h>
#include <stdlib.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <functional>

#include "platform/linux/SpillFile.h"

namespace ostrel::testing_support {

/// What the calls of a `SpillFile` do in tests: as the system's own unless told
/// otherwise. One at a time; ends with the test.
class SpillFaults {
 public:
  std::atomic<int> openError{0};
  std::atomic<int> writeError{0};
  std::atomic<int> readError{0};
  std::atomic<bool> writesAreShort{false};
  std::atomic<int> writes{0};
  /// Called in each write; set while there is none.
  std::function<void()> inWrite;

  SpillFaults() { current = this; }
  ~SpillFaults() { current = nullptr; }
  SpillFaults(const SpillFaults&) = delete;
  SpillFaults& operator=(const SpillFaults&) = delete;

  SpillCalls calls() const {
    return {[](const char* path, int flags, mode_t mode) {
              return failingWith<int>(current->openError,
                                      [&] { return ::open(path, flags, mode); });
            },
            ::mkostemp,
            [](int file, const iovec* parts, int count, off_t begin) {
              ++current->writes;
              if (current->inWrite) current->inWrite();
              return failingWith<ssize_t>(current->writeError, [&] {
                if (!current->writesAreShort) return ::pwritev(file, parts, count, begin);
                return ::pwrite(file, parts->iov_base, (parts->iov_len + 1) / 2, begin);
              });
            },
            [](int file, void* to, std::size_t size, off_t begin) {
              return failingWith<ssize_t>(current->readError,
                                          [&] { return ::pread(file, to, size, begin); });
            }};
  }

 private:
  template <typename Result, typename Call>
  static Result failingWith(int error, Call call) {
    if (error == 0) return call();
    errno = error;
    return -1;
  }

  static inline SpillFaults* current = nullptr;
};

}  // namespace ostrel::testing_support
