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

// What waits to be given back, of groups and of others: little in memory. Where there is
// more, whoever adds to it gives a few back, so that nobody is held up for long.
constexpr std::size_t kMostWaiting = 16'384;
constexpr std::size_t kFewAtOnce = 4;

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

// Neighbours make one hole. Where the file system knows none, the room comes back with
// the file. Without the lock.
void SpillFile::punch(int file, std::vector<Hole> holes) {
  std::sort(holes.begin(), holes.end(),
            [](const Hole& a, const Hole& b) { return a.begin < b.begin; });
  for (auto hole = holes.begin(); hole != holes.end();) {
    const std::uint64_t begin = hole->begin;
    std::uint64_t end = begin;
    for (; hole != holes.end() && hole->begin == end; ++hole) end = hole->end;
    ::fallocate(file, FALLOC_FL_PUNCH_HOLE | FALLOC_FL_KEEP_SIZE,
                static_cast<off_t>(begin), static_cast<off_t>(end - begin));
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

  /// Pages of a group that is in the file are free then.
  void release(Extent extent) {
    --extents;
    for (std::size_t page = pageOf(extent.begin); page <= lastPageOf(extent); ++page) {
      if (--extentsOfPage[page] == 0 && !bytes) freePages |= bitOf(page);
    }
    if (extents == 0 && !isBeingWritten) used = 0;  // It may be filled anew.
  }

  /// It is in the file. What was released meanwhile is free.
  void becameWritten() {
    bytes.reset();
    for (std::size_t page = 0; page * kPage < used; ++page) {
      if (extentsOfPage[page] == 0) freePages |= bitOf(page);
    }
  }

  /// The free pages, which are given back then; neighbours make one hole.
  void takeHoles(std::vector<Hole>& holes) {
    for (std::size_t page = 0; page < kPages; ++page) {
      if ((freePages & bitOf(page)) == 0) continue;
      const std::uint64_t at = begin + page * kPage;
      if (holes.empty() || holes.back().end != at) holes.push_back({at, at});
      holes.back().end = at + kPage;
    }
    freePages = 0;
  }

  const std::uint64_t begin;
  std::unique_ptr<std::uint8_t[]> bytes;  // None once they are in the file.
  std::uint32_t used = 0;
  std::uint32_t extents = 0;
  std::atomic<std::uint32_t> unfilled{0};  // Places whose pieces are still copied.
  std::uint32_t freePages = 0;             // In the file, and not given back; a bit each.
  bool isBeingWritten = false;
  bool isListedFreed = false;  // In `freed_`.

 private:
  static constexpr std::size_t kPages = kGroupBytes / kPage;
  static_assert(kPages <= 32);

  static std::uint32_t bitOf(std::size_t page) { return std::uint32_t{1} << page; }
  std::size_t pageOf(std::uint64_t at) const {
    return static_cast<std::size_t>((at - begin) / kPage);
  }
  std::size_t lastPageOf(Extent extent) const {
    return pageOf(extent.begin + extent.size - 1);
  }

  std::array<std::uint16_t, kPages> extentsOfPage{};
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
  if (error != 0) {
    fail(error);
  } else {
    full_.reset();
    group->becameWritten();
    noteFree(group);
  }
  dropIfUnused(group);
  lock.unlock();
  leave(/*extents=*/1);
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
  holes_.clear();
  freed_.clear();
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
  {
    const std::lock_guard lock(mutex_);
    for (const Extent extent : extents) {
      if (const auto group = groupOf(extent)) {
        group->release(extent);
        noteFree(group);
        dropIfUnused(group);
      } else {
        holes_.push_back({extent.begin, extent.begin + roomOf(extent.size)});
      }
    }
  }
  leave(extents.size());
}

void SpillFile::forget(std::size_t count) { leave(count); }

// The extents, which kept the file open until now, are none any more. What is free is
// given back without the lock, as it takes its time too.
void SpillFile::leave(std::size_t extents) {
  FileDescriptor last;
  std::unique_lock lock(mutex_);
  const std::size_t waiting = holes_.size() + freed_.size();
  const bool isLater = giveRoomBackLater_ && waiting <= kMostWaiting;
  if (isLater && waiting != 0 && !std::exchange(isRoomGivenBackLater_, true)) {
    ++extents_;  // The file stays.
    giveRoomBackLater_();
  }
  if (!isLater && waiting != 0) {
    std::vector<Hole> holes = takeHoles(giveRoomBackLater_ ? kFewAtOnce : waiting);
    const int file = file_.get();
    lock.unlock();
    punch(file, std::move(holes));
    lock.lock();
  }
  last = dropExtents(extents);
}

// What was left last goes first. In no order.
std::vector<SpillFile::Hole> SpillFile::takeHoles(std::size_t most) {
  std::vector<Hole> all;
  for (; most != 0 && !freed_.empty(); --most) {
    freed_.back()->takeHoles(all);
    freed_.back()->isListedFreed = false;
    freed_.pop_back();
  }
  for (; most != 0 && !holes_.empty(); --most) {
    all.push_back(holes_.back());
    holes_.pop_back();
  }
  return all;
}

void SpillFile::noteFree(const std::shared_ptr<Group>& group) {
  if (group->freePages == 0 || std::exchange(group->isListedFreed, true)) return;
  freed_.push_back(group);
}

void SpillFile::giveRoomBackLater(std::function<void()> later) {
  const std::lock_guard lock(mutex_);
  giveRoomBackLater_ = std::move(later);
}

void SpillFile::giveRoomBack() {
  FileDescriptor last;
  std::unique_lock lock(mutex_);
  if (!isRoomGivenBackLater_) return;
  std::vector<Hole> holes = takeHoles(SIZE_MAX);
  if (extents_ > 1) {  // Else it comes back with the file.
    const int file = file_.get();
    lock.unlock();
    punch(file, std::move(holes));
    lock.lock();
  }
  if ((!holes_.empty() || !freed_.empty()) && giveRoomBackLater_) {
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
