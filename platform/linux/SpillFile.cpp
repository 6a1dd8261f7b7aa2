// Extents are only ever added at the file's end, whole pages each, and leave a hole
// when they go; with the last the file goes too, and the next begins at 0. So there
// is nothing to look for when one is added, and the file's length says nothing of
// the room that it takes.
#include "platform/linux/SpillFile.h"

#include <fcntl.h>
#include <limits.h>
#include <stdlib.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <utility>

#include "platform/linux/SmallFile.h"

namespace ostrel {
namespace {

constexpr std::uint64_t kPage = 4096;
constexpr mode_t kFileMode = 0600;

std::uint64_t roomOf(std::size_t size) { return (size + kPage - 1) / kPage * kPage; }

void punchHole(int file, std::uint64_t begin, std::uint64_t size) {
  // Where there are no holes, the room comes back with the file.
  ::fallocate(file, FALLOC_FL_PUNCH_HOLE | FALLOC_FL_KEEP_SIZE, static_cast<off_t>(begin),
              static_cast<off_t>(size));
}

// 0, or the error.
int writeAll(int file, std::span<iovec> parts, std::uint64_t begin,
             const SpillCalls& calls) {
  while (!parts.empty()) {
    const auto count = static_cast<int>(std::min<std::size_t>(parts.size(), IOV_MAX));
    const ssize_t written =
        calls.pwritev(file, parts.data(), count, static_cast<off_t>(begin));
    if (written < 0 && errno == EINTR) continue;
    if (written < 0) return errno;
    if (written == 0) return ENOSPC;
    begin += static_cast<std::uint64_t>(written);
    auto left = static_cast<std::size_t>(written);
    while (!parts.empty() && left >= parts.front().iov_len) {
      left -= parts.front().iov_len;
      parts = parts.subspan(1);
    }
    if (left != 0) {
      parts.front().iov_base = static_cast<char*>(parts.front().iov_base) + left;
      parts.front().iov_len -= left;
    }
  }
  return 0;
}

}  // namespace

SpillCalls SpillCalls::system() {
  return {
      [](const char* path, int flags, mode_t mode) { return ::open(path, flags, mode); },
      ::mkostemp, ::pwritev, ::pread};
}

SpillFile::SpillFile(std::string directory, std::chrono::milliseconds pause,
                     const SpillCalls& calls)
    : directory_(std::move(directory)), pause_(pause), calls_(calls) {}

std::optional<SpillFile::Extent> SpillFile::write(std::span<const Bytes> parts) {
  std::vector<iovec> pieces;
  std::size_t size = 0;
  for (const Bytes part : parts) {
    if (part.empty()) continue;
    pieces.push_back({const_cast<std::uint8_t*>(part.data()), part.size()});
    size += part.size();
  }
  const auto extent = begin(size);
  if (!extent) return std::nullopt;
  if (const int error = writeAll(file_.get(), pieces, extent->begin, calls_)) {
    fail(error);
    release({&*extent, 1});
    return std::nullopt;
  }
  return extent;
}

std::optional<SpillFile::Extent> SpillFile::begin(std::size_t size) {
  const std::lock_guard lock(mutex_);
  if (error_ != 0 && std::chrono::steady_clock::now() < retryAt_) return std::nullopt;
  if (!file_) {
    file_.reset(openFile());
    if (!file_) {
      error_ = errno;
      retryAt_ = std::chrono::steady_clock::now() + pause_;
      return std::nullopt;
    }
  }
  const Extent extent{end_, size};
  end_ += roomOf(size);
  ++extents_;
  return extent;
}

// -1, with errno set, when there can be none.
int SpillFile::openFile() {
  const int file =
      calls_.open(directory_.c_str(), O_TMPFILE | O_EXCL | O_RDWR | O_CLOEXEC, kFileMode);
  if (file >= 0 || (errno != EOPNOTSUPP && errno != EISDIR && errno != EINVAL)) {
    return file;
  }
  // A file system without files that have no name.
  std::string path = directory_ + "/.entries-XXXXXX";
  const int named = calls_.mkostemp(path.data(), O_CLOEXEC);
  if (named >= 0) ::unlink(path.c_str());
  return named;
}

void SpillFile::fail(int error) {
  const std::lock_guard lock(mutex_);
  error_ = error;
  retryAt_ = std::chrono::steady_clock::now() + pause_;
}

std::optional<ErrorObject> SpillFile::read(Extent extent, std::uint8_t* to) {
  int file;
  {
    const std::lock_guard lock(mutex_);
    file = file_.get();
  }
  std::size_t done = 0;
  while (done < extent.size) {
    const ssize_t size = calls_.pread(file, to + done, extent.size - done,
                                      static_cast<off_t>(extent.begin + done));
    if (size < 0 && errno == EINTR) continue;
    if (size <= 0) return errorOfPath(size < 0 ? errno : EIO, directory_);
    done += static_cast<std::size_t>(size);
  }
  return std::nullopt;
}

void SpillFile::release(std::span<const Extent> extents) {
  if (extents.empty()) return;
  FileDescriptor last;  // Closed without the lock: a large file takes its time.
  const std::lock_guard lock(mutex_);
  extents_ -= extents.size();
  if (extents_ == 0) {
    last = std::move(file_);
    end_ = 0;
    return;
  }
  std::uint64_t begin = extents.front().begin;
  std::uint64_t end = begin;
  for (const Extent extent : extents) {
    if (extent.begin != end) {
      punchHole(file_.get(), begin, end - begin);
      begin = extent.begin;
    }
    end = extent.begin + roomOf(extent.size);
  }
  punchHole(file_.get(), begin, end - begin);
}

std::optional<ErrorObject> SpillFile::latestError() const {
  const std::lock_guard lock(mutex_);
  if (error_ == 0) return std::nullopt;
  return errorOfPath(error_, directory_);
}

bool SpillFile::isOpen() const {
  const std::lock_guard lock(mutex_);
  return static_cast<bool>(file_);
}

}  // namespace ostrel
