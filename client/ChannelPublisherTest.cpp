#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <thread>
#include <vector>

#include "ostrel/channels.h"
#include "platform/linux/ChannelFileFormat.h"

namespace ostrel {
namespace {

using channels::Header;
using channels::Record;

class ChannelPublisher : public testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = "/tmp/ostrel-channels-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    directory_ = pattern;
  }
  void TearDown() override {
    for (ostrel_channels* one : opened_) ostrel_channels_close(one);
    std::filesystem::remove_all(directory_);
  }

  ostrel_channels* open(const char* group = "Speaker", const char* subgroup = "Stats",
                        std::uint32_t capacity = 4) {
    ostrel_channels* channels = nullptr;
    EXPECT_EQ(
        ostrel_channels_open_in(directory_.c_str(), group, subgroup, capacity, &channels),
        0);
    if (channels != nullptr) opened_.push_back(channels);
    return channels;
  }
  int statusOfOpening(const char* group, const char* subgroup,
                      std::uint32_t capacity = 4) {
    ostrel_channels* channels = nullptr;
    const int status =
        ostrel_channels_open_in(directory_.c_str(), group, subgroup, capacity, &channels);
    if (status == 0) opened_.push_back(channels);
    return status;
  }
  static ostrel_counter* counter(ostrel_channels* channels, const char* name) {
    ostrel_counter* found = nullptr;
    EXPECT_EQ(ostrel_channels_counter(channels, name, &found), 0);
    return found;
  }
  static int statusOfCounter(ostrel_channels* channels, const char* name) {
    ostrel_counter* found = nullptr;
    return ostrel_channels_counter(channels, name, &found);
  }
  std::string file() const { return directory_ + "/Speaker.Stats"; }

  std::string directory_;
  std::vector<ostrel_channels*> opened_;
};

TEST_F(ChannelPublisher, WritesTheDocumentedFile) {
  ostrel_channels* channels = open();
  ostrel_channels_set(counter(channels, "frames"), 7);
  ostrel_channels_add(counter(channels, "underruns"), -2);

  std::ifstream stream(file(), std::ios::binary);
  Header header{};
  Record records[4]{};
  stream.read(reinterpret_cast<char*>(&header), sizeof header);
  stream.read(reinterpret_cast<char*>(&records), sizeof records);
  ASSERT_TRUE(stream);
  EXPECT_EQ(stream.peek(), std::ifstream::traits_type::eof());
  EXPECT_EQ(std::memcmp(header.magic, "OSTRCHAN", 8), 0);
  EXPECT_EQ(header.version, 1u);
  EXPECT_EQ(header.capacity, 4u);
  EXPECT_EQ(header.count, 2u);
  EXPECT_STREQ(header.group, "Speaker");
  EXPECT_STREQ(header.subgroup, "Stats");
  EXPECT_STREQ(records[0].name, "frames");
  EXPECT_EQ(records[0].value, 7);
  EXPECT_STREQ(records[1].name, "underruns");
  EXPECT_EQ(records[1].value, -2);
}

TEST_F(ChannelPublisher, LeavesOneFileThatAllMayReadAndOnlyItsUserMayWrite) {
  const mode_t mask = ::umask(0077);
  open();
  ::umask(mask);
  int files = 0;
  for (const auto& entry : std::filesystem::directory_iterator(directory_)) {
    ++files;
    struct stat status {};
    ASSERT_EQ(::stat(entry.path().c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0644u);
  }
  EXPECT_EQ(files, 1);
}

TEST_F(ChannelPublisher, SharesCountersAmongOpeners) {
  ostrel_counter* const first = counter(open(), "frames");
  ostrel_counter* const second = counter(open(), "frames");
  ostrel_channels_add(first, 3);
  ostrel_channels_add(second, 4);
  EXPECT_EQ(ostrel_channels_get(first), 7);
  EXPECT_EQ(ostrel_channels_get(second), 7);
}

TEST_F(ChannelPublisher, KeepsValuesAndCapacityOfAnEarlierRun) {
  ostrel_channels_set(counter(open("Speaker", "Stats", 2), "frames"), 7);
  ostrel_channels_close(opened_.back());
  opened_.clear();
  ostrel_channels* const again = open("Speaker", "Stats", 8);
  EXPECT_EQ(ostrel_channels_get(counter(again, "frames")), 7);
  counter(again, "second");
  EXPECT_EQ(statusOfCounter(again, "third"), ENOSPC);
}

TEST_F(ChannelPublisher, HasRoomForItsCapacity) {
  ostrel_channels* const channels = open("Speaker", "Stats", 3);
  EXPECT_EQ(statusOfCounter(channels, "1"), 0);
  EXPECT_EQ(statusOfCounter(channels, "2"), 0);
  EXPECT_EQ(statusOfCounter(channels, "3"), 0);
  EXPECT_EQ(statusOfCounter(channels, "4"), ENOSPC);
  EXPECT_EQ(statusOfCounter(channels, "1"), 0);
}

TEST_F(ChannelPublisher, RefusesNamesThatDoNotFit) {
  const std::string group(OSTREL_CHANNELS_MOST_GROUP_BYTES, 'g');
  EXPECT_EQ(statusOfOpening(group.c_str(), group.c_str()), 0);
  EXPECT_EQ(statusOfOpening((group + "g").c_str(), "s"), EINVAL);
  EXPECT_EQ(statusOfOpening("g", (group + "g").c_str()), EINVAL);
  EXPECT_EQ(statusOfOpening("\xff", "s"), EINVAL);
  const std::string name(OSTREL_CHANNELS_MOST_NAME_BYTES, 'n');
  ostrel_channels* const channels = open();
  EXPECT_EQ(statusOfCounter(channels, name.c_str()), 0);
  EXPECT_EQ(statusOfCounter(channels, (name + "n").c_str()), EINVAL);
  EXPECT_EQ(statusOfCounter(channels, ""), EINVAL);
  EXPECT_EQ(statusOfCounter(channels, nullptr), EINVAL);
  EXPECT_EQ(statusOfCounter(channels, "\xc3"), EINVAL);
}

TEST_F(ChannelPublisher, RefusesACapacityThatIsTooLarge) {
  EXPECT_EQ(statusOfOpening("a", "", OSTREL_CHANNELS_MOST_COUNTERS), 0);
  EXPECT_EQ(statusOfOpening("b", "", OSTREL_CHANNELS_MOST_COUNTERS + 1), EINVAL);
}

TEST_F(ChannelPublisher, NeedsNeitherAGroupNorASubgroup) {
  open(nullptr, "QDL");
  open("Speaker", nullptr);
  open("", "");
  EXPECT_TRUE(std::filesystem::exists(directory_ + "/%.QDL"));
  EXPECT_TRUE(std::filesystem::exists(directory_ + "/Speaker.%"));
  EXPECT_TRUE(std::filesystem::exists(directory_ + "/%.%"));
}

TEST_F(ChannelPublisher, StaysInItsDirectoryWhateverTheNames) {
  open("../../escaped", "a/b");
  EXPECT_TRUE(std::filesystem::exists(directory_ + "/%2E%2E%2F%2E%2E%2Fescaped.a%2Fb"));
}

TEST_F(ChannelPublisher, MakesItsDirectory) {
  directory_ += "/deeper/still";
  open();
  EXPECT_TRUE(std::filesystem::exists(file()));
}

TEST_F(ChannelPublisher, ReplacesWhatIsNoChannelFile) {
  std::ofstream(file()) << "junk";
  ::chmod(file().c_str(), 0644);
  EXPECT_EQ(ostrel_channels_get(counter(open(), "frames")), 0);
}

TEST_F(ChannelPublisher, NeverMapsWhatAnotherMayCutShort) {
  open();
  ASSERT_EQ(::chmod(file().c_str(), 0666), 0);
  EXPECT_EQ(statusOfOpening("Speaker", "Stats"), EACCES);
  ASSERT_EQ(::chmod(file().c_str(), 0644), 0);
  if (::geteuid() == 0) {
    ASSERT_EQ(::chown(file().c_str(), 65534, 65534), 0);
    EXPECT_EQ(statusOfOpening("Speaker", "Stats"), EACCES);
  }
}

TEST_F(ChannelPublisher, NeverFollowsALink) {
  const std::string victim = directory_ + "/victim";
  std::ofstream(victim) << "precious";
  std::filesystem::create_symlink(victim, file());
  ostrel_channels_set(counter(open(), "frames"), 7);
  EXPECT_EQ(std::filesystem::file_size(victim), 8u);
  EXPECT_TRUE(std::filesystem::is_regular_file(std::filesystem::symlink_status(file())));
}

TEST_F(ChannelPublisher, AddsFromManyThreadsAndProcesses) {
  constexpr int kProcesses = 3;
  constexpr int kThreads = 4;
  constexpr int kTimes = 20000;
  std::vector<pid_t> children;
  for (int p = 0; p < kProcesses; ++p) {
    const pid_t child = ::fork();
    if (child == 0) {
      ostrel_channels* channels = nullptr;
      ostrel_channels_open_in(directory_.c_str(), "Speaker", "Stats", 64, &channels);
      std::vector<std::thread> threads;
      for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&, t] {
          ostrel_counter* shared = nullptr;
          ostrel_counter* own = nullptr;
          ostrel_channels_counter(channels, "shared", &shared);
          const std::string name = "own" + std::to_string(p * kThreads + t);
          ostrel_channels_counter(channels, name.c_str(), &own);
          for (int i = 0; i < kTimes; ++i) {
            ostrel_channels_add(shared, 1);
            ostrel_channels_add(own, 1);
          }
        });
      }
      for (std::thread& thread : threads) thread.join();
      ::_exit(0);
    }
    children.push_back(child);
  }
  for (const pid_t child : children) {
    int status = -1;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
  }
  ostrel_channels* const channels = open();
  EXPECT_EQ(ostrel_channels_get(counter(channels, "shared")),
            kProcesses * kThreads * kTimes);
  for (int i = 0; i < kProcesses * kThreads; ++i) {
    const std::string name = "own" + std::to_string(i);
    EXPECT_EQ(ostrel_channels_get(counter(channels, name.c_str())), kTimes);
  }
}

TEST_F(ChannelPublisher, OpensInTheRuntimeDirectory) {
  ::setenv("RUNTIME_DIRECTORY", directory_.c_str(), /*replace=*/1);
  ostrel_channels* channels = nullptr;
  EXPECT_EQ(ostrel_channels_open("Speaker", "Stats", 0, &channels), 0);
  ::unsetenv("RUNTIME_DIRECTORY");
  ostrel_channels_close(channels);
  EXPECT_EQ(std::filesystem::file_size(directory_ + "/channels/Speaker.Stats"),
            channels::fileBytes(OSTREL_CHANNELS_DEFAULT_COUNTERS));
}

TEST_F(ChannelPublisher, OpensBesideTheSocketOfItsService) {
  ::setenv("OSTREL_REPORTING_SOCKET", (directory_ + "/reporting.sock").c_str(),
           /*replace=*/1);
  ostrel_channels* channels = nullptr;
  EXPECT_EQ(ostrel_channels_open("Speaker", "Stats", 0, &channels), 0);
  ::unsetenv("OSTREL_REPORTING_SOCKET");
  ostrel_channels_close(channels);
  EXPECT_TRUE(std::filesystem::exists(directory_ + "/channels/Speaker.Stats"));
}

TEST_F(ChannelPublisher, ClosesNothing) { ostrel_channels_close(nullptr); }

}  // namespace
}  // namespace ostrel
