#include "forwarder/StoreWatch.h"

#include <poll.h>
#include <sys/inotify.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <iterator>

#include "platform/Logging.h"

namespace ostrel {
namespace {

using std::chrono::milliseconds;

constexpr std::uint32_t kEvents =
    IN_MODIFY | IN_CREATE | IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;
constexpr std::uint32_t kDirectoryIsGone = IN_DELETE_SELF | IN_MOVE_SELF | IN_IGNORED;

// Where the kernel has no watch to give.
constexpr milliseconds kWithoutWatch{60'000};

std::string directoryOf(const std::string& path) {
  const auto directory = std::filesystem::absolute(path).parent_path();
  return directory.lexically_normal().string();
}

}  // namespace

StoreWatch::StoreWatch(const std::string& storePath, int end, milliseconds settling)
    : directory_(directoryOf(storePath)),
      name_(std::filesystem::path(storePath).filename()),
      end_(end),
      settling_(settling),
      inotify_(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK)),
      timer_(::timerfd_create(CLOCK_BOOTTIME, TFD_CLOEXEC | TFD_NONBLOCK)) {
  watch();
}

bool StoreWatch::forChange() {
  while (!isChanged()) {
    if (watch_ < 0) return forTime(kWithoutWatch);
    if (!waitForEvents()) return false;
  }
  const bool goesOn = forTime(settling_);
  readEvents();
  return goesOn;
}

bool StoreWatch::forTime(milliseconds pause) {
  const auto seconds = std::chrono::duration_cast<std::chrono::seconds>(pause);
  itimerspec due{};
  due.it_value.tv_sec = seconds.count();
  due.it_value.tv_nsec = std::chrono::nanoseconds(pause - seconds).count();
  // A time of nothing would stop the timer.
  if (pause <= milliseconds(0)) due.it_value.tv_nsec = 1;
  ::timerfd_settime(timer_.get(), /*flags=*/0, &due, /*old_value=*/nullptr);
  pollfd descriptors[] = {{timer_.get(), POLLIN, 0}, {end_, POLLIN, 0}};
  while (::poll(descriptors, std::size(descriptors), /*timeout=*/-1) < 0 &&
         errno == EINTR) {
  }
  return descriptors[1].revents == 0;
}

bool StoreWatch::waitForEvents() {
  pollfd descriptors[] = {{inotify_.get(), POLLIN, 0}, {end_, POLLIN, 0}};
  while (::poll(descriptors, std::size(descriptors), /*timeout=*/-1) < 0 &&
         errno == EINTR) {
  }
  return descriptors[1].revents == 0;
}

bool StoreWatch::isChanged() {
  if (watchesStore_ && readEvents()) return true;
  // A store may have come with its directory.
  return !watchesStore_ && watch();
}

/// Watches the directory of the store or, where it is not there yet, the deepest one
/// above it. True when it is that of the store.
bool StoreWatch::watch() {
  for (;;) {
    std::filesystem::path directory = directory_;
    const int before = watch_;
    while (!tryToWatch(directory) && directory != directory.root_path()) {
      directory = directory.parent_path();
    }
    if (before >= 0 && before != watch_) ::inotify_rm_watch(inotify_.get(), before);
    watchesStore_ = directory == directory_;
    readEvents();  // Of what was watched before; it may be gone again, too.
    if (watch_ < 0 || watchesStore_) return watchesStore_;
    // What came to be before the watch did would not be told.
    std::filesystem::path below = directory_;
    while (below != directory && below.parent_path() != directory) {
      below = below.parent_path();
    }
    std::error_code ignored;
    if (!std::filesystem::is_directory(below, ignored)) return false;
  }
}

bool StoreWatch::tryToWatch(const std::string& directory) {
  watch_ = ::inotify_add_watch(inotify_.get(), directory.c_str(), kEvents);
  if (watch_ < 0 && errno != ENOENT && errno != ENOTDIR) {
    OSTREL_LOG_ERROR(processLogScope, "cannot watch %@: %@", directory,
                     std::strerror(errno));
  }
  return watch_ >= 0;
}

/// Takes all events; whether one of them was of the store.
bool StoreWatch::readEvents() {
  alignas(inotify_event) std::array<char, 16384> buffer;
  bool isChanged = false;
  for (;;) {
    const ssize_t size = ::read(inotify_.get(), buffer.data(), buffer.size());
    if (size <= 0) return isChanged;
    for (const char* at = buffer.data(); at < buffer.data() + size;) {
      const auto& event = *reinterpret_cast<const inotify_event*>(at);
      at += sizeof(inotify_event) + event.len;
      if ((event.mask & IN_Q_OVERFLOW) != 0) {
        isChanged = true;
      } else if (event.wd != watch_) {
        continue;  // Of a directory that was watched before.
      } else if ((event.mask & kDirectoryIsGone) != 0) {
        watchesStore_ = false;
      } else if (event.len != 0 && isOfStore(event.mask, event.name)) {
        isChanged = true;
      }
    }
  }
}

/// Reading a store may make and remove its log and its index, which is no change.
bool StoreWatch::isOfStore(std::uint32_t mask, const char* name) const {
  if (name == name_) return true;
  return name == name_ + "-wal" && (mask & IN_MODIFY) != 0;
}

}  // namespace ostrel
