#pragma once

#include <atomic>
#include <chrono>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/ChangeNotification.h"
#include "platform/linux/FileDescriptor.h"

namespace ostrel {

/// Notifications as files in one directory: a notification is posted by whatever
/// writes, replaces or touches the file of its name. The directory is made when it
/// is missing, also when somebody removes it later; a file that is found in it then
/// counts as posted.
///
/// The first post of a name is handed on at once or 10 ms after another's, those that
/// follow within `kShortestInterval` as one at its end. While steps that earlier ones
/// queued have not run, of `kMostUnderWay` of them, it is one in `kIntervalBehind`: such
/// steps may be one for each session, and wait for as long as its start takes. The
/// thread, which is started by the first registration, sleeps between posts.
class InotifyChangeNotification final : public ChangeNotification {
 public:
  static constexpr std::chrono::milliseconds kShortestInterval{100};
  static constexpr int kMostUnderWay = 4;
  static constexpr std::chrono::milliseconds kIntervalBehind{2000};

  /// The directory above `directory` need not exist either.
  explicit InotifyChangeNotification(std::string directory);
  ~InotifyChangeNotification() override;

  /// The runtime directory + "/notify".
  static std::string systemDirectory();

  /// The status is an `errno` value when the name cannot be one of a file or the
  /// directory cannot be watched.
  Registration registerDispatch(std::string_view name, std::shared_ptr<WorkQueue> queue,
                                Handler handler) override;

 private:
  using Time = std::chrono::steady_clock::time_point;

  struct Registered {
    std::string name;
    int token;
    std::shared_ptr<WorkQueue> queue;
    std::shared_ptr<const Handler> handler;
    Time quietUntil{};
    Time behindUntil{};
    std::shared_ptr<std::atomic<int>> underWay = std::make_shared<std::atomic<int>>(0);
    bool isPosted = false;
  };

  int start();
  bool watch();
  void run();
  int waitMilliseconds();
  bool readEvents();
  void post(std::string_view name);
  void postAll();
  void postExisting();
  void handOn();
  void lostDirectory();
  void watchAgain();

  const std::string directory_;
  FileDescriptor inotify_;
  FileDescriptor stopEvent_;
  std::thread thread_;

  // On the thread, and before it starts.
  int watch_ = -1;
  std::chrono::milliseconds retryDelay_{};
  Time retryAt_{};

  std::mutex mutex_;  // Guards all below.
  std::vector<Registered> registered_;
};

}  // namespace ostrel
