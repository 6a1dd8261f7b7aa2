#pragma once

#include <sys/types.h>
#include <sys/uio.h>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/ErrorObject.h"
#include "platform/SmallMutex.h"
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
///
/// Small pieces, whoever writes them, wait in memory until a group of them is full, and
/// go to the file with one call: a hundred thousand lists of a few messages took three
/// times as long when each wrote its own. What was taken is not lost when the group
/// cannot be written then: it stays where it is, and nothing more is taken until it is
/// written.
class SpillFile {
 public:
  /// A group of pieces, and the largest that goes into one.
  static constexpr std::size_t kGroupBytes = 64 * 1024;
  static constexpr std::size_t kLargestOfGroup = kGroupBytes / 8;
  /// One that is filled, and one that is written.
  static constexpr std::size_t kMostBytesInMemory = 2 * kGroupBytes;

  /// A piece of the file.
  struct Extent {
    std::uint64_t begin;
    std::size_t size;
  };
  using Bytes = std::span<const std::uint8_t>;

  /// In `directory`, which must exist once something is written. After a failure,
  /// `pause` passes until it is tried again. Small pieces wait for one another where
  /// `bytesInMemory` are enough for it, and are written one by one where not.
  SpillFile(std::string directory, std::chrono::milliseconds pause,
            std::size_t bytesInMemory, const SpillCalls& calls);
  ~SpillFile();

  /// How the room of what is released is given back from now on: `later` has
  /// `giveRoomBack` called some time after, by a thread that may wait for the disk;
  /// empty: `release` does so itself. It is called with a lock held.
  void giveRoomBackLater(std::function<void()> later);
  void giveRoomBack();

  /// Writes `parts` one after the other as one new extent, which is the caller's to
  /// release. None when it cannot be written or could not be a moment ago.
  std::optional<Extent> write(std::span<const Bytes> parts);

  /// Reads an extent that is not released meanwhile. None when it was read.
  std::optional<ErrorObject> read(Extent extent, std::uint8_t* to);

  /// Gives the extents' room on the disk back, soon.
  void release(std::span<const Extent> extents);
  /// Releases `count` extents if there are no others, and says so.
  bool releaseIfAll(std::size_t count);
  /// Releases as many extents, of which nobody knows any more where they are: their room
  /// on the disk comes back with the file.
  void forget(std::size_t count);

  /// Why the latest `write` that failed did so.
  std::optional<ErrorObject> latestError() const;

  bool isOpen() const;

  /// What the pieces that are not written yet take in memory.
  std::size_t bytesInMemory() const;

 private:
  struct Group;
  struct Hole {
    std::uint64_t begin;
    std::uint64_t end;
  };

  std::optional<Extent> gather(std::span<const Bytes> parts, std::size_t size);
  std::optional<Extent> writeAlone(std::span<const Bytes> parts, std::size_t size);
  void leave(std::size_t extents);
  static void punch(int file, std::vector<Hole> holes);

  // With the lock.
  bool isReady();
  int openFile();
  std::shared_ptr<Group> beginGroup();
  bool writeFullGroup(std::unique_lock<SmallMutex>& lock);
  std::shared_ptr<Group> groupOf(Extent extent) const;
  void dropIfUnused(const std::shared_ptr<Group>& group);
  FileDescriptor dropExtents(std::size_t count);
  void noteFree(const std::shared_ptr<Group>& group);
  std::vector<Hole> takeHoles(std::size_t most);
  void fail(int error);

  const std::string directory_;
  const std::chrono::milliseconds pause_;
  const bool isGathering_;
  const SpillCalls calls_;

  // What each piece needs, on one line of the cache: several threads write them in turn.
  alignas(64) mutable SmallMutex mutex_;
  // Guarded by `mutex_`. The descriptor stays the same while there are extents.
  FileDescriptor file_;
  int error_ = 0;
  std::size_t extents_ = 0;
  std::shared_ptr<Group> filling_;  // May be none.
  std::shared_ptr<Group> full_;     // Until it is written. May be none.

  std::chrono::steady_clock::time_point retryAt_;
  std::uint64_t end_ = 0;
  // What waits to be given back: pages of groups, and pieces that were in none.
  std::vector<std::shared_ptr<Group>> freed_;
  std::vector<Hole> holes_;
  std::function<void()> giveRoomBackLater_;
  bool isRoomGivenBackLater_ = false;  // Then it keeps the file open.
  std::unordered_map<std::uint64_t, std::shared_ptr<Group>> groups_;  // By their place.
};

}  // namespace ostrel
