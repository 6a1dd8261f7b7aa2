// A list's entries are copied into chunks of memory, each twice the one before, until
// they have taken the list's share. Then they are written to the file together, as
// one extent, and of the chunks only the last stays, to be filled and written again
// and again. So the file has a list's entries in large pieces, of which a reader has
// one in memory at a time, and what is in the chunks always comes after what is in
// the file. An entry lies in one chunk, or in one extent of its own, and is never
// split. Where the memory of all lists is used up, a short list has no chunk: each of its
// entries is an extent.
//
// A snapshot copies the places, not the entries. Chunks are never written before
// their `used`, and not used again once a snapshot has seen them; extents are
// released with the last of the list and its snapshots.
#include "platform/linux/FileEntryStorage.h"

#include <algorithm>
#include <atomic>
#include <utility>
#include <vector>

#include "platform/KeptBytes.h"
#include "platform/Logging.h"
#include "platform/linux/ExtentList.h"
#include "platform/linux/Limits.h"
#include "platform/linux/Share.h"

namespace ostrel {
namespace {

// A list without entries has no chunk, a short one a small chunk, and a long one
// wastes little at the end of its last.
constexpr std::size_t kFirstChunk = 1024;
constexpr std::size_t kLargestChunk = 128 * 1024;

// A list is short as long as what names the places of its entries is no more than a
// chunk.
constexpr std::size_t kExtentsOfShortList = kFirstChunk / sizeof(SpillFile::Extent);

// What readers have in memory, but for an entry that is larger alone.
constexpr std::size_t kLargestExtent = 2 * kLargestChunk;

constexpr std::chrono::milliseconds kHolesTogether{200};

using Bytes = StoredEntries::Bytes;

}  // namespace

// Outlives the storage as long as a list or a snapshot is left.
struct FileEntryStorage::State {
  State(std::string directory, const Limits& given, const SpillCalls& calls)
      : limits(given),
        memory(given.bytesInMemory - given.bytesOfFile),
        file(std::move(directory), given.pauseOfFile, given.bytesOfFile, calls) {}

  const Limits limits;
  Share memory;  // Of the lists.
  SpillFile file;
  std::atomic<std::uint64_t> refused{0};
};

/// Memory that is counted while it lives. Whoever makes it has counted it.
class FileEntryStorage::Memory {
 public:
  Memory(std::shared_ptr<State> state, std::size_t size)
      : state_(std::move(state)), size_(size), bytes_(new std::uint8_t[size]) {}
  Memory(const Memory&) = delete;
  Memory& operator=(const Memory&) = delete;
  ~Memory() { state_->memory.give(size_); }

  std::size_t size() const { return size_; }
  std::uint8_t* data() { return bytes_.get(); }

 private:
  const std::shared_ptr<State> state_;
  const std::size_t size_;
  const std::unique_ptr<std::uint8_t[]> bytes_;
};

class FileEntryStorage::EntriesSnapshot final : public StoredEntries::Snapshot {
 public:
  struct Part {
    std::shared_ptr<Memory> memory;
    std::size_t size;
  };

  EntriesSnapshot(ReporterID session, std::shared_ptr<State> state,
                  std::shared_ptr<const ExtentList> spilled, std::vector<Part> parts)
      : session_(session),
        state_(std::move(state)),
        spilled_(std::move(spilled)),
        view_(spilled_ ? spilled_->view() : ExtentList::View()),
        parts_(std::move(parts)) {}

  bool forEachRun(const StoredEntries::RunCallback& callback) const override {
    if (const auto error = view_.forEach(callback)) {
      OSTREL_LOG_ERROR(processLogScope, "%lli: cannot read the session's list back: %@",
                       session_, *error);
      return false;
    }
    for (const Part& part : parts_) callback({part.memory->data(), part.size});
    return true;
  }

 private:
  const ReporterID session_;
  const std::shared_ptr<State> state_;
  const std::shared_ptr<const ExtentList> spilled_;  // Keeps what the view shows.
  const ExtentList::View view_;
  const std::vector<Part> parts_;
};

class FileEntryStorage::Entries final : public StoredEntries {
 public:
  Entries(ReporterID session, std::shared_ptr<State> state)
      : session_(session), state_(std::move(state)) {}

  bool append(std::span<const Bytes> parts,
              const std::shared_ptr<PayloadAccount>& account) override {
    std::size_t size = 0;
    for (const Bytes part : parts) size += part.size();
    if (!kept_.keep(account, size)) {
      return refuse("its client's user has no room left for more");
    }
    if (place(parts, size)) return true;
    kept_.undo(account, size);
    const auto error = state_->file.latestError();
    return refuse(error ? error->description : "no memory is left for lists");
  }

  std::shared_ptr<const Snapshot> snapshot() override {
    noteUsed();
    std::vector<EntriesSnapshot::Part> parts;
    for (Chunk& chunk : chunks_) {
      if (chunk.used == 0) continue;
      chunk.isShared = true;
      parts.push_back({chunk.memory, chunk.used});
    }
    return std::make_shared<const EntriesSnapshot>(session_, state_, spilled_,
                                                   std::move(parts));
  }

 private:
  struct Chunk {
    std::shared_ptr<Memory> memory;
    std::size_t used = 0;   // Of the last: as far as `noteUsed` has told.
    bool isShared = false;  // With a snapshot.

    std::uint8_t* end() const { return memory->data() + used; }
    std::size_t left() const { return memory->size() - used; }
  };
  enum class Share { kOfList, kOfAll };
  enum class Placed { kThere, kInFile, kNowhere };

  // Nearly always there is room in the last chunk, and only the list itself is looked at:
  // of a hundred thousand lists each of the three pieces of memory between it and the
  // chunk's bytes was another 100 ns away.
  bool place(std::span<const Bytes> parts, std::size_t size) {
    if (size > left_) {
      noteUsed();
      const Placed placed = findRoom(parts, size);
      at_ = chunks_.empty() ? nullptr : chunks_.back().end();
      left_ = chunks_.empty() ? 0 : chunks_.back().left();
      if (placed != Placed::kThere) return placed == Placed::kInFile;
    }
    for (const Bytes part : parts) at_ = std::copy(part.begin(), part.end(), at_);
    left_ -= size;
    return true;
  }

  void noteUsed() {
    if (!chunks_.empty()) chunks_.back().used = chunks_.back().memory->size() - left_;
  }

  Placed findRoom(std::span<const Bytes> parts, std::size_t size) {
    if (addChunk(size, Share::kOfList)) return Placed::kThere;
    if (isShort() && writeToFile(parts)) return Placed::kInFile;
    if (makeRoom(size)) return Placed::kThere;
    if (isMemoryEmpty() && writeToFile(parts)) return Placed::kInFile;
    return addChunk(size, Share::kOfAll) ? Placed::kThere : Placed::kNowhere;
  }

  // Where memory is short, a short list takes none: its entries go into the file's group
  // at once, which is at hand, and not first into a chunk of its own, which is far away
  // among those of a hundred thousand lists.
  bool isShort() const {
    return chunks_.empty() && (!spilled_ || spilled_->size() < kExtentsOfShortList);
  }

  bool makeRoom(std::size_t bytes) {
    if (!spill()) return false;
    if (chunks_.empty() && bytes <= kLargestChunk) beginChunk();
    return hasRoom(bytes);
  }

  bool isMemoryEmpty() const {
    return std::all_of(chunks_.begin(), chunks_.end(),
                       [](const Chunk& chunk) { return chunk.used == 0; });
  }

  bool hasRoom(std::size_t bytes) const {
    return !chunks_.empty() && chunks_.back().left() >= bytes;
  }

  // A chunk with room for `bytes`, within the list's share of the memory or only
  // within that of all.
  bool addChunk(std::size_t bytes, Share share) {
    if (share == Share::kOfAll) {
      return takeChunk(std::max(bytes, kLargestChunk)) || takeChunk(bytes);
    }
    if (spilled_) return false;
    std::size_t taken = 0;
    for (const Chunk& chunk : chunks_) taken += chunk.memory->size();
    const std::size_t wanted =
        chunks_.empty() ? kFirstChunk
                        : std::min(2 * chunks_.back().memory->size(), kLargestChunk);
    const std::size_t size = std::max(wanted, bytes);
    if (taken + size > state_->limits.listBytesInMemory) return false;
    if (!state_->memory.take(size)) return false;
    pushChunk(size);
    return true;
  }

  bool takeChunk(std::size_t size) {
    const bool isFirst = chunks_.empty() && size <= kFirstChunk;
    if (isFirst) {
      state_->memory.takeAnyway(size);
    } else if (!state_->memory.take(size)) {
      return false;
    }
    pushChunk(size);
    return true;
  }

  void pushChunk(std::size_t size) {
    chunks_.push_back({std::make_shared<Memory>(state_, size)});
  }

  // Moves everything from memory to the file. False: that cannot be written, and
  // what was left is in memory.
  bool spill() {
    while (!isMemoryEmpty()) {
      std::vector<Bytes> parts;
      std::size_t size = 0;
      for (const Chunk& chunk : chunks_) {
        // Never an extent of nothing: the last chunk that was written may be empty still.
        if (size != 0 && size + chunk.used > kLargestExtent) break;
        parts.emplace_back(chunk.memory->data(), chunk.used);
        size += chunk.used;
      }
      if (!writeToFile(parts)) return false;
      Chunk last = std::move(chunks_[parts.size() - 1]);
      chunks_.erase(chunks_.begin(),
                    chunks_.begin() + static_cast<std::ptrdiff_t>(parts.size()));
      if (chunks_.empty()) renewChunk(std::move(last));
    }
    return true;
  }

  bool writeToFile(std::span<const Bytes> parts) {
    if (spilled_) return spilled_->write(parts);
    auto spilled =
        std::make_shared<ExtentList>(std::shared_ptr<SpillFile>(state_, &state_->file));
    if (!spilled->write(parts)) return false;
    spilled_ = std::move(spilled);
    return true;
  }

  // Goes on with the memory of the chunk that was written, or with more if there is.
  void renewChunk(Chunk written) {
    const std::size_t size = written.memory->size();
    if (written.isShared || size > kLargestChunk) {
      beginChunk();
    } else if (size == kLargestChunk || !takeChunk(std::min(2 * size, kLargestChunk))) {
      written.used = 0;
      chunks_.push_back(std::move(written));
    }
  }

  void beginChunk() {
    if (!takeChunk(kLargestChunk)) takeChunk(kFirstChunk);
  }

  bool refuse(std::string_view reason) {
    ++state_->refused;
    if (!std::exchange(hasRefused_, true)) {
      OSTREL_LOG_ERROR(processLogScope,
                       "%lli: the session's list goes without some messages: %@",
                       session_, reason);
    }
    return false;
  }

  // What a message needs, side by side.
  std::uint8_t* at_ = nullptr;  // The end of the last chunk's entries.
  std::size_t left_ = 0;        // From there to the chunk's end.
  KeptBytes kept_;

  const ReporterID session_;
  const std::shared_ptr<State> state_;
  std::vector<Chunk> chunks_;  // What comes after the file.
  std::shared_ptr<ExtentList> spilled_;
  bool hasRefused_ = false;
};

FileEntryStorage::Limits FileEntryStorage::Limits::ofService() {
  return {limits::kListBytesInMemory, limits::kListsBytesInMemory,
          limits::kPauseOfListsFile, limits::kListsBytesBehind};
}

FileEntryStorage::FileEntryStorage(std::string directory, ConcurrentQueue* disposal)
    : FileEntryStorage(std::move(directory), Limits::ofService(), SpillCalls::system(),
                       disposal) {}

FileEntryStorage::FileEntryStorage(std::string directory, const Limits& limits,
                                   const SpillCalls& calls, ConcurrentQueue* disposal)
    : state_(std::make_shared<State>(std::move(directory), limits, calls)) {
  if (disposal == nullptr) return;
  // A hole waits until the file system's journal is written: a fifth of a second on the
  // thread that serves, when many clients left together. Holes that come soon after one
  // another are often one.
  state_->file.giveRoomBackLater([disposal, state = std::weak_ptr<State>(state_)] {
    disposal->asyncAfter(kHolesTogether, [state] {
      if (const auto still = state.lock()) still->file.giveRoomBack();
    });
  });
}

FileEntryStorage::~FileEntryStorage() { state_->file.giveRoomBackLater(nullptr); }

std::unique_ptr<StoredEntries> FileEntryStorage::makeEntries(ReporterID session) {
  return std::make_unique<Entries>(session, state_);
}

std::uint64_t FileEntryStorage::refusedEntries() const { return state_->refused; }

std::size_t FileEntryStorage::bytesInMemory() const {
  return state_->memory.used() + state_->file.bytesInMemory();
}

bool FileEntryStorage::hasFile() const { return state_->file.isOpen(); }

}  // namespace ostrel
