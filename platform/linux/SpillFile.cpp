// Extents are only ever added at the file's end, whole pages each, and leave a hole
// when they go; with the last the file goes too, and the next begins at 0. So there
// is nothing to look for when one is added, and the file's length says nothing of
// the room that it takes.
//
// A group has its place in the file from the start, so that its pieces have theirs too
// before they are written. Places of groups are numbered: an extent's place says whether
// it is a piece of one. Pieces share pages, which go when the last of them goes.
#include "platform/linux/SpillFile.h"

#include <fcntl.h>
#include <limits.h>
#include <stdlib.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <utility>
#include <vector>

#include "platform/linux/SmallFile.h"

namespace ostrel {
namespace {

constexpr std::uint64_t kPage = 4096;
constexpr mode_t kFileMode = 0600;

// A page at least, so that no two extents begin at one place.
std::uint64_t roomOf(std::size_t size) {
  return (std::max<std::size_t>(size, 1) + kPage - 1) / kPage * kPage;
}

// What is given back later is little in memory.
constexpr std::size_t kMostHoles = 4096;

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

/// The places in the file that nothing is in any more. Neighbours make one hole.
class SpillFile::Holes {
 public:
  void add(std::uint64_t begin, std::uint64_t size) {
    if (holes_.empty() || begin != holes_.back().end) holes_.push_back({begin, begin});
    holes_.back().end = begin + size;
  }
  const std::vector<Hole>& all() const { return holes_; }

 private:
  std::vector<Hole> holes_;
};

// Where the file system knows no holes, the room comes back with the file.
void SpillFile::punch(int file, const std::vector<Hole>& holes) {
  for (const Hole& hole : holes) {
    ::fallocate(file, FALLOC_FL_PUNCH_HOLE | FALLOC_FL_KEEP_SIZE,
                static_cast<off_t>(hole.begin),
                static_cast<off_t>(hole.end - hole.begin));
  }
}

/// Pieces that are written together. What a piece changes is one line of the cache.
struct alignas(64) SpillFile::Group {
  explicit Group(std::uint64_t at) : begin(at), bytes(new std::uint8_t[kGroupBytes]) {}

  bool hasRoom(std::size_t size) const { return kGroupBytes - used >= size; }

  /// A place for a piece that `fill` is called for next, by the same thread.
  Extent add(std::size_t size) {
    const Extent extent{begin + used, size};
    used += static_cast<std::uint32_t>(size);
    ++extents;
    for (std::size_t page = pageOf(extent.begin); page <= lastPageOf(extent); ++page) {
      ++extentsOfPage[page];
    }
    unfilled.fetch_add(1, std::memory_order_relaxed);
    return extent;
  }

  /// Without the lock: the piece comes from memory that nobody has looked at lately, and
  /// threads that waited for that slept at the lock, 150 ns a message.
  void fill(const Extent& extent, std::span<const Bytes> parts) {
    std::uint8_t* at = bytes.get() + (extent.begin - begin);
    for (const Bytes part : parts) at = std::copy(part.begin(), part.end(), at);
    unfilled.fetch_sub(1, std::memory_order_release);
  }
  bool isFilled() const { return unfilled.load(std::memory_order_acquire) == 0; }

  /// Pages that are free by it are added to `holes` if the group is in the file.
  void release(Extent extent, Holes& holes) {
    --extents;
    for (std::size_t page = pageOf(extent.begin); page <= lastPageOf(extent); ++page) {
      if (--extentsOfPage[page] == 0 && !bytes) holes.add(begin + page * kPage, kPage);
    }
    if (extents == 0 && !isBeingWritten) used = 0;  // It may be filled anew.
  }

  /// It is in the file. What was released meanwhile leaves holes.
  void becameWritten(Holes& holes) {
    bytes.reset();
    for (std::size_t page = 0; page * kPage < used; ++page) {
      if (extentsOfPage[page] == 0) holes.add(begin + page * kPage, kPage);
    }
  }

  const std::uint64_t begin;
  std::unique_ptr<std::uint8_t[]> bytes;  // None once they are in the file.
  std::uint32_t used = 0;
  std::uint32_t extents = 0;
  std::atomic<std::uint32_t> unfilled{0};  // Places whose pieces are still copied.
  bool isBeingWritten = false;

 private:
  std::size_t pageOf(std::uint64_t at) const {
    return static_cast<std::size_t>((at - begin) / kPage);
  }
  std::size_t lastPageOf(Extent extent) const {
    return pageOf(extent.begin + extent.size - 1);
  }

  std::array<std::uint16_t, kGroupBytes / kPage> extentsOfPage{};
};

SpillFile::SpillFile(std::string directory, std::chrono::milliseconds pause,
                     std::size_t bytesInMemory, const SpillCalls& calls)
    : directory_(std::move(directory)),
      pause_(pause),
      isGathering_(bytesInMemory >= kMostBytesInMemory),
      calls_(calls) {}

SpillFile::~SpillFile() = default;

std::optional<SpillFile::Extent> SpillFile::write(std::span<const Bytes> parts) {
  std::size_t size = 0;
  for (const Bytes part : parts) size += part.size();
  if (isGathering_ && size != 0 && size <= kLargestOfGroup) return gather(parts, size);
  return writeAlone(parts, size);
}

std::optional<SpillFile::Extent> SpillFile::gather(std::span<const Bytes> parts,
                                                   std::size_t size) {
  std::unique_lock lock(mutex_);
  for (;;) {
    if (!isReady()) return std::nullopt;
    const bool hasRoom = !filling_ || filling_->hasRoom(size);
    if (!hasRoom && !full_) full_ = std::move(filling_);
    const bool mustWait = full_ && (full_->isBeingWritten || !full_->isFilled());
    if (mustWait && filling_ && !hasRoom) break;
    if (full_ && !mustWait) {
      if (!writeFullGroup(lock)) return std::nullopt;
      continue;
    }
    if (!filling_) filling_ = beginGroup();
    ++extents_;
    Group* const group = filling_.get();
    const Extent extent = group->add(size);
    lock.unlock();
    group->fill(extent, parts);
    return extent;
  }
  // Nobody waits for the disk because of what others write.
  lock.unlock();
  return writeAlone(parts, size);
}

std::optional<SpillFile::Extent> SpillFile::writeAlone(std::span<const Bytes> parts,
                                                       std::size_t size) {
  std::vector<iovec> pieces;
  for (const Bytes part : parts) {
    if (!part.empty()) {
      pieces.push_back({const_cast<std::uint8_t*>(part.data()), part.size()});
    }
  }
  Extent extent{0, size};
  {
    const std::lock_guard lock(mutex_);
    if (!isReady()) return std::nullopt;
    extent.begin = end_;
    end_ += roomOf(size);
    ++extents_;
  }
  if (const int error = writeAll(file_.get(), pieces, extent.begin, calls_)) {
    {
      const std::lock_guard lock(mutex_);
      fail(error);
    }
    release({&extent, 1});
    return std::nullopt;
  }
  return extent;
}

// Whether the file is open and may be written.
bool SpillFile::isReady() {
  if (error_ != 0 && std::chrono::steady_clock::now() < retryAt_) return false;
  if (!file_) {
    file_.reset(openFile());
    if (!file_) fail(errno);
  }
  return static_cast<bool>(file_);
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

std::shared_ptr<SpillFile::Group> SpillFile::beginGroup() {
  const std::uint64_t place = (end_ + kGroupBytes - 1) / kGroupBytes;
  end_ = (place + 1) * kGroupBytes;
  auto group = std::make_shared<Group>(place * kGroupBytes);
  groups_.emplace(place, group);
  return group;
}

// Lets the lock go meanwhile, and takes it again. False: it cannot be written, and stays.
bool SpillFile::writeFullGroup(std::unique_lock<SmallMutex>& lock) {
  const std::shared_ptr<Group> group = full_;
  group->isBeingWritten = true;
  ++extents_;  // The file stays.
  const int file = file_.get();
  lock.unlock();
  iovec bytes{group->bytes.get(), group->used};
  const int error = writeAll(file, {&bytes, 1}, group->begin, calls_);
  lock.lock();
  group->isBeingWritten = false;
  Holes holes;
  if (error != 0) {
    fail(error);
  } else {
    full_.reset();
    group->becameWritten(holes);
  }
  dropIfUnused(group);
  lock.unlock();
  leave(holes, /*extents=*/1);
  lock.lock();
  return error == 0;
}

std::shared_ptr<SpillFile::Group> SpillFile::groupOf(Extent extent) const {
  const auto found = groups_.find(extent.begin / kGroupBytes);
  return found != groups_.end() ? found->second : nullptr;
}

// The one that is filled goes on with other pieces.
void SpillFile::dropIfUnused(const std::shared_ptr<Group>& group) {
  if (group->extents != 0 || group->isBeingWritten || group == filling_) return;
  if (group == full_) full_.reset();
  groups_.erase(group->begin / kGroupBytes);
}

// The file, to be closed, if nothing is in it any more.
FileDescriptor SpillFile::dropExtents(std::size_t count) {
  extents_ -= count;
  if (extents_ != 0) return {};
  groups_.clear();
  filling_.reset();
  full_.reset();
  end_ = 0;
  return std::move(file_);
}

void SpillFile::fail(int error) {
  error_ = error;
  retryAt_ = std::chrono::steady_clock::now() + pause_;
}

std::optional<ErrorObject> SpillFile::read(Extent extent, std::uint8_t* to) {
  int file;
  {
    const std::lock_guard lock(mutex_);
    if (const auto group = groupOf(extent); group && group->bytes) {
      std::copy_n(group->bytes.get() + (extent.begin - group->begin), extent.size, to);
      return std::nullopt;
    }
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

bool SpillFile::releaseIfAll(std::size_t count) {
  FileDescriptor last;  // Closed without the lock: a large file takes its time.
  const std::lock_guard lock(mutex_);
  if (count != extents_) return false;
  last = dropExtents(count);
  return true;
}

void SpillFile::release(std::span<const Extent> extents) {
  if (extents.empty() || releaseIfAll(extents.size())) return;
  Holes holes;
  {
    const std::lock_guard lock(mutex_);
    for (const Extent extent : extents) {
      if (const auto group = groupOf(extent)) {
        group->release(extent, holes);
        dropIfUnused(group);
      } else {
        holes.add(extent.begin, roomOf(extent.size));
      }
    }
  }
  leave(holes, extents.size());
}

void SpillFile::forget(std::size_t count) { leave(Holes(), count); }

// The extents, which kept the file open until now, are none any more. Without the lock,
// as holes take their time too.
void SpillFile::leave(const Holes& holes, std::size_t extents) {
  if (!isLeftForLater(holes.all())) punch(file_.get(), holes.all());
  FileDescriptor last;
  const std::lock_guard lock(mutex_);
  last = dropExtents(extents);
}

bool SpillFile::isLeftForLater(const std::vector<Hole>& holes) {
  const std::lock_guard lock(mutex_);
  if (!giveRoomBackLater_ || holes_.size() + holes.size() > kMostHoles) return false;
  holes_.insert(holes_.end(), holes.begin(), holes.end());
  if (!holes_.empty() && !std::exchange(isRoomGivenBackLater_, true)) {
    ++extents_;  // The file stays.
    giveRoomBackLater_();
  }
  return true;
}

void SpillFile::giveRoomBackLater(std::function<void()> later) {
  const std::lock_guard lock(mutex_);
  giveRoomBackLater_ = std::move(later);
}

void SpillFile::giveRoomBack() {
  FileDescriptor last;
  std::vector<Hole> holes;
  std::unique_lock lock(mutex_);
  if (!isRoomGivenBackLater_) return;
  holes.swap(holes_);
  if (extents_ > 1) {  // Else it comes back with the file.
    const int file = file_.get();
    lock.unlock();
    punch(file, holes);
    lock.lock();
  }
  if (!holes_.empty() && giveRoomBackLater_) {
    giveRoomBackLater_();
    return;
  }
  isRoomGivenBackLater_ = false;
  last = dropExtents(1);
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

std::size_t SpillFile::bytesInMemory() const {
  const std::lock_guard lock(mutex_);
  return (filling_ ? kGroupBytes : 0) + (full_ ? kGroupBytes : 0);
}

}  // namespace ostrel
