#include "platform/linux/SpillFile.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <deque>
#include <filesystem>
#include <random>
#include <semaphore>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/Bytes.h"
#include "platform/linux/SpillFaults.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

constexpr std::size_t kGroup = SpillFile::kGroupBytes;
constexpr std::size_t kLargest = SpillFile::kLargestOfGroup;
constexpr std::size_t kMemory = SpillFile::kMostBytesInMemory;
constexpr std::size_t kPage = 4096;

/// Bytes that say where they belong, so that none can stand for another's.
std::string bytesOf(std::size_t seed, std::size_t size) {
  std::string bytes(size, '\0');
  for (std::size_t i = 0; i < size; ++i) {
    bytes[i] = static_cast<char>((seed * 31 + i * 7 + i / 256) & 0xFF);
  }
  return bytes;
}

/// What was written, and where.
struct Piece {
  SpillFile::Extent extent;
  std::string bytes;
};

class SpillFileTest : public testing::Test {
 protected:
  explicit SpillFileTest(std::size_t memory = kMemory)
      : file_(directory_.path(), std::chrono::milliseconds(0), memory, faults_.calls()) {}

  /// In two parts, as the entries of a list come.
  bool write(std::size_t size) {
    std::string bytes = bytesOf(pieces_.size(), size);
    const auto all = asBytes(bytes);
    const std::array parts{all.first(size / 3), all.subspan(size / 3)};
    const auto extent = file_.write(parts);
    if (extent) pieces_.push_back({*extent, std::move(bytes)});
    return extent.has_value();
  }

  void writeGroup() {
    for (std::size_t size = 0; size < kGroup; size += 1024) ASSERT_TRUE(write(1024));
  }

  std::string read(const Piece& piece) {
    std::string bytes(piece.extent.size, '\0');
    const auto error =
        file_.read(piece.extent, reinterpret_cast<std::uint8_t*>(bytes.data()));
    EXPECT_FALSE(error) << error->description;
    return bytes;
  }

  void expectAllReadable() {
    for (std::size_t i = 0; i < pieces_.size(); ++i) {
      ASSERT_TRUE(read(pieces_[i]) == pieces_[i].bytes) << i;
    }
  }

  void releasePieces(std::size_t from, std::size_t to) {
    std::vector<SpillFile::Extent> extents;
    for (std::size_t i = from; i < to; ++i) extents.push_back(pieces_[i].extent);
    file_.release(extents);
    pieces_.erase(pieces_.begin() + static_cast<std::ptrdiff_t>(from),
                  pieces_.begin() + static_cast<std::ptrdiff_t>(to));
  }

  /// What the one file takes on the disk.
  std::size_t bytesOnDisk() const {
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
      std::error_code error;
      const std::string target = std::filesystem::read_symlink(entry.path(), error);
      if (!target.starts_with(directory_.path() + "/")) continue;
      struct stat status {};
      ::stat(entry.path().c_str(), &status);
      return static_cast<std::size_t>(status.st_blocks) * 512;
    }
    return 0;
  }

  /// Threads that write, read and release; nothing is left of it.
  void useByManyThreads() {
    constexpr int kThreads = 4;
    std::vector<std::thread> threads;
    for (int number = 0; number < kThreads; ++number) {
      threads.emplace_back([this, number] {
        std::mt19937 random(static_cast<unsigned>(number));
        std::deque<Piece> mine;
        const auto check = [&](const Piece& piece) {
          std::string bytes(piece.extent.size, '\0');
          ASSERT_FALSE(
              file_.read(piece.extent, reinterpret_cast<std::uint8_t*>(bytes.data())));
          ASSERT_TRUE(bytes == piece.bytes);
        };
        for (std::size_t i = 0; i < 2000; ++i) {
          std::string bytes =
              bytesOf(i * kThreads + static_cast<std::size_t>(number),
                      1 + random() % (random() % 20 == 0 ? 2 * kLargest : 1500));
          const auto extent = file_.write(std::array{asBytes(bytes)});
          ASSERT_TRUE(extent);
          mine.push_back({*extent, std::move(bytes)});
          check(mine[random() % mine.size()]);
          if (mine.size() > 100) {
            check(mine.front());
            file_.release({&mine.front().extent, 1});
            mine.pop_front();
          }
        }
        for (const Piece& piece : mine) {
          check(piece);
          file_.release({&piece.extent, 1});
        }
      });
    }
    for (std::thread& thread : threads) thread.join();
  }

  testing_support::SpillFaults faults_;
  testing_support::TemporaryDirectory directory_;
  SpillFile file_;
  std::vector<Piece> pieces_;
};

TEST_F(SpillFileTest, GathersPiecesWhereThereIsMemoryForIt) {
  for (const std::size_t memory : {kMemory - 1, kMemory, kMemory + 1}) {
    faults_.writes = 0;
    SpillFile file(directory_.path(), std::chrono::milliseconds(0), memory,
                   faults_.calls());
    const std::string piece(1000, 'x');
    const std::array parts{asBytes(piece)};
    for (int i = 0; i < 40; ++i) ASSERT_TRUE(file.write(parts));
    EXPECT_EQ(faults_.writes, memory < kMemory ? 40 : 0) << memory;
    EXPECT_EQ(file.bytesInMemory(), memory < kMemory ? 0 : kGroup) << memory;
  }
}

TEST_F(SpillFileTest, WritesAGroupOnceAPieceFindsNoRoomInIt) {
  for (const std::size_t last : {1023u, 1024u, 1025u}) {
    faults_.writes = 0;
    for (std::size_t size = 1024; size < kGroup; size += 1024) ASSERT_TRUE(write(1024));
    ASSERT_TRUE(write(last));
    EXPECT_EQ(faults_.writes, last > 1024 ? 1 : 0) << last;
    expectAllReadable();
    ASSERT_TRUE(write(1));
    EXPECT_EQ(faults_.writes, last > 1023 ? 1 : 0) << last;
    expectAllReadable();
    releasePieces(0, pieces_.size());
    EXPECT_FALSE(file_.isOpen());
    EXPECT_EQ(file_.bytesInMemory(), 0u);
  }
}

TEST_F(SpillFileTest, WritesALargePieceByItself) {
  for (const std::size_t size : {kLargest - 1, kLargest, kLargest + 1}) {
    faults_.writes = 0;
    ASSERT_TRUE(write(size));
    EXPECT_EQ(faults_.writes, size > kLargest ? 1 : 0) << size;
  }
  expectAllReadable();
}

TEST_F(SpillFileTest, TakesAPieceOfNothing) {
  ASSERT_TRUE(write(0));
  ASSERT_TRUE(write(1024));
  expectAllReadable();
  releasePieces(0, 1);
  expectAllReadable();
  releasePieces(0, 1);
  EXPECT_FALSE(file_.isOpen());
}

TEST_F(SpillFileTest, HasPiecesOfEverySizeInTheirOrder) {
  std::mt19937 random(11);
  for (int i = 0; i < 600; ++i) ASSERT_TRUE(write(1 + random() % (kLargest + 2000)));
  expectAllReadable();
  EXPECT_LE(file_.bytesInMemory(), kMemory);
}

TEST_F(SpillFileTest, KeepsWhatItTookWhenTheGroupCannotBeWritten) {
  writeGroup();
  faults_.writeError = ENOSPC;
  EXPECT_FALSE(write(1024));
  EXPECT_FALSE(write(1));
  EXPECT_FALSE(write(kLargest + 1));
  EXPECT_EQ(file_.latestError()->code, ENOSPC);
  expectAllReadable();
  EXPECT_LE(file_.bytesInMemory(), kMemory);

  faults_.writeError = 0;
  writeGroup();
  writeGroup();
  expectAllReadable();
  EXPECT_EQ(file_.bytesInMemory(), kGroup);
}

TEST_F(SpillFileTest, LosesNothingWhenTheDiskIsFullNowAndThen) {
  std::mt19937 random(12);
  for (int i = 0; i < 3000; ++i) {
    if (random() % 50 == 0) faults_.writeError = random() % 3 == 0 ? ENOSPC : 0;
    faults_.writesAreShort = random() % 2 == 0;
    write(1 + random() % (i % 3 == 0 ? 3 * kLargest : 1500));
    if (random() % 5 == 0 && !pieces_.empty()) {
      const std::size_t begin = random() % pieces_.size();
      releasePieces(begin, std::min(begin + random() % 8, pieces_.size()));
    }
  }
  EXPECT_GT(pieces_.size(), 200u);
  expectAllReadable();
  releasePieces(0, pieces_.size());
  EXPECT_FALSE(file_.isOpen());
}

TEST_F(SpillFileTest, LeavesAFailedGroupAloneForAWhile) {
  SpillFile file(directory_.path(), std::chrono::hours(1), kMemory, faults_.calls());
  faults_.writeError = ENOSPC;
  const std::string piece(1024, 'x');
  const std::array parts{asBytes(piece)};
  for (std::size_t i = 0; i < 1000; ++i) {
    EXPECT_EQ(file.write(parts).has_value(), i < kGroup / 1024) << i;
  }
  EXPECT_EQ(faults_.writes, 1);
}

TEST_F(SpillFileTest, ForgetsAFailedGroupOfWhichNothingIsLeft) {
  ASSERT_TRUE(write(kLargest + 1));
  writeGroup();
  faults_.writeError = ENOSPC;
  EXPECT_FALSE(write(1024));
  EXPECT_EQ(file_.bytesInMemory(), kGroup);
  releasePieces(1, pieces_.size());
  EXPECT_EQ(file_.bytesInMemory(), 0u);
  EXPECT_TRUE(write(1024));
  expectAllReadable();
}

TEST_F(SpillFileTest, GivesAPageBackWithTheLastPieceOnIt) {
  writeGroup();
  ASSERT_TRUE(write(1024));  // The group is in the file, and this in memory.
  const std::size_t before = bytesOnDisk();
  ASSERT_GE(before, kGroup);
  releasePieces(1, 4);
  EXPECT_EQ(bytesOnDisk(), before);
  releasePieces(0, 1);
  EXPECT_EQ(bytesOnDisk(), before - kPage);
  releasePieces(0, kGroup / 1024 - 4);
  EXPECT_EQ(bytesOnDisk(), before - kGroup);
  expectAllReadable();
}

TEST_F(SpillFileTest, TakesNoRoomForPiecesThatWereReleasedBeforeTheyWereWritten) {
  for (std::size_t size = 0; size < kGroup; size += 1024) ASSERT_TRUE(write(1024));
  releasePieces(4, kGroup / 1024);
  writeGroup();
  ASSERT_TRUE(write(1024));
  EXPECT_LE(bytesOnDisk(), kGroup + kPage);
  expectAllReadable();
}

TEST_F(SpillFileTest, FillsAGroupAnewOfWhichNothingIsLeft) {
  ASSERT_TRUE(write(kLargest + 1));
  faults_.writes = 0;
  for (int i = 0; i < 10; ++i) {
    for (std::size_t size = 0; size < kGroup; size += 1024) ASSERT_TRUE(write(1024));
    expectAllReadable();
    releasePieces(1, pieces_.size());
  }
  EXPECT_EQ(faults_.writes, 0);
  EXPECT_EQ(file_.bytesInMemory(), kGroup);
}

/// While another thread is in the middle of writing a group.
class SpillFileBeingWritten : public SpillFileTest {
 protected:
  void SetUp() override {
    writeGroup();
    faults_.inWrite = [this] {
      if (std::this_thread::get_id() != writer_) return;
      writer_ = std::thread::id();
      isWriting_.release();
      mayEnd_.acquire();
    };
    thread_ = std::thread([this] {
      writer_ = std::this_thread::get_id();
      extent_ = file_.write(std::array{asBytes(text_)});
    });
    isWriting_.acquire();
  }
  void endWrite() {
    mayEnd_.release();
    thread_.join();
  }
  void TearDown() override { ASSERT_FALSE(thread_.joinable()); }

  const std::string text_ = bytesOf(4711, 1000);
  std::optional<SpillFile::Extent> extent_;

 private:
  std::atomic<std::thread::id> writer_;
  std::binary_semaphore isWriting_{0};
  std::binary_semaphore mayEnd_{0};
  std::thread thread_;
};

TEST_F(SpillFileBeingWritten, IsRead) {
  expectAllReadable();
  endWrite();
  expectAllReadable();
  EXPECT_EQ(read({*extent_, text_}), text_);
}

TEST_F(SpillFileBeingWritten, HoldsNobodyUp) {
  writeGroup();
  EXPECT_EQ(faults_.writes, 1);
  ASSERT_TRUE(write(1024));
  EXPECT_EQ(faults_.writes, 2);
  EXPECT_EQ(file_.bytesInMemory(), kMemory);
  expectAllReadable();
  endWrite();
  writeGroup();
  expectAllReadable();
  EXPECT_EQ(read({*extent_, text_}), text_);
}

TEST_F(SpillFileBeingWritten, LeavesNoRoomBehindForWhatIsReleased) {
  releasePieces(4, pieces_.size());
  endWrite();
  EXPECT_EQ(bytesOnDisk(), kPage);
  expectAllReadable();
}

TEST_F(SpillFileBeingWritten, KeepsTheFileOpenUntilItIsWritten) {
  releasePieces(0, pieces_.size());
  EXPECT_TRUE(file_.isOpen());
  endWrite();
  EXPECT_EQ(read({*extent_, text_}), text_);
  file_.release({&*extent_, 1});
  EXPECT_FALSE(file_.isOpen());
}

TEST_F(SpillFileBeingWritten, MayFailWithoutALoss) {
  writeGroup();
  faults_.writeError = ENOSPC;
  endWrite();
  EXPECT_FALSE(extent_);
  EXPECT_FALSE(write(1024));
  expectAllReadable();
  faults_.writeError = 0;
  ASSERT_TRUE(write(1024));
  expectAllReadable();
}

// Each with pieces of its own, which it reads and releases in any order.
TEST_F(SpillFileTest, ServesManyThreads) {
  useByManyThreads();
  EXPECT_FALSE(file_.isOpen());
  EXPECT_EQ(file_.bytesInMemory(), 0u);
}

TEST_F(SpillFileTest, ServesManyThreadsWhileAnotherGivesRoomBack) {
  std::counting_semaphore<> asked{0};
  std::atomic<bool> isDone = false;
  file_.giveRoomBackLater([&] { asked.release(); });
  std::thread giver([&] {
    for (;;) {
      asked.acquire();
      if (isDone) return;
      file_.giveRoomBack();
    }
  });
  useByManyThreads();
  isDone = true;
  asked.release();
  giver.join();
  // What was still asked for then.
  while (file_.isOpen()) file_.giveRoomBack();
  EXPECT_EQ(file_.bytesInMemory(), 0u);
}

}  // namespace
}  // namespace ostrel
