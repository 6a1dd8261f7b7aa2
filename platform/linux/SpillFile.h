#pragma once

#include <sys/types.h>
#include <sys/uio.h>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/ErrorObject.h"
#include "platform/linux/FileDescriptor.h"

namespace ostrel {

/// The system calls whose failures tests bring about. Each as the system's own.
struct SpillCalls {
  int (*open)(const char* path, int flags, mode_t mode);
  int (*mkostemp)(char* path, int flags);
  ssize_t (*pwritev)(int file, const iovec* parts, int count, off_t begin);
  ssize_t (*pread)(int file, void* to, std::size_t size, off_t begin);

  static SpillCalls system();
};

/// A file without a name, for what is too much for the memory: it is open, at one
/// descriptor, only while something is in it. Any thread.
class SpillFile {
 public:
  /// A piece of the file.
  struct Extent {
    std::uint64_t begin;
    std::size_t size;
  };
  using Bytes = std::span<const std::uint8_t>;

  /// In `directory`, which must exist once something is written. After a failure,
  /// `pause` passes until it is tried again.
  SpillFile(std::string directory, std::chrono::milliseconds pause,
            const SpillCalls& calls);

  /// Writes `parts` one after the other as one new extent, which is the caller's to
  /// release. None when it cannot be written or could not be a moment ago.
  std::optional<Extent> write(std::span<const Bytes> parts);

  /// Reads an extent that is not released meanwhile. Else the error.
  std::optional<ErrorObject> read(Extent extent, std::uint8_t* to);

  /// Gives the extents' room on the disk back.
  void release(std::span<const Extent> extents);

  /// Why the latest `write` that failed did so.
  std::optional<ErrorObject> latestError() const;

  bool isOpen() const;

 private:
  int openFile();
  std::optional<Extent> begin(std::size_t size);
  void fail(int error);

  const std::string directory_;
  const std::chrono::milliseconds pause_;
  const SpillCalls calls_;

  mutable std::mutex mutex_;
  // Guarded by `mutex_`. The descriptor stays the same while there are extents.
  FileDescriptor file_;
  std::uint64_t end_ = 0;
  std::size_t extents_ = 0;
  int error_ = 0;
  std::chrono::steady_clock::time_point retryAt_;
};

}  // namespace ostrel
