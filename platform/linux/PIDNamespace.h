// For tests of processes whose IDs are taken again: a namespace of process IDs.
#pragma once

#include <sched.h>
#include <sys/mount.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <functional>
#include <string>

namespace ostrel::testing_support {

inline constexpr const char* kPIDNamespaceMissing =
    "no process can have an ID of the test's choice: that takes a namespace of process "
    "IDs with a /proc of its own, thus root, or a kernel that gives a user namespace to "
    "everybody";

/// Writes a file of the kernel's.
inline bool writeSetting(const std::string& path, const std::string& text) {
  return (std::ofstream(path) << text << std::flush).good();
}

/// The next process that this one starts in its namespace gets `pid`, if that is free.
inline bool chooseNextPID(pid_t pid) {
  return writeSetting("/proc/sys/kernel/ns_last_pid", std::to_string(pid - 1));
}

/// Takes namespaces of its own for what the calling process starts. It must have one
/// thread. Whoever is not root is so in a user namespace, under the same IDs.
inline bool takePIDNamespace() {
  const std::string user = std::to_string(::geteuid());
  const std::string group = std::to_string(::getegid());
  constexpr int kOwn = CLONE_NEWPID | CLONE_NEWNS;
  const bool isTaken = ::unshare(kOwn) == 0 ||
                       (::unshare(CLONE_NEWUSER | kOwn) == 0 &&
                        writeSetting("/proc/self/setgroups", "deny") &&
                        writeSetting("/proc/self/uid_map", user + ' ' + user + " 1") &&
                        writeSetting("/proc/self/gid_map", group + ' ' + group + " 1"));
  return isTaken && ::mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0;
}

/// Calls `steps` in the first process of a namespace of its own, which has a /proc that
/// fits, and returns what it returns; all that it started ends with it. -1 where there is
/// no such thing.
inline int inPIDNamespace(const std::function<int()>& steps) {
  constexpr int kMissing = 77;
  const auto statusOf = [](pid_t child) {
    int status = 0;
    const bool hasEnded = ::waitpid(child, &status, /*options=*/0) == child;
    return hasEnded && WIFEXITED(status) ? WEXITSTATUS(status) : 128;
  };
  const pid_t outer = ::fork();
  if (outer == 0) {
    if (!takePIDNamespace()) ::_exit(kMissing);
    const pid_t first = ::fork();
    if (first != 0) ::_exit(first > 0 ? statusOf(first) : kMissing);
    const bool isThere =
        ::mount("none", "/proc", "proc", 0, nullptr) == 0 && chooseNextPID(2);
    ::_exit(isThere ? steps() : kMissing);
  }
  const int status = outer > 0 ? statusOf(outer) : kMissing;
  return status == kMissing ? -1 : status;
}

}  // namespace ostrel::testing_support
