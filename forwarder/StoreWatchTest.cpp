#include "forwarder/StoreWatch.h"

#include <gtest/gtest.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <thread>

#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using std::chrono::hours;
using std::chrono::milliseconds;
using testing_support::eventually;
using testing_support::TemporaryDirectory;

class StoreWatchTest : public ::testing::Test {
 protected:
  std::string path() const { return directory_ / "a/b/reports.db"; }
  void makeDirectory() { std::filesystem::create_directories(directory_ / "a/b"); }
  void write(const std::string& name) { directory_.write("a/b/" + name, "x"); }
  void end() {
    const std::uint64_t one = 1;
    ASSERT_EQ(::write(end_.get(), &one, sizeof one), 8);
  }

  static bool sleeps(pid_t thread) {
    std::ifstream file("/proc/self/task/" + std::to_string(thread) + "/stat");
    std::string text;
    std::getline(file, text);
    return text.find(") S ") != std::string::npos;
  }

  const TemporaryDirectory directory_;
  const FileDescriptor end_{::eventfd(0, EFD_CLOEXEC)};
};

TEST_F(StoreWatchTest, SeesTheStoreAndItsLogWritten) {
  makeDirectory();
  StoreWatch watch(path(), end_.get(), milliseconds(0));
  write("reports.db");
  EXPECT_TRUE(watch.forChange());
  write("reports.db-wal");
  EXPECT_TRUE(watch.forChange());
}

TEST_F(StoreWatchTest, SeesAStoreThatIsMovedIntoPlace) {
  makeDirectory();
  directory_.write("other", "x");
  StoreWatch watch(path(), end_.get(), milliseconds(0));
  std::filesystem::rename(directory_ / "other", path());
  EXPECT_TRUE(watch.forChange());
}

TEST_F(StoreWatchTest, SeesADirectoryThatComes) {
  StoreWatch watch(path(), end_.get(), milliseconds(0));
  std::thread making([&] { makeDirectory(); });
  EXPECT_TRUE(watch.forChange());
  making.join();
  write("reports.db");
  EXPECT_TRUE(watch.forChange());
}

TEST_F(StoreWatchTest, SeesADirectoryThatTakesThePlaceOfAnother) {
  makeDirectory();
  StoreWatch watch(path(), end_.get(), milliseconds(0));
  std::filesystem::rename(directory_ / "a", directory_ / "old");
  std::filesystem::remove_all(directory_ / "old");
  std::thread making([&] {
    makeDirectory();
    write("reports.db");
  });
  EXPECT_TRUE(watch.forChange());
  making.join();
}

TEST_F(StoreWatchTest, SeesNoOtherFilesAndNoReaders) {
  makeDirectory();
  StoreWatch watch(path(), end_.get(), milliseconds(0));
  write("forwarder.json");
  write("reports.db-shm");
  directory_.write("a/b/reports.db-wal", "");  // As a reader makes it.
  std::filesystem::remove(directory_ / "a/b/reports.db-wal");
  std::atomic<bool> isOver = false;
  std::atomic<pid_t> thread = 0;
  std::thread waiting([&] {
    thread = ::gettid();
    watch.forChange();
    isOver = true;
  });
  EXPECT_TRUE(eventually([&] { return isOver || (thread != 0 && sleeps(thread)); }));
  EXPECT_FALSE(isOver);
  end();
  waiting.join();
}

TEST_F(StoreWatchTest, EndsWhileItWaits) {
  makeDirectory();
  StoreWatch watch(path(), end_.get(), milliseconds(0));
  std::thread ending([&] { end(); });
  EXPECT_FALSE(watch.forTime(hours(24)));
  EXPECT_FALSE(watch.forChange());
  ending.join();
}

TEST_F(StoreWatchTest, EndsWhileWhatWasWrittenSettles) {
  makeDirectory();
  StoreWatch watch(path(), end_.get(), hours(1));
  write("reports.db");
  end();
  EXPECT_FALSE(watch.forChange());
}

TEST_F(StoreWatchTest, WaitsForATime) {
  StoreWatch watch(path(), end_.get(), milliseconds(0));
  EXPECT_TRUE(watch.forTime(milliseconds(0)));
  EXPECT_TRUE(watch.forTime(milliseconds(1)));
}

}  // namespace
}  // namespace ostrel
