#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <string>
#include <vector>

namespace ostrel::bench {

using Clock = std::chrono::steady_clock;
using Seconds = std::chrono::duration<double>;

/// Says what went wrong and ends the run: a figure of a broken run is none.
[[noreturn]] void fail(const std::string& sentence);

/// An error of the system, with `errno` in words.
[[noreturn]] void failWithErrno(const std::string& what);

/// What the kernel says of a process's memory, in bytes.
struct Memory {
  std::uint64_t resident = 0;
  std::uint64_t anonymous = 0;  // Of the resident: neither files nor shared.
  std::uint64_t peakResident = 0;
  std::uint64_t threads = 0;
};

/// A process that this one made; it is ended with this object.
class ChildProcess {
 public:
  struct Settings {
    std::vector<std::string> environment;  // "NAME=value", besides our own.
    std::string outputPath;                // For both outputs; empty: as ours.
    int onlyCPU = -1;                      // -1: any.
  };

  /// Runs `body` in a copy of this process, which must have no other thread.
  static ChildProcess fork(const std::function<void()>& body, int onlyCPU = -1);
  static ChildProcess execute(const std::vector<std::string>& command,
                              const Settings& settings);

  ChildProcess(ChildProcess&& other) noexcept;
  ChildProcess& operator=(ChildProcess&&) = delete;
  /// Asks it to end, and after 3 s makes it.
  ~ChildProcess();

  /// Waits until it ends of itself. The exit status, or 128 and the signal.
  int wait();

  pid_t pid() const { return pid_; }
  bool isRunning() const;

  /// Processor time of all of its threads.
  Seconds processorTime() const;
  Memory memory() const;
  /// Begins a new peak of the resident memory.
  void forgetPeakMemory() const;
  /// How often its threads went to sleep of themselves and woke up again.
  std::uint64_t wakeups() const;

 private:
  explicit ChildProcess(pid_t pid) : pid_(pid) {}

  pid_t pid_ = -1;
};

/// Processor time of this process.
Seconds ownProcessorTime();

/// Binds the calling thread, and those it makes, to one processor; -1: to all.
void useOnlyCPU(int cpu);

/// A new directory below the system's place for temporary files, removed with all
/// that is in it.
class PrivateDirectory {
 public:
  PrivateDirectory();
  ~PrivateDirectory();
  PrivateDirectory(const PrivateDirectory&) = delete;
  PrivateDirectory& operator=(const PrivateDirectory&) = delete;

  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

}  // namespace ostrel::bench
