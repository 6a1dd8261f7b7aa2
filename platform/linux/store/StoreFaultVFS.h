// A layer below SQLite for tests: it makes calls fail, and it remembers what was
// written since the last sync so that a power cut can be played at any point.
#pragma once

#include <sqlite3.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <cstring>
#include <map>
#include <mutex>
#include <random>
#include <string>
#include <vector>

namespace ostrel {

/// Which call of the file layer fails.
struct FaultPlan {
  enum class Kind { kAny, kWrite, kSync };

  Kind kind = Kind::kAny;
  int code = SQLITE_IOERR;  // Of writes; others fail with their own kind of it.
  std::int64_t after = -1;  // Calls that succeed before; -1: none fails.
  bool isForEver = false;
  std::int64_t second = 0;   // So many calls after the first one more fails; 0: none.
  bool endsProcess = false;  // In place of failing, with the status `FaultVFS::kEnded`.
};

/// One change of a file on its way to the disk.
struct FileEvent {
  enum class Kind { kWrite, kTruncate, kSync, kDelete, kMark };

  Kind kind;
  std::string file;
  std::int64_t offset = 0;  // Of a truncation: the size. Of a mark: its number.
  std::string bytes;
};

/// Registered once for the process under `kName`.
class FaultVFS {
 public:
  static constexpr const char* kName = "ostrel-faults";
  static constexpr int kEnded = 9;

  static FaultVFS& instance() {
    static FaultVFS vfs;
    return vfs;
  }

  void setPlan(const FaultPlan& plan) {
    const std::lock_guard lock(mutex_);
    plan_ = plan;
    calls_ = 0;
    failed_ = 0;
  }
  void clearPlan() { setPlan(FaultPlan()); }
  /// Calls that failed under the present plan.
  std::int64_t failed() const {
    const std::lock_guard lock(mutex_);
    return failed_;
  }

  /// A sync does nothing: for tests that do not cut.
  void setSkipsSync(bool skips) { skipsSync_ = skips; }

  void startRecording() {
    const std::lock_guard lock(mutex_);
    isRecording_ = true;
    events_.clear();
  }
  std::vector<FileEvent> stopRecording() {
    const std::lock_guard lock(mutex_);
    isRecording_ = false;
    return std::move(events_);
  }
  /// Notes that everything up to `number` has been acknowledged.
  void mark(std::int64_t number) {
    record({FileEvent::Kind::kMark, std::string(), number, std::string()});
  }

 private:
  struct File : sqlite3_file {
    sqlite3_file* below;
    char name[512];
  };

  FaultVFS() : below_(sqlite3_vfs_find(nullptr)) {
    vfs_ = *below_;
    vfs_.zName = kName;
    vfs_.szOsFile = static_cast<int>(sizeof(File)) + below_->szOsFile;
    vfs_.pNext = nullptr;
    vfs_.pAppData = this;
    vfs_.xOpen = open;
    vfs_.xDelete = remove;
    sqlite3_vfs_register(&vfs_, /*makeDflt=*/0);
    makeMethods();
  }

  bool mustFail(FaultPlan::Kind kind, int* code) {
    const std::lock_guard lock(mutex_);
    if (plan_.after < 0) return false;
    if (plan_.kind != FaultPlan::Kind::kAny && plan_.kind != kind) return false;
    const std::int64_t call = calls_++;
    const bool isSecond = plan_.second > 0 && call == plan_.after + plan_.second;
    if (call < plan_.after) return false;
    if (call > plan_.after && !plan_.isForEver && !isSecond) return false;
    if (plan_.endsProcess) ::_exit(kEnded);
    ++failed_;
    if (code != nullptr) *code = plan_.code;
    return true;
  }

  void record(FileEvent event) {
    const std::lock_guard lock(mutex_);
    if (isRecording_) events_.push_back(std::move(event));
  }

  static File* of(sqlite3_file* file) { return static_cast<File*>(file); }
  static const sqlite3_io_methods* below(sqlite3_file* file) {
    return of(file)->below->pMethods;
  }

  static int open(sqlite3_vfs*, const char* name, sqlite3_file* out, int flags,
                  int* outFlags) {
    FaultVFS& self = instance();
    File* file = of(out);
    file->pMethods = nullptr;
    if (self.mustFail(FaultPlan::Kind::kAny, nullptr)) return SQLITE_CANTOPEN;
    file->below = reinterpret_cast<sqlite3_file*>(file + 1);
    std::strncpy(file->name, name != nullptr ? name : "", sizeof file->name - 1);
    file->name[sizeof file->name - 1] = '\0';
    const int code = self.below_->xOpen(self.below_, name, file->below, flags, outFlags);
    if (file->below->pMethods != nullptr) file->pMethods = &self.methods_;
    return code;
  }

  static int remove(sqlite3_vfs*, const char* name, int syncDirectory) {
    FaultVFS& self = instance();
    if (self.mustFail(FaultPlan::Kind::kAny, nullptr)) return SQLITE_IOERR_DELETE;
    const int code = self.below_->xDelete(self.below_, name, syncDirectory);
    if (code == SQLITE_OK) self.record({FileEvent::Kind::kDelete, name, 0, {}});
    return code;
  }

  static int read(sqlite3_file* file, void* bytes, int size, sqlite3_int64 offset) {
    if (instance().mustFail(FaultPlan::Kind::kAny, nullptr)) return SQLITE_IOERR_READ;
    return below(file)->xRead(of(file)->below, bytes, size, offset);
  }

  static int write(sqlite3_file* file, const void* bytes, int size,
                   sqlite3_int64 offset) {
    int code = SQLITE_OK;
    if (instance().mustFail(FaultPlan::Kind::kWrite, &code)) return code;
    instance().record(
        {FileEvent::Kind::kWrite, of(file)->name, offset,
         std::string(static_cast<const char*>(bytes), static_cast<std::size_t>(size))});
    return below(file)->xWrite(of(file)->below, bytes, size, offset);
  }

  static int truncate(sqlite3_file* file, sqlite3_int64 size) {
    if (instance().mustFail(FaultPlan::Kind::kAny, nullptr)) {
      return SQLITE_IOERR_TRUNCATE;
    }
    instance().record({FileEvent::Kind::kTruncate, of(file)->name, size, {}});
    return below(file)->xTruncate(of(file)->below, size);
  }

  static int sync(sqlite3_file* file, int flags) {
    if (instance().mustFail(FaultPlan::Kind::kSync, nullptr)) return SQLITE_IOERR_FSYNC;
    if (instance().skipsSync_) return SQLITE_OK;
    const int code = below(file)->xSync(of(file)->below, flags);
    instance().record({FileEvent::Kind::kSync, of(file)->name, 0, {}});
    return code;
  }

  static int fileSize(sqlite3_file* file, sqlite3_int64* size) {
    if (instance().mustFail(FaultPlan::Kind::kAny, nullptr)) return SQLITE_IOERR_FSTAT;
    return below(file)->xFileSize(of(file)->below, size);
  }

  void makeMethods() {
    methods_.iVersion = 2;  // Without memory mapping of the database itself.
    methods_.xClose = [](sqlite3_file* file) {
      return below(file)->xClose(of(file)->below);
    };
    methods_.xRead = read;
    methods_.xWrite = write;
    methods_.xTruncate = truncate;
    methods_.xSync = sync;
    methods_.xFileSize = fileSize;
    methods_.xLock = [](sqlite3_file* file, int level) {
      if (instance().mustFail(FaultPlan::Kind::kAny, nullptr)) return SQLITE_IOERR_LOCK;
      return below(file)->xLock(of(file)->below, level);
    };
    methods_.xUnlock = [](sqlite3_file* file, int level) {
      return below(file)->xUnlock(of(file)->below, level);
    };
    methods_.xCheckReservedLock = [](sqlite3_file* file, int* out) {
      return below(file)->xCheckReservedLock(of(file)->below, out);
    };
    methods_.xFileControl = [](sqlite3_file* file, int operation, void* argument) {
      return below(file)->xFileControl(of(file)->below, operation, argument);
    };
    methods_.xSectorSize = [](sqlite3_file* file) {
      return below(file)->xSectorSize(of(file)->below);
    };
    methods_.xDeviceCharacteristics = [](sqlite3_file* file) {
      return below(file)->xDeviceCharacteristics(of(file)->below);
    };
    methods_.xShmMap = [](sqlite3_file* file, int page, int size, int extend,
                          void volatile** out) {
      if (instance().mustFail(FaultPlan::Kind::kAny, nullptr)) {
        return SQLITE_IOERR_SHMMAP;
      }
      return below(file)->xShmMap(of(file)->below, page, size, extend, out);
    };
    methods_.xShmLock = [](sqlite3_file* file, int offset, int count, int flags) {
      if ((flags & SQLITE_SHM_LOCK) != 0 &&
          instance().mustFail(FaultPlan::Kind::kAny, nullptr)) {
        return SQLITE_IOERR_SHMLOCK;
      }
      return below(file)->xShmLock(of(file)->below, offset, count, flags);
    };
    methods_.xShmBarrier = [](sqlite3_file* file) {
      below(file)->xShmBarrier(of(file)->below);
    };
    methods_.xShmUnmap = [](sqlite3_file* file, int remove) {
      return below(file)->xShmUnmap(of(file)->below, remove);
    };
  }

  sqlite3_vfs* const below_;
  sqlite3_vfs vfs_{};
  sqlite3_io_methods methods_{};
  mutable std::mutex mutex_;
  FaultPlan plan_;
  std::int64_t calls_ = 0;
  std::int64_t failed_ = 0;
  std::atomic<bool> skipsSync_{false};
  bool isRecording_ = false;
  std::vector<FileEvent> events_;
};

/// The files as a power cut may leave them: what was synced is there; of what was
/// written since, any part in any order, some of it torn between sectors.
class PowerCut {
 public:
  explicit PowerCut(std::uint64_t seed) : random_(seed) {}

  void apply(const FileEvent& event) {
    switch (event.kind) {
      case FileEvent::Kind::kSync:
        for (const FileEvent& change : unsynced_[event.file]) {
          applyTo(files_[event.file], change);
        }
        unsynced_[event.file].clear();
        break;
      case FileEvent::Kind::kDelete:
        files_.erase(event.file);
        unsynced_.erase(event.file);
        break;
      case FileEvent::Kind::kMark:
        break;
      default:
        files_[event.file];
        unsynced_[event.file].push_back(event);
        break;
    }
  }

  std::map<std::string, std::string> cut() {
    constexpr std::size_t kSector = 512;
    auto files = files_;
    for (auto& [name, changes] : unsynced_) {
      std::vector<FileEvent> reached;
      for (const FileEvent& change : changes) {
        const auto fate = random_() % 4;
        if (fate == 0) continue;
        reached.push_back(change);
        if (fate == 1 && change.kind == FileEvent::Kind::kWrite) {
          reached.back().bytes.resize(kSector *
                                      (random_() % (change.bytes.size() / kSector + 1)));
        }
      }
      std::shuffle(reached.begin(), reached.end(), random_);
      for (const FileEvent& change : reached) applyTo(files[name], change);
    }
    return files;
  }

 private:
  static void applyTo(std::string& content, const FileEvent& change) {
    const auto offset = static_cast<std::size_t>(change.offset);
    if (change.kind == FileEvent::Kind::kTruncate) {
      content.resize(offset);
      return;
    }
    if (content.size() < offset + change.bytes.size()) {
      content.resize(offset + change.bytes.size());
    }
    content.replace(offset, change.bytes.size(), change.bytes);
  }

  std::map<std::string, std::string> files_;
  std::map<std::string, std::vector<FileEvent>> unsynced_;
  std::mt19937_64 random_;
};

}  // namespace ostrel
