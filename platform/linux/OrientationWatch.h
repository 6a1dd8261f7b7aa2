#pragma once

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/OrientationService.h"
#include "platform/linux/FileDescriptor.h"
#include "platform/linux/Limits.h"

namespace ostrel {

/// Where one kind of orientation comes from.
class OrientationSource {
 public:
  using Code = OrientationService::OrientationCode;
  using Report = std::function<void(Code)>;

  virtual ~OrientationSource() = default;

  /// False when there is nothing to watch on this machine. Any thread.
  virtual bool isConfigured() const = 0;

  /// Watches the source and reports what it says, changed or not, until
  /// `stopDescriptor` becomes readable. Whatever is wrong with the source, it is
  /// tried again. May be called again after it returned.
  virtual void run(int stopDescriptor, const Report& report) = 0;
};

/// The waits between attempts: doubled from the first to the longest.
class BackOff {
 public:
  explicit BackOff(std::chrono::milliseconds first) : first_(first), next_(first) {}

  std::chrono::milliseconds next() {
    const auto wait = next_;
    next_ = std::min(next_ * 2, kLongest);
    return wait;
  }
  void reset() { next_ = first_; }

  static constexpr std::chrono::milliseconds kFirst{1000};
  static constexpr std::chrono::milliseconds kLongest{60000};

 private:
  const std::chrono::milliseconds first_;
  std::chrono::milliseconds next_;
};

/// Sleeps for `time`, or for ever when it is negative, or until `stopDescriptor` is
/// readable. True: it is.
bool waitForStop(int stopDescriptor, std::chrono::milliseconds time);

/// The observers of one kind, and the thread that runs their source while there
/// are any. The first report after the source was started is what holds, not a
/// change; nor is one that says the same again.
class OrientationWatch {
 public:
  using Code = OrientationSource::Code;
  using Callback = OrientationService::Callback;

  /// Changes handed on per second; what exceeds them is dropped and counted.
  static constexpr int kMostChangesPerSecond = limits::kOrientationChangesPerSecond;
  /// Between two lines that say how many were dropped.
  static constexpr std::chrono::minutes kShortestLogInterval{1};

  /// `threadName` has at most 15 bytes. One observer more than `mostObservers` takes the
  /// place of the one that is there longest, which a line says once in a while.
  OrientationWatch(std::string threadName, std::unique_ptr<OrientationSource> source,
                   std::size_t mostObservers = limits::kOrientationObservers);
  OrientationWatch(const OrientationWatch&) = delete;
  OrientationWatch& operator=(const OrientationWatch&) = delete;
  /// Waits for the thread. Not called by a callback.
  ~OrientationWatch();

  // Neither blocks on the source. Any thread, callbacks included.
  void add(const std::string& id, Callback callback);
  void remove(const std::string& id);

 private:
  struct Observer {
    std::shared_ptr<const Callback> callback;
    std::uint64_t order = 0;  // Its key in `byOrder_`.
  };

  void startThread();
  void run();
  void report(Code code);
  bool mayHandOn();
  std::shared_ptr<const Callback> takeOldest();

  const std::string threadName_;
  const std::size_t mostObservers_;
  const std::unique_ptr<OrientationSource> source_;
  const FileDescriptor stopEvent_;

  // On the thread.
  std::optional<Code> last_;
  double allowance_ = kMostChangesPerSecond;
  std::chrono::steady_clock::time_point allowanceAt_{};
  std::uint64_t dropped_ = 0;
  std::chrono::steady_clock::time_point droppedLoggedAt_{};

  std::mutex mutex_;  // Guards all below.
  std::condition_variable ended_;
  std::map<std::string, Observer> observers_;
  std::map<std::uint64_t, std::string> byOrder_;  // Who came first stands first.
  std::uint64_t nextOrder_ = 0;
  std::chrono::steady_clock::time_point crowdLoggedAt_{};
  bool isRunning_ = false;
};

}  // namespace ostrel
