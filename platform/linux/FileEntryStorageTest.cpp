#include "platform/linux/FileEntryStorage.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <optional>
#include <random>
#include <utility>

#include "platform/linux/Limits.h"
#include "platform/linux/OwnProcess.h"
#include "platform/linux/SpillFaults.h"
#include "platform/linux/StoredEntriesTesting.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using testing_support::append;
using testing_support::bytesOf;

constexpr ReporterID kSession{42};
constexpr std::chrono::milliseconds kNoPause{0};
constexpr std::size_t kFirstChunk = 1024;

// The descriptors of files without a name below `directory`.
std::vector<int> namelessFiles(const std::string& directory) {
  std::vector<int> found;
  for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
    std::error_code error;
    const std::string target = std::filesystem::read_symlink(entry.path(), error);
    if (target.starts_with(directory + "/") && target.ends_with(" (deleted)")) {
      found.push_back(std::stoi(entry.path().filename()));
    }
  }
  return found;
}

class FileEntryStorageTest : public testing::Test {
 protected:
  FileEntryStorage storageOf(std::size_t bytesOfList, std::size_t bytesOfAll) {
    return FileEntryStorage(directory_.path(), {bytesOfList, bytesOfAll, kNoPause},
                            faults_.calls());
  }

  void expectOneError(const std::string& end) {
    const auto lines = log_.lines(LogLevel::kError);
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_TRUE(lines[0].ends_with(end)) << lines[0];
  }

  testing_support::SpillFaults faults_;
  testing_support::CapturedLog log_;
  testing_support::TemporaryDirectory directory_;
};

TEST_F(FileEntryStorageTest, HasNoMemoryForAListWithoutEntries) {
  FileEntryStorage storage(directory_.path());
  const auto entries = storage.makeEntries(kSession);
  EXPECT_EQ(storage.bytesInMemory(), 0u);
  append(*entries, "x");
  EXPECT_EQ(storage.bytesInMemory(), kFirstChunk);
}

TEST_F(FileEntryStorageTest, LeavesAListInMemoryUpToItsShare) {
  // Two chunks: 1 KiB and 2 KiB.
  for (const std::size_t share : {3071u, 3072u, 3073u}) {
    FileEntryStorage storage = storageOf(share, /*bytesOfAll=*/1 << 20);
    const auto entries = storage.makeEntries(kSession);
    const std::string entry(64, 'x');
    for (int i = 0; i < 48; ++i) append(*entries, entry);
    EXPECT_EQ(storage.hasFile(), share < 3072) << share;
    append(*entries, entry);
    EXPECT_TRUE(storage.hasFile()) << share;
    EXPECT_EQ(bytesOf(*entries->snapshot()).size(), 49u * 64) << share;
  }
}

TEST_F(FileEntryStorageTest, HasNoMoreMemoryForALongListThanItsShare) {
  FileEntryStorage storage(directory_.path());
  const auto entries = storage.makeEntries(kSession);
  const std::string entry(200, 'x');
  std::size_t most = 0;
  for (int i = 0; i < 10000; ++i) {
    append(*entries, entry);
    most = std::max(most, storage.bytesInMemory());
  }
  EXPECT_LE(most, limits::kListBytesInMemory);
  EXPECT_TRUE(storage.hasFile());
}

TEST_F(FileEntryStorageTest, HasNoMoreMemoryForAllListsThanTheirShare) {
  constexpr std::size_t kLists = 100;
  constexpr std::size_t kAll = 200 * 1024;
  FileEntryStorage storage = storageOf(limits::kListBytesInMemory, kAll);
  std::vector<std::unique_ptr<StoredEntries>> lists;
  for (std::size_t i = 0; i < kLists; ++i) lists.push_back(storage.makeEntries(kSession));
  for (int i = 0; i < 100; ++i) {
    for (const auto& list : lists) ASSERT_TRUE(append(*list, std::string(100, 'x')));
    ASSERT_LE(storage.bytesInMemory(), kAll + kLists * kFirstChunk);
  }
  for (const auto& list : lists) {
    EXPECT_EQ(bytesOf(*list->snapshot()), std::string(10000, 'x'));
  }
  lists.clear();
  EXPECT_EQ(storage.bytesInMemory(), 0u);
}

TEST_F(FileEntryStorageTest, HasNoMemoryForAShortListOnceThatOfAllIsUsedUp) {
  // As many entries as a chunk could name places.
  constexpr int kShort = 64;
  FileEntryStorage storage = storageOf(kFirstChunk, /*bytesOfAll=*/kFirstChunk);
  const auto first = storage.makeEntries(kSession);
  append(*first, "x");
  const auto entries = storage.makeEntries(kSession);
  std::string expected;
  for (int count = 1; count <= kShort + 2; ++count) {
    const std::string entry = std::to_string(count) + ",";
    ASSERT_TRUE(append(*entries, entry));
    expected += entry;
    EXPECT_EQ(storage.bytesInMemory(), (count <= kShort ? 1 : 2) * kFirstChunk) << count;
  }
  EXPECT_EQ(bytesOf(*entries->snapshot()), expected);
}

TEST_F(FileEntryStorageTest, ReadsBackWithoutHavingTheListInMemory) {
  FileEntryStorage storage(directory_.path());
  const auto entries = storage.makeEntries(kSession);
  for (int i = 0; i < 20000; ++i) append(*entries, std::string(200, 'x'));
  std::size_t largest = 0;
  entries->snapshot()->forEachRun(
      [&](StoredEntries::Bytes run) { largest = std::max(largest, run.size()); });
  EXPECT_LE(largest, 256u * 1024);
}

TEST_F(FileEntryStorageTest, HasOneFileThatOnlyTheServiceCanRead) {
  const std::size_t before = testing_support::openDescriptors();
  FileEntryStorage storage = storageOf(/*bytesOfList=*/1, /*bytesOfAll=*/1);
  std::vector<std::unique_ptr<StoredEntries>> lists;
  for (int i = 0; i < 20; ++i) {
    lists.push_back(storage.makeEntries(kSession));
    for (int j = 0; j < 20; ++j) append(*lists.back(), std::string(500, 'x'));
  }
  EXPECT_TRUE(std::filesystem::is_empty(directory_.path()));
  EXPECT_EQ(testing_support::openDescriptors(), before + 1);
  const auto files = namelessFiles(directory_.path());
  ASSERT_EQ(files.size(), 1u);
  struct stat status {};
  ASSERT_EQ(::fstat(files[0], &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0600u);
  EXPECT_EQ(status.st_nlink, 0u);
  EXPECT_EQ(::fcntl(files[0], F_GETFD), FD_CLOEXEC);
  lists.clear();
  EXPECT_EQ(testing_support::openDescriptors(), before);
}

TEST_F(FileEntryStorageTest, LeavesNoFileBehindWhereEachHasAName) {
  for (const int error : {EOPNOTSUPP, EISDIR}) {
    faults_.openError = error;
    FileEntryStorage storage = storageOf(/*bytesOfList=*/1, /*bytesOfAll=*/1);
    const auto entries = storage.makeEntries(kSession);
    for (int i = 0; i < 20; ++i) EXPECT_TRUE(append(*entries, std::string(500, 'x')));
    EXPECT_TRUE(storage.hasFile());
    EXPECT_TRUE(std::filesystem::is_empty(directory_.path()));
    EXPECT_EQ(bytesOf(*entries->snapshot()), std::string(10000, 'x'));
  }
}

TEST_F(FileEntryStorageTest, GivesTheRoomOnTheDiskBackWithEachList) {
  FileEntryStorage storage(directory_.path());
  const auto small = storage.makeEntries(kSession);
  auto large = storage.makeEntries(kSession);
  const std::string entry(1000, 'x');
  for (int i = 0; i < 300; ++i) append(*small, entry);
  for (int i = 0; i < 4000; ++i) append(*large, entry);
  const auto files = namelessFiles(directory_.path());
  ASSERT_EQ(files.size(), 1u);
  struct stat before {};
  ::fstat(files[0], &before);

  large.reset();

  struct stat after {};
  ::fstat(files[0], &after);
  EXPECT_LT(after.st_blocks, before.st_blocks / 2);
  EXPECT_EQ(bytesOf(*small->snapshot()), std::string(300'000, 'x'));
}

/// Runs what it has when the test says so.
class ManualDisposal final : public ConcurrentQueue {
 public:
  void asyncAfter(std::chrono::nanoseconds, Task step) override {
    steps.push_back(std::move(step));
  }
  void run() {
    for (Task& step : std::exchange(steps, {})) step();
  }

  std::vector<Task> steps;
};

class FileEntryStorageDisposal : public FileEntryStorageTest {
 protected:
  static constexpr std::size_t kEntry = 5000;

  /// Of an own extent each.
  std::unique_ptr<StoredEntries> makeList(std::size_t entries) {
    auto list = storage_->makeEntries(kSession);
    for (std::size_t i = 0; i < entries; ++i) append(*list, std::string(kEntry, 'x'));
    return list;
  }
  blkcnt_t blocksOnDisk() const {
    const auto files = namelessFiles(directory_.path());
    if (files.size() != 1) return 0;
    struct stat status {};
    ::fstat(files[0], &status);
    return status.st_blocks;
  }

  ManualDisposal disposal_;
  std::optional<FileEntryStorage> storage_{std::in_place, directory_.path(),
                                           FileEntryStorage::Limits{1, 1, kNoPause},
                                           faults_.calls(), &disposal_};
};

TEST_F(FileEntryStorageDisposal, GivesRoomOnTheDiskBackLaterAndForManyAtOnce) {
  const auto kept = makeList(10);
  const blkcnt_t before = blocksOnDisk();
  for (int i = 0; i < 10; ++i) makeList(100);
  EXPECT_EQ(disposal_.steps.size(), 1u);
  EXPECT_GT(blocksOnDisk(), 50 * before);
  disposal_.run();
  EXPECT_EQ(blocksOnDisk(), before);
  EXPECT_TRUE(disposal_.steps.empty());
  EXPECT_EQ(bytesOf(*kept->snapshot()), std::string(10 * kEntry, 'x'));
}

TEST_F(FileEntryStorageDisposal, HasTheFileOpenUntilThen) {
  auto first = makeList(10);
  const auto second = makeList(10);
  first.reset();
  EXPECT_TRUE(storage_->hasFile());
  const auto third = makeList(10);
  disposal_.run();
  EXPECT_EQ(bytesOf(*second->snapshot()), std::string(10 * kEntry, 'x'));
  EXPECT_EQ(bytesOf(*third->snapshot()), std::string(10 * kEntry, 'x'));
}

TEST_F(FileEntryStorageDisposal, ClosesTheFileWhenNothingIsLeft) {
  auto first = makeList(10);
  makeList(10);
  first.reset();
  disposal_.run();
  EXPECT_FALSE(storage_->hasFile());
  EXPECT_EQ(bytesOf(*makeList(3)->snapshot()), std::string(3 * kEntry, 'x'));
}

TEST_F(FileEntryStorageDisposal, IsNotAskedWhenTheStorageHasGone) {
  auto first = makeList(10);
  auto second = makeList(10);
  storage_.reset();
  first.reset();
  EXPECT_TRUE(disposal_.steps.empty());
  second.reset();
  EXPECT_TRUE(namelessFiles(directory_.path()).empty());
}

TEST_F(FileEntryStorageDisposal, KeepsNoMoreForLaterThanSomeThousandHoles) {
  constexpr std::size_t kMost = 16'384;
  constexpr blkcnt_t kOfOne = 8;
  const auto kept = storage_->makeEntries(kSession);
  append(*kept, "x");
  std::vector<std::unique_ptr<StoredEntries>> lists;
  for (std::size_t i = 0; i < kMost + 1000; ++i) {
    lists.push_back(storage_->makeEntries(kSession));
    append(*lists.back(), "x");
  }
  const blkcnt_t before = blocksOnDisk();
  ASSERT_EQ(before, (kMost + 1001) * kOfOne);
  for (std::size_t i = 0; i < kMost; ++i) lists[i].reset();
  EXPECT_EQ(blocksOnDisk(), before);
  lists.clear();
  // Who finds too many gives a few back.
  EXPECT_LE(blocksOnDisk(), before - kOfOne * 1000);
  EXPECT_GE(blocksOnDisk(), before - kOfOne * 1004);
  disposal_.run();
  EXPECT_EQ(blocksOnDisk(), kOfOne);
}

TEST_F(FileEntryStorageTest, GoesOnAfterAWriteThatTookAPart) {
  faults_.writesAreShort = true;
  FileEntryStorage storage = storageOf(/*bytesOfList=*/4096, /*bytesOfAll=*/4096);
  const auto entries = storage.makeEntries(kSession);
  std::string expected;
  for (int i = 0; i < 500; ++i) {
    const std::string entry = std::to_string(i) + std::string(200, ',');
    ASSERT_TRUE(append(*entries, entry));
    expected += entry;
  }
  EXPECT_EQ(bytesOf(*entries->snapshot()), expected);
}

TEST_F(FileEntryStorageTest, KeepsEntriesInMemoryWhileTheDiskIsFull) {
  FileEntryStorage storage = storageOf(/*bytesOfList=*/4096, /*bytesOfAll=*/1 << 20);
  const auto entries = storage.makeEntries(kSession);
  const std::string entry(100, 'x');
  for (int i = 0; i < 100; ++i) append(*entries, entry);
  ASSERT_TRUE(storage.hasFile());

  faults_.writeError = ENOSPC;
  for (int i = 0; i < 5000; ++i) ASSERT_TRUE(append(*entries, entry));
  EXPECT_EQ(bytesOf(*entries->snapshot()), std::string(510'000, 'x'));
  EXPECT_EQ(storage.refusedEntries(), 0u);

  faults_.writeError = 0;
  for (int i = 0; i < 5000; ++i) ASSERT_TRUE(append(*entries, entry));
  EXPECT_EQ(bytesOf(*entries->snapshot()), std::string(1'010'000, 'x'));
  EXPECT_LE(storage.bytesInMemory(), 128u * 1024);
}

// An entry that is larger than an extent comes while the disk is full, and has a chunk of
// its own behind the one that was written last and is empty.
TEST_F(FileEntryStorageTest, WritesNoExtentOfNothingBeforeALargeEntry) {
  FileEntryStorage storage = storageOf(/*bytesOfList=*/4096, /*bytesOfAll=*/4 << 20);
  const auto entries = storage.makeEntries(kSession);
  std::string expected;
  const auto add = [&](std::size_t size, char letter) {
    ASSERT_TRUE(append(*entries, std::string(size, letter)));
    expected += std::string(size, letter);
  };
  add(3000, 'a');
  add(3000, 'b');
  add(200'000, 'c');
  ASSERT_TRUE(storage.hasFile());
  faults_.writeError = ENOSPC;
  add(300'000, 'd');
  faults_.writeError = 0;
  add(200'000, 'e');
  std::string all;
  entries->snapshot()->forEachRun([&](StoredEntries::Bytes run) {
    EXPECT_NE(run.size(), 0u);
    all.append(run.begin(), run.end());
  });
  EXPECT_TRUE(all == expected);
}

TEST_F(FileEntryStorageTest, RefusesWhatFitsNeitherDiskNorMemory) {
  faults_.writeError = ENOSPC;
  FileEntryStorage storage = storageOf(/*bytesOfList=*/4096, /*bytesOfAll=*/10'000);
  const auto entries = storage.makeEntries(kSession);
  std::string expected;
  std::uint64_t refused = 0;
  for (int i = 0; i < 200; ++i) {
    const std::string entry = std::to_string(i) + std::string(100, ',');
    if (append(*entries, entry)) {
      expected += entry;
    } else {
      ++refused;
    }
  }
  EXPECT_GT(expected.size(), 9'000u);
  EXPECT_EQ(bytesOf(*entries->snapshot()), expected);
  EXPECT_EQ(storage.refusedEntries(), refused);
  expectOneError("42: the session's list goes without some messages: " +
                 directory_.path() + ": No space left on device");

  faults_.writeError = 0;
  ASSERT_TRUE(append(*entries, "later"));
  EXPECT_EQ(bytesOf(*entries->snapshot()), expected + "later");
}

TEST_F(FileEntryStorageTest, IsOfUseWithoutItsDirectory) {
  FileEntryStorage storage(directory_ / "missing", {4096, 10'000, kNoPause},
                           SpillCalls::system());
  const auto entries = storage.makeEntries(kSession);
  std::size_t taken = 0;
  for (int i = 0; i < 200; ++i) taken += append(*entries, std::string(100, 'x')) ? 1 : 0;
  EXPECT_GT(taken, 90u);
  EXPECT_EQ(bytesOf(*entries->snapshot()).size(), 100 * taken);
  EXPECT_EQ(storage.refusedEntries(), 200 - taken);
}

TEST_F(FileEntryStorageTest, LeavesAFullDiskAloneForAWhile) {
  faults_.writeError = ENOSPC;
  FileEntryStorage storage(directory_.path(), {1, 1, std::chrono::hours(1)},
                           faults_.calls());
  const auto entries = storage.makeEntries(kSession);
  for (int i = 0; i < 100; ++i) append(*entries, std::string(100, 'x'));
  EXPECT_EQ(faults_.writes, 1);
}

TEST_F(FileEntryStorageTest, SaysWhenItCannotReadBack) {
  FileEntryStorage storage = storageOf(/*bytesOfList=*/1, /*bytesOfAll=*/1);
  const auto entries = storage.makeEntries(kSession);
  for (int i = 0; i < 100; ++i) append(*entries, std::string(100, 'x'));
  faults_.readError = EIO;
  EXPECT_FALSE(entries->snapshot()->forEachRun([](StoredEntries::Bytes) {}));
  expectOneError("42: cannot read the session's list back: " + directory_.path() +
                 ": Input/output error");
}

/// Lists that grow in turn, some of which end, with snapshots of any age, while the disk
/// is full now and then. `bytesOfFile` as in the limits.
class FileEntryStorageLists : public FileEntryStorageTest,
                              public testing::WithParamInterface<std::size_t> {};

TEST_P(FileEntryStorageLists, AreWhatWasAppendedWhateverTheSharesAndTheDisk) {
  std::mt19937 random(5);
  for (int run = 0; run < 12; ++run) {
    const std::size_t share = random() % 20'000;
    const std::size_t shareOfAll = random() % 40'000;
    FileEntryStorage storage(directory_.path(),
                             {share, shareOfAll + GetParam(), kNoPause, GetParam()},
                             faults_.calls());
    struct List {
      std::unique_ptr<StoredEntries> entries;
      std::string expected;
    };
    std::vector<List> lists;
    std::vector<std::pair<std::shared_ptr<const StoredEntries::Snapshot>, std::string>>
        snapshots;
    std::uint64_t refused = 0;
    for (int step = 0; step < 500; ++step) {
      if (random() % 20 == 0) faults_.writeError = random() % 10 == 0 ? ENOSPC : 0;
      if (lists.size() < 5) lists.push_back({storage.makeEntries(kSession), ""});
      const std::size_t chosen = random() % lists.size();
      List& list = lists[chosen];
      const std::size_t sizes[] = {1, 30, 200, 1000, 3000, random() % 60'000};
      const std::string entry(sizes[random() % 6] + 1,
                              static_cast<char>('a' + step % 26));
      if (append(*list.entries, entry)) {
        list.expected += entry;
      } else {
        ++refused;
      }
      if (random() % 40 == 0) {
        snapshots.emplace_back(list.entries->snapshot(), list.expected);
      }
      if (random() % 150 == 0) {
        lists.erase(lists.begin() + static_cast<std::ptrdiff_t>(chosen));
      }
    }
    for (const List& list : lists) {
      ASSERT_TRUE(bytesOf(*list.entries->snapshot()) == list.expected) << run;
    }
    lists.clear();
    for (const auto& [snapshot, expected] : snapshots) {
      ASSERT_TRUE(bytesOf(*snapshot) == expected) << run;
    }
    EXPECT_EQ(storage.refusedEntries(), refused);
    snapshots.clear();
    EXPECT_EQ(storage.bytesInMemory(), 0u);
    EXPECT_FALSE(storage.hasFile());
  }
}

INSTANTIATE_TEST_SUITE_P(WrittenOneByOneOrTogether, FileEntryStorageLists,
                         testing::Values(0, SpillFile::kMostBytesInMemory));

// A hundred thousand sessions with a few messages each are like this.
TEST_F(FileEntryStorageTest, WritesTheEntriesOfManyShortListsTogether) {
  constexpr std::size_t kLists = 1000;
  FileEntryStorage storage(directory_.path(),
                           {limits::kListBytesInMemory, limits::kListsBytesBehind,
                            kNoPause, limits::kListsBytesBehind},
                           faults_.calls());
  std::vector<std::unique_ptr<StoredEntries>> lists;
  for (std::size_t i = 0; i < kLists; ++i) lists.push_back(storage.makeEntries(kSession));
  std::vector<std::string> expected(kLists);
  for (int turn = 0; turn < 20; ++turn) {
    for (std::size_t i = 0; i < kLists; ++i) {
      const std::string entry = std::to_string(i * 100) + std::string(200, ',');
      ASSERT_TRUE(append(*lists[i], entry));
      expected[i] += entry;
    }
  }
  // Some three hundred entries fill a group. No list has a chunk of its own.
  EXPECT_GT(faults_.writes, 0);
  EXPECT_LE(faults_.writes, static_cast<int>(20 * kLists / 300));
  EXPECT_LE(storage.bytesInMemory(), limits::kListsBytesBehind);
  for (std::size_t i = 0; i < kLists; ++i) {
    ASSERT_TRUE(bytesOf(*lists[i]->snapshot()) == expected[i]) << i;
  }
}

}  // namespace
}  // namespace ostrel
