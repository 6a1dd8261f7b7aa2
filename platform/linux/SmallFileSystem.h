// For tests of a disk that is full: a file system of a few megabytes.
#pragma once

#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <stdexcept>
#include <string>
#include <utility>

namespace ostrel::testing_support {

/// An empty file system in memory, mounted over a directory, that only this process and
/// those it starts see, until its end. The process must have one thread when it is made.
class SmallFileSystem {
 public:
  struct Missing : std::runtime_error {
    Missing()
        : std::runtime_error(
              "no small file system can be mounted: that takes root, or "
              "a kernel that gives a user namespace to everybody") {}
  };

  /// `size` as mount takes it, such as "2m". Throws `Missing`.
  SmallFileSystem(std::string place, const std::string& size) : place_(std::move(place)) {
    if (!takeOwnMounts() || !mount(/*flags=*/0, size)) throw Missing();
  }
  ~SmallFileSystem() { ::umount2(place_.c_str(), MNT_DETACH); }
  SmallFileSystem(const SmallFileSystem&) = delete;
  SmallFileSystem& operator=(const SmallFileSystem&) = delete;

  bool resize(const std::string& size) { return mount(MS_REMOUNT, size); }
  bool makeReadOnly(const std::string& size) {
    return mount(MS_REMOUNT | MS_RDONLY, size);
  }

 private:
  // Whoever is not root is so in a user namespace, under the same IDs.
  static bool takeOwnMounts() {
    const uid_t user = ::geteuid();
    const gid_t group = ::getegid();
    const bool isTaken =
        ::unshare(CLONE_NEWNS) == 0 || (::unshare(CLONE_NEWUSER | CLONE_NEWNS) == 0 &&
                                        write("/proc/self/setgroups", "deny") &&
                                        write("/proc/self/uid_map", toItself(user)) &&
                                        write("/proc/self/gid_map", toItself(group)));
    return isTaken && ::mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0;
  }
  static std::string toItself(unsigned id) {
    return std::to_string(id) + ' ' + std::to_string(id) + " 1";
  }
  static bool write(const char* path, const std::string& text) {
    return (std::ofstream(path) << text << std::flush).good();
  }
  bool mount(unsigned long flags, const std::string& size) {
    return ::mount("none", place_.c_str(), "tmpfs", flags, ("size=" + size).c_str()) == 0;
  }

  const std::string place_;
};

/// Calls `steps`, which makes a `SmallFileSystem` first, in a child process. Fails the
/// test unless they return 0; else they return the number of the step that failed.
template <typename Steps>
void expectInChildWithSmallFileSystem(const Steps& steps) {
  constexpr int kMissing = 77;
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    int result = kMissing;
    try {
      result = steps();
    } catch (const SmallFileSystem::Missing&) {
    }
    ::_exit(result);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, /*options=*/0), child);
  ASSERT_TRUE(WIFEXITED(status)) << "signal " << WTERMSIG(status);
  if (WEXITSTATUS(status) == kMissing) FAIL() << SmallFileSystem::Missing().what();
  EXPECT_EQ(WEXITSTATUS(status), 0) << "the step that failed";
}

}  // namespace ostrel::testing_support
