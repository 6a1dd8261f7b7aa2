#include "platform/linux/DirectoryFileSystem.h"

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

#include "platform/linux/store/StoreTesting.h"

namespace ostrel {
namespace {

namespace fs = std::filesystem;

TextSource textOf(std::string text) {
  return [text = std::move(text)](const TextWriter& write) { write(text); };
}

std::string readFile(const std::string& path) {
  std::ifstream file(path);
  std::ostringstream text;
  text << file.rdbuf();
  return text.str();
}

mode_t modeOf(const std::string& path) {
  struct stat status;
  return ::lstat(path.c_str(), &status) == 0 ? status.st_mode & 07777 : 0;
}

class DirectoryFileSystemTest : public ::testing::Test {
 protected:
  // The names in the logs' directory.
  std::vector<std::string> names() const {
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator(logs())) {
      names.push_back(entry.path().filename());
    }
    std::sort(names.begin(), names.end());
    return names;
  }

  std::string root() const { return directory_.path() + "/root"; }
  std::string logs() const { return root() + "/Audio/Reporting"; }
  std::string victim() const { return directory_.path() + "/victim"; }

  void makeLogs() {
    ASSERT_TRUE(files_.createDirectory(logs(), 0777).succeeded);
    std::ofstream(victim()) << "untouched";
  }

  TemporaryDirectory directory_;
  DirectoryFileSystem files_{root()};
};

TEST_F(DirectoryFileSystemTest, MakesDirectoriesWithTheirPermissionsWhateverTheUmask) {
  const mode_t before = ::umask(0077);
  EXPECT_TRUE(files_.createDirectory(logs(), 0777).succeeded);
  ::umask(before);
  EXPECT_EQ(modeOf(root() + "/Audio"), 0777u);
  EXPECT_EQ(modeOf(logs()), 0777u);
}

TEST_F(DirectoryFileSystemTest, LeavesTheModeOfDirectoriesThatExist) {
  fs::create_directories(root() + "/Audio");
  fs::permissions(root() + "/Audio", fs::perms(0750));
  EXPECT_TRUE(files_.createDirectory(logs(), 0777).succeeded);
  EXPECT_TRUE(files_.createDirectory(logs(), 0700).succeeded);
  EXPECT_EQ(modeOf(root() + "/Audio"), 0750u);
  EXPECT_EQ(modeOf(logs()), 0777u);
}

TEST_F(DirectoryFileSystemTest, MakesOneDirectoryFromManyThreads) {
  std::vector<std::thread> threads;
  for (int i = 0; i < 8; ++i) {
    threads.emplace_back(
        [this] { EXPECT_TRUE(files_.createDirectory(logs(), 0777).succeeded); });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(modeOf(logs()), 0777u);
}

TEST_F(DirectoryFileSystemTest, RefusesDirectoriesOutsideTheRoot) {
  for (const std::string& path : {directory_.path() + "/other", root() + "x/y",
                                  root() + "/../other", root() + "/./a"}) {
    const Success result = files_.createDirectory(path, 0777);
    EXPECT_FALSE(result.succeeded) << path;
    EXPECT_EQ(result.error->domain, kPOSIXErrorDomain);
    EXPECT_EQ(result.error->code, ENOENT);
  }
  EXPECT_FALSE(fs::exists(directory_.path() + "/other"));
}

TEST_F(DirectoryFileSystemTest, DoesNotFollowALinkInPlaceOfADirectory) {
  fs::create_directories(root());
  fs::create_directories(directory_.path() + "/elsewhere");
  fs::create_symlink(directory_.path() + "/elsewhere", root() + "/Audio");
  EXPECT_FALSE(files_.createDirectory(logs(), 0777).succeeded);
  EXPECT_FALSE(files_.writeFileAtomically(root() + "/Audio", "a", textOf("x")).succeeded);
  EXPECT_TRUE(fs::is_empty(directory_.path() + "/elsewhere"));
}

TEST_F(DirectoryFileSystemTest, FailsOnAFileInPlaceOfADirectory) {
  fs::create_directories(root());
  std::ofstream(root() + "/Audio") << "file";
  const Success result = files_.createDirectory(logs(), 0777);
  EXPECT_FALSE(result.succeeded);
  EXPECT_EQ(result.error->code, ENOTDIR);
}

TEST_F(DirectoryFileSystemTest, RefusesADirectoryOfAnotherUser) {
  makeLogs();
  static uid_t owner;
  FileCalls calls = FileCalls::system();
  calls.fstat = [](int file, struct stat* status) {
    const int result = ::fstat(file, status);
    status->st_uid = owner;
    return result;
  };
  DirectoryFileSystem files(root(), calls);
  for (const uid_t trusted : {::geteuid(), uid_t{0}}) {
    owner = trusted;
    EXPECT_TRUE(files.writeFileAtomically(logs(), "a", textOf("x")).succeeded);
  }
  owner = ::geteuid() + 1;
  for (const Success& result : {files.writeFileAtomically(logs(), "b", textOf("x")),
                                files.createDirectory(logs(), 0777)}) {
    EXPECT_FALSE(result.succeeded);
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->code, EPERM);
  }
  EXPECT_EQ(names(), std::vector<std::string>{"a"});
}

TEST_F(DirectoryFileSystemTest, WritesAFileReadableByItsGroupOnly) {
  makeLogs();
  const mode_t before = ::umask(0);
  EXPECT_TRUE(files_.writeFileAtomically(logs(), "a.json", textOf("text")).succeeded);
  ::umask(before);
  EXPECT_EQ(readFile(logs() + "/a.json"), "text");
  EXPECT_EQ(modeOf(logs() + "/a.json"), 0640u);
  EXPECT_EQ(names(), std::vector<std::string>{"a.json"});
}

TEST_F(DirectoryFileSystemTest, WritesManyPiecesInOrder) {
  makeLogs();
  std::string expected;
  for (int i = 0; i < 100000; ++i) expected += std::to_string(i) + ",";
  expected += std::string(200000, 'x');
  const TextSource pieces = [](const TextWriter& write) {
    for (int i = 0; i < 100000; ++i) write(std::to_string(i) + ",");
    write(std::string(200000, 'x'));
  };
  EXPECT_TRUE(files_.writeFileAtomically(logs(), "a", pieces).succeeded);
  EXPECT_EQ(readFile(logs() + "/a"), expected);
}

TEST_F(DirectoryFileSystemTest, ReplacesAnOlderFile) {
  makeLogs();
  EXPECT_TRUE(
      files_.writeFileAtomically(logs(), "a", textOf("older and longer")).succeeded);
  EXPECT_TRUE(files_.writeFileAtomically(logs(), "a", textOf("new")).succeeded);
  EXPECT_EQ(readFile(logs() + "/a"), "new");
}

TEST_F(DirectoryFileSystemTest, FailsWithoutAnErrorObjectWhenThereIsNoText) {
  makeLogs();
  const Success result = files_.writeFileAtomically(logs(), "a", std::nullopt);
  EXPECT_FALSE(result.succeeded);
  EXPECT_EQ(result.error, std::nullopt);
  EXPECT_TRUE(names().empty());
}

TEST_F(DirectoryFileSystemTest, RefusesNamesThatCannotExist) {
  makeLogs();
  for (const std::string& name :
       {std::string("a/b"), std::string("../a"), std::string("a\0b", 3), std::string(),
        std::string("."), std::string(".."), std::string("/")}) {
    const Success result = files_.writeFileAtomically(logs(), name, textOf("x"));
    EXPECT_FALSE(result.succeeded) << name;
    EXPECT_EQ(result.error->code, ENOENT);
  }
  EXPECT_TRUE(names().empty());
  EXPECT_EQ(fs::directory_iterator(root() + "/Audio")->path().filename(), "Reporting");
}

TEST_F(DirectoryFileSystemTest, TakesNamesOf255BytesAndNoMore) {
  makeLogs();
  EXPECT_TRUE(
      files_.writeFileAtomically(logs(), std::string(255, 'n'), textOf("x")).succeeded);
  const Success result =
      files_.writeFileAtomically(logs(), std::string(256, 'n'), textOf("x"));
  EXPECT_EQ(result.error->code, ENAMETOOLONG);
  EXPECT_EQ(names().size(), 1u);
}

TEST_F(DirectoryFileSystemTest, FailsInADirectoryThatIsMissing) {
  const Success result = files_.writeFileAtomically(logs(), "a", textOf("x"));
  EXPECT_FALSE(result.succeeded);
  EXPECT_EQ(result.error->code, ENOENT);
}

TEST_F(DirectoryFileSystemTest, ReplacesAPlantedLinkWithoutFollowingIt) {
  makeLogs();
  fs::create_symlink(victim(), logs() + "/a");
  EXPECT_TRUE(files_.writeFileAtomically(logs(), "a", textOf("mine")).succeeded);
  EXPECT_EQ(readFile(victim()), "untouched");
  EXPECT_FALSE(fs::is_symlink(logs() + "/a"));
  EXPECT_EQ(readFile(logs() + "/a"), "mine");
}

TEST_F(DirectoryFileSystemTest, ReplacesAHardLinkWithoutWritingThroughIt) {
  makeLogs();
  fs::create_hard_link(victim(), logs() + "/a");
  EXPECT_TRUE(files_.writeFileAtomically(logs(), "a", textOf("mine")).succeeded);
  EXPECT_EQ(readFile(victim()), "untouched");
}

TEST_F(DirectoryFileSystemTest, ReplacesAFIFOWithoutWaitingForAReader) {
  makeLogs();
  ASSERT_EQ(::mkfifo((logs() + "/a").c_str(), 0666), 0);
  EXPECT_TRUE(files_.writeFileAtomically(logs(), "a", textOf("mine")).succeeded);
  EXPECT_EQ(readFile(logs() + "/a"), "mine");
}

TEST_F(DirectoryFileSystemTest, FailsOnADirectoryAtTheFinalName) {
  makeLogs();
  fs::create_directory(logs() + "/a");
  const Success result = files_.writeFileAtomically(logs(), "a", textOf("x"));
  EXPECT_FALSE(result.succeeded);
  EXPECT_EQ(names(), std::vector<std::string>{"a"});
}

TEST_F(DirectoryFileSystemTest, NeverWritesThroughLinksPlantedMeanwhile) {
  makeLogs();
  std::atomic<bool> isDone{false};
  std::thread attacker([&] {
    while (!isDone) {
      std::error_code ignored;
      fs::remove(logs() + "/a", ignored);
      fs::create_symlink(victim(), logs() + "/a", ignored);
    }
  });
  for (int i = 0; i < 300; ++i) {
    EXPECT_TRUE(files_.writeFileAtomically(logs(), "a", textOf("mine")).succeeded);
  }
  isDone = true;
  attacker.join();
  EXPECT_EQ(readFile(victim()), "untouched");
}

// A failing call leaves the old file, and no other.
class DirectoryFileSystemFaults : public DirectoryFileSystemTest {
 protected:
  void expectFailure(const FileCalls& calls, int error) {
    makeLogs();
    ASSERT_TRUE(files_.writeFileAtomically(logs(), "a", textOf("old")).succeeded);
    DirectoryFileSystem failing(root(), calls);
    const Success result = failing.writeFileAtomically(logs(), "a", textOf("new"));
    EXPECT_FALSE(result.succeeded);
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->domain, kPOSIXErrorDomain);
    EXPECT_EQ(result.error->code, error);
    EXPECT_EQ(readFile(logs() + "/a"), "old");
    EXPECT_EQ(names(), std::vector<std::string>{"a"});
  }
};

TEST_F(DirectoryFileSystemFaults, AWriteErrorLeavesTheOldFile) {
  FileCalls calls = FileCalls::system();
  calls.write = [](int, const void*, std::size_t) -> ssize_t {
    errno = ENOSPC;
    return -1;
  };
  expectFailure(calls, ENOSPC);
}

TEST_F(DirectoryFileSystemFaults, ASyncErrorLeavesTheOldFile) {
  FileCalls calls = FileCalls::system();
  calls.fsync = [](int) {
    errno = EIO;
    return -1;
  };
  expectFailure(calls, EIO);
}

TEST_F(DirectoryFileSystemFaults, AnErrorOfTheModeLeavesTheOldFile) {
  FileCalls calls = FileCalls::system();
  calls.fchmod = [](int, mode_t) {
    errno = EROFS;
    return -1;
  };
  expectFailure(calls, EROFS);
}

TEST_F(DirectoryFileSystemFaults, ARenameErrorLeavesTheOldFile) {
  FileCalls calls = FileCalls::system();
  calls.renameat = [](int, const char*, int, const char*) {
    errno = EDQUOT;
    return -1;
  };
  expectFailure(calls, EDQUOT);
}

TEST_F(DirectoryFileSystemFaults, InterruptedAndShortWritesGoOn) {
  makeLogs();
  FileCalls calls = FileCalls::system();
  calls.write = [](int file, const void* bytes, std::size_t size) -> ssize_t {
    static bool isInterrupted = false;
    isInterrupted = !isInterrupted;
    if (isInterrupted) {
      errno = EINTR;
      return -1;
    }
    return ::write(file, bytes, std::min<std::size_t>(size, 3));
  };
  DirectoryFileSystem files(root(), calls);
  EXPECT_TRUE(files.writeFileAtomically(logs(), "a", textOf("a longer text")).succeeded);
  EXPECT_EQ(readFile(logs() + "/a"), "a longer text");
}

TEST_F(DirectoryFileSystemFaults, AFileThatIsTooLargeLeavesTheOldFile) {
  makeLogs();
  ASSERT_TRUE(files_.writeFileAtomically(logs(), "a", textOf("old")).succeeded);
  struct rlimit before;
  ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &before), 0);
  const struct rlimit small = {100'000, before.rlim_max};
  const auto handler = std::signal(SIGXFSZ, SIG_IGN);
  ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &small), 0);
  const Success result =
      files_.writeFileAtomically(logs(), "a", textOf(std::string(200'000, 'x')));
  ::setrlimit(RLIMIT_FSIZE, &before);
  std::signal(SIGXFSZ, handler);
  EXPECT_FALSE(result.succeeded);
  EXPECT_EQ(result.error->code, EFBIG);
  EXPECT_EQ(readFile(logs() + "/a"), "old");
  EXPECT_EQ(names(), std::vector<std::string>{"a"});
}

TEST_F(DirectoryFileSystemFaults, ATextThatThrowsLeavesTheOldFile) {
  makeLogs();
  const TextSource throwing = [](const TextWriter& write) {
    write("some");
    throw std::bad_alloc();
  };
  EXPECT_THROW(files_.writeFileAtomically(logs(), "a", throwing), std::bad_alloc);
  EXPECT_TRUE(names().empty());
}

}  // namespace
}  // namespace ostrel
