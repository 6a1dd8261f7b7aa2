#include "platform/linux/InotifyChangeNotification.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <filesystem>
#include <optional>
#include <system_error>

#include "platform/Logging.h"
#include "platform/linux/Burden.h"
#include "platform/linux/Places.h"
#include "platform/linux/Threads.h"

namespace ostrel {
namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;

// What writes, replaces or touches a file; what happens to the directory itself.
constexpr std::uint32_t kEvents =
    IN_CLOSE_WRITE | IN_MOVED_TO | IN_ATTRIB | IN_DELETE_SELF | IN_MOVE_SELF;

// What comes in this time is looked at together: a flood costs no more than that, however
// often a file is touched and whatever its name.
constexpr milliseconds kPauseOfReading{10};

// Counts a post until the last step has run that came of it.
class PostUnderWay final : public Burden {
 public:
  explicit PostUnderWay(std::shared_ptr<std::atomic<int>> count)
      : Burden(PayloadAccount::kNobody), count_(std::move(count)) {
    ++*count_;
  }

 private:
  ~PostUnderWay() override { --*count_; }

  const std::shared_ptr<std::atomic<int>> count_;
};

// Whoever replaces the directory is given this long to do it himself.
constexpr milliseconds kFirstRetry{50};
constexpr milliseconds kSecondRetry{1000};
constexpr milliseconds kLongestRetry{60000};

// With the permissions of the directory above, so that who may write there may
// post.
void makeDirectory(const std::string& directory) {
  const std::filesystem::path above = std::filesystem::path(directory).parent_path();
  std::error_code ignored;
  std::filesystem::create_directories(above, ignored);
  struct stat status {};
  if (::stat(above.c_str(), &status) != 0) return;
  if (::mkdir(directory.c_str(), status.st_mode & 0777) == 0) {
    ::chmod(directory.c_str(), status.st_mode & 07777);
  }
}

}  // namespace

InotifyChangeNotification::InotifyChangeNotification(std::string directory)
    : directory_(std::move(directory)) {}

InotifyChangeNotification::~InotifyChangeNotification() {
  if (!thread_.joinable()) return;
  const std::uint64_t one = 1;
  if (::write(stopEvent_.get(), &one, sizeof one) < 0) std::abort();
  thread_.join();
}

std::string InotifyChangeNotification::systemDirectory() {
  return runtimeDirectory() + "/notify";
}

ChangeNotification::Registration InotifyChangeNotification::registerDispatch(
    std::string_view name, std::shared_ptr<WorkQueue> queue, Handler handler) {
  if (name.empty() || name.size() > NAME_MAX ||
      name.find('/') != std::string_view::npos ||
      name.find('\0') != std::string_view::npos) {
    return {EINVAL, /*token=*/-1};
  }
  const std::lock_guard lock(mutex_);
  if (!thread_.joinable()) {
    if (const int error = start(); error != 0) return {error, /*token=*/-1};
  }
  const int token = static_cast<int>(registered_.size()) + 1;
  registered_.push_back({std::string(name), token, std::move(queue),
                         std::make_shared<const Handler>(std::move(handler))});
  return {/*status=*/0, token};
}

// Starts to watch. 0, or the error.
int InotifyChangeNotification::start() {
  inotify_.reset(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
  stopEvent_.reset(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!inotify_ || !stopEvent_) return errno;
  makeDirectory(directory_);
  if (!watch()) return errno;
  try {
    thread_ = startThread("notifications", /*niceness=*/0, [this] { run(); });
  } catch (const std::system_error& error) {
    return error.code().value();
  }
  return 0;
}

bool InotifyChangeNotification::watch() {
  watch_ = ::inotify_add_watch(inotify_.get(), directory_.c_str(), kEvents | IN_ONLYDIR);
  return watch_ >= 0;
}

void InotifyChangeNotification::run() {
  for (bool isFlood = false;;) {
    pollfd descriptors[] = {{stopEvent_.get(), POLLIN, 0}, {inotify_.get(), POLLIN, 0}};
    if (isFlood) {
      ::poll(descriptors, /*nfds=*/1, static_cast<int>(kPauseOfReading.count()));
    } else {
      ::poll(descriptors, std::size(descriptors), waitMilliseconds());
    }
    if (descriptors[0].revents != 0) return;
    isFlood = readEvents();
    if (watch_ < 0 && steady_clock::now() >= retryAt_) watchAgain();
    handOn();
  }
}

// Until something is due; -1 when nothing is.
int InotifyChangeNotification::waitMilliseconds() {
  std::optional<Time> due;
  if (watch_ < 0) due = retryAt_;
  const std::lock_guard lock(mutex_);
  for (const Registered& one : registered_) {
    if (one.isPosted) due = std::min(due.value_or(one.quietUntil), one.quietUntil);
  }
  if (!due) return -1;
  const auto left = std::chrono::ceil<milliseconds>(*due - steady_clock::now());
  return static_cast<int>(std::max(left, milliseconds(0)).count());
}

// False when there was none.
bool InotifyChangeNotification::readEvents() {
  alignas(inotify_event) std::array<char, 16384> buffer;
  for (bool isAny = false;; isAny = true) {
    const ssize_t size = ::read(inotify_.get(), buffer.data(), buffer.size());
    if (size <= 0) return isAny;
    for (const char* at = buffer.data(); at < buffer.data() + size;) {
      const auto& event = *reinterpret_cast<const inotify_event*>(at);
      at += sizeof(inotify_event) + event.len;
      if ((event.mask & IN_Q_OVERFLOW) != 0) {
        postAll();
      } else if (event.wd != watch_) {
        continue;  // Of a directory that was there before.
      } else if ((event.mask & (IN_DELETE_SELF | IN_MOVE_SELF | IN_IGNORED)) != 0) {
        lostDirectory();
      } else if (event.len != 0) {
        post(event.name);
      }
    }
  }
}

void InotifyChangeNotification::post(std::string_view name) {
  const std::lock_guard lock(mutex_);
  for (Registered& one : registered_) {
    if (one.name == name) one.isPosted = true;
  }
}

void InotifyChangeNotification::postAll() {
  const std::lock_guard lock(mutex_);
  for (Registered& one : registered_) one.isPosted = true;
}

void InotifyChangeNotification::postExisting() {
  const std::lock_guard lock(mutex_);
  for (Registered& one : registered_) {
    struct stat status {};
    const std::string path = directory_ + "/" + one.name;
    if (::lstat(path.c_str(), &status) == 0) one.isPosted = true;
  }
}

// Queues the handlers whose interval is over.
void InotifyChangeNotification::handOn() {
  const auto now = steady_clock::now();
  const std::lock_guard lock(mutex_);
  for (Registered& one : registered_) {
    if (!one.isPosted || now < one.quietUntil) continue;
    one.quietUntil = now + kShortestInterval;
    if (*one.underWay >= kMostUnderWay && now < one.behindUntil) continue;
    one.behindUntil = now + kIntervalBehind;
    one.isPosted = false;
    const BurdenShare underWay(new PostUnderWay(one.underWay));
    const Burden::Scope bearing(underWay.get());
    one.queue->async([handler = one.handler, token = one.token] { (*handler)(token); });
  }
}

void InotifyChangeNotification::lostDirectory() {
  ::inotify_rm_watch(inotify_.get(), watch_);
  watch_ = -1;
  retryDelay_ = kFirstRetry;
  retryAt_ = steady_clock::now() + retryDelay_;
}

void InotifyChangeNotification::watchAgain() {
  if (retryDelay_ != kFirstRetry) makeDirectory(directory_);
  if (watch()) {
    postExisting();
    return;
  }
  if (retryDelay_ == kSecondRetry) {
    OSTREL_LOG_ERROR(processLogScope, "cannot watch %@ for notifications: error %i",
                     directory_, errno);
  }
  retryDelay_ = retryDelay_ == kFirstRetry ? kSecondRetry
                                           : std::min(retryDelay_ * 2, kLongestRetry);
  retryAt_ = steady_clock::now() + retryDelay_;
}

}  // namespace ostrel
