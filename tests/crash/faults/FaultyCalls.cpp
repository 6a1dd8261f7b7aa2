// Stands between the service and the system: calls that are made through here fail when
// a test wants them to. The linker finds these functions before those of the libraries.
#include <dlfcn.h>
#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/file.h>
#include <sys/inotify.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <cstdlib>
#include <new>

#include "tests/crash/FaultPlan.h"

namespace {

using ostrel::crash::Call;
using ostrel::crash::SharedFaults;

SharedFaults* faults = nullptr;
sqlite3_mem_methods sqliteMemory;

template <typename Function>
Function* below(Function*, const char* name) {
  return reinterpret_cast<Function*>(::dlsym(RTLD_NEXT, name));
}

// Whether this call fails, with `errno` set then.
bool mustFail(Call call) {
  if (faults == nullptr) return false;
  faults->calls[static_cast<std::size_t>(call)].fetch_add(1);
  if ((faults->kinds.load() & 1U << static_cast<unsigned>(call)) == 0) return false;
  const std::int64_t number = faults->matched.fetch_add(1);
  const std::int64_t after = faults->after.load();
  if (number < after || (number > after && !faults->isForEver.load())) return false;
  faults->failed.fetch_add(1);
  if (faults->error.load() == SharedFaults::kKill) {
    ::kill(::getpid(), SIGKILL);
    ::pause();
  }
  errno = faults->error.load();
  return true;
}

void* allocate(std::size_t size) {
  void* memory = mustFail(Call::kAllocate) ? nullptr : std::malloc(size);
  if (memory == nullptr) throw std::bad_alloc();
  return memory;
}

// Before everything else, SQLite included.
__attribute__((constructor(101))) void mapFaults() {
  const char* path = std::getenv("OSTREL_FAULTS");
  const int file = path != nullptr ? ::open(path, O_RDWR | O_CLOEXEC) : -1;
  if (file < 0) return;
  void* memory = ::mmap(nullptr, sizeof(SharedFaults), PROT_READ | PROT_WRITE, MAP_SHARED,
                        file, /*offset=*/0);
  ::close(file);
  if (memory == MAP_FAILED) return;
  ::sqlite3_config(SQLITE_CONFIG_GETMALLOC, &sqliteMemory);
  static sqlite3_mem_methods failing;
  failing = sqliteMemory;
  failing.xMalloc = [](int size) {
    return mustFail(Call::kSQLiteAllocate) ? nullptr : sqliteMemory.xMalloc(size);
  };
  failing.xRealloc = [](void* old, int size) {
    return mustFail(Call::kSQLiteAllocate) ? nullptr : sqliteMemory.xRealloc(old, size);
  };
  ::sqlite3_config(SQLITE_CONFIG_MALLOC, &failing);
  faults = static_cast<SharedFaults*>(memory);
  // What fails for ever must not outlive the test that wants it to.
  ::prctl(PR_SET_PDEATHSIG, SIGKILL);
}

// A file, pipe or socket, and no event of the kernel's: those do not fail.
bool hasPlace(int file) {
  struct statx status;
  return ::syscall(SYS_statx, file, "", AT_EMPTY_PATH, STATX_TYPE, &status) == 0 &&
         (status.stx_mode & S_IFMT) != 0;
}

mode_t modeOf(int flags, va_list arguments) {
  return (flags & (O_CREAT | O_TMPFILE)) != 0 ? va_arg(arguments, mode_t) : 0;
}

}  // namespace

void* operator new(std::size_t size) { return allocate(size != 0 ? size : 1); }
void* operator new(std::size_t size, std::align_val_t alignment) {
  void* memory =
      mustFail(Call::kAllocate)
          ? nullptr
          : std::aligned_alloc(static_cast<std::size_t>(alignment),
                               (size + static_cast<std::size_t>(alignment) - 1) /
                                   static_cast<std::size_t>(alignment) *
                                   static_cast<std::size_t>(alignment));
  if (memory == nullptr) throw std::bad_alloc();
  return memory;
}
void operator delete(void* memory) noexcept { std::free(memory); }
void operator delete(void* memory, std::size_t) noexcept { std::free(memory); }
void operator delete(void* memory, std::align_val_t) noexcept { std::free(memory); }
void operator delete(void* memory, std::size_t, std::align_val_t) noexcept {
  std::free(memory);
}

// A function `name` that fails with -1.
#define OSTREL_FAULTY(kind, result, name, parameters, arguments) \
  result name parameters {                                       \
    if (mustFail(Call::kind)) return -1;                         \
    static const auto next = below(&name, #name);                \
    return next arguments;                                       \
  }

extern "C" {

OSTREL_FAULTY(kAccept, int, accept4,
              (int socket, sockaddr* address, socklen_t* size, int flags),
              (socket, address, size, flags))
OSTREL_FAULTY(kReceive, ssize_t, recvmsg, (int socket, msghdr* message, int flags),
              (socket, message, flags))
OSTREL_FAULTY(kReceive, ssize_t, recv, (int socket, void* bytes, size_t size, int flags),
              (socket, bytes, size, flags))
OSTREL_FAULTY(kSend, ssize_t, sendmsg, (int socket, const msghdr* message, int flags),
              (socket, message, flags))
OSTREL_FAULTY(kSend, ssize_t, send,
              (int socket, const void* bytes, size_t size, int flags),
              (socket, bytes, size, flags))
OSTREL_FAULTY(kRead, ssize_t, pread, (int file, void* bytes, size_t size, off_t offset),
              (file, bytes, size, offset))
OSTREL_FAULTY(kRead, ssize_t, pread64,
              (int file, void* bytes, size_t size, off64_t offset),
              (file, bytes, size, offset))
OSTREL_FAULTY(kWrite, ssize_t, pwrite64,
              (int file, const void* bytes, size_t size, off64_t offset),
              (file, bytes, size, offset))
OSTREL_FAULTY(kSync, int, fsync, (int file), (file))
OSTREL_FAULTY(kSync, int, fdatasync, (int file), (file))
OSTREL_FAULTY(kRename, int, rename, (const char* from, const char* to) noexcept,
              (from, to))
OSTREL_FAULTY(kRename, int, renameat,
              (int fromDirectory, const char* from, int toDirectory,
               const char* to) noexcept,
              (fromDirectory, from, toDirectory, to))
OSTREL_FAULTY(kTruncate, int, ftruncate, (int file, off_t size) noexcept, (file, size))
OSTREL_FAULTY(kTruncate, int, ftruncate64, (int file, off64_t size) noexcept,
              (file, size))
OSTREL_FAULTY(kStatus, int, fstat64, (int file, struct stat64* status) noexcept,
              (file, status))
OSTREL_FAULTY(kStatus, int, fstat, (int file, struct stat* status) noexcept,
              (file, status))
OSTREL_FAULTY(kDirectory, int, mkdir, (const char* path, mode_t mode) noexcept,
              (path, mode))
OSTREL_FAULTY(kPoll, int, epoll_wait,
              (int poll, epoll_event* events, int most, int timeout),
              (poll, events, most, timeout))
OSTREL_FAULTY(kPollControl, int, epoll_ctl,
              (int poll, int operation, int file, epoll_event* event) noexcept,
              (poll, operation, file, event))
OSTREL_FAULTY(kPollControl, int, epoll_create1, (int flags) noexcept, (flags))
OSTREL_FAULTY(kEvent, int, eventfd, (unsigned count, int flags) noexcept, (count, flags))
OSTREL_FAULTY(kWatch, int, inotify_init1, (int flags) noexcept, (flags))
OSTREL_FAULTY(kWatch, int, inotify_add_watch,
              (int watch, const char* path, std::uint32_t mask) noexcept,
              (watch, path, mask))
OSTREL_FAULTY(kSocket, int, socket, (int domain, int type, int protocol) noexcept,
              (domain, type, protocol))
OSTREL_FAULTY(kSocket, int, bind,
              (int socket, const sockaddr* address, socklen_t size) noexcept,
              (socket, address, size))
OSTREL_FAULTY(kSocket, int, listen, (int socket, int backlog) noexcept, (socket, backlog))
OSTREL_FAULTY(kLock, int, flock, (int file, int operation) noexcept, (file, operation))

ssize_t read(int file, void* bytes, size_t size) {
  if (hasPlace(file) && mustFail(Call::kRead)) return -1;
  static const auto next = below(&read, "read");
  return next(file, bytes, size);
}

ssize_t write(int file, const void* bytes, size_t size) {
  if (hasPlace(file) && mustFail(Call::kWrite)) return -1;
  static const auto next = below(&write, "write");
  return next(file, bytes, size);
}

int fcntl64(int file, int command, ...) {
  va_list arguments;
  va_start(arguments, command);
  void* argument = va_arg(arguments, void*);
  va_end(arguments);
  // Giving a lock back does not fail.
  const bool isLock =
      command == F_SETLK && static_cast<struct flock*>(argument)->l_type != F_UNLCK;
  if (isLock && mustFail(Call::kLock)) return -1;
  static const auto next = below(&fcntl64, "fcntl64");
  return next(file, command, argument);
}

int open(const char* path, int flags, ...) {
  va_list arguments;
  va_start(arguments, flags);
  const mode_t mode = modeOf(flags, arguments);
  va_end(arguments);
  if (mustFail(Call::kOpen)) return -1;
  static const auto next = below(&open, "open");
  return next(path, flags, mode);
}

int open64(const char* path, int flags, ...) {
  va_list arguments;
  va_start(arguments, flags);
  const mode_t mode = modeOf(flags, arguments);
  va_end(arguments);
  if (mustFail(Call::kOpen)) return -1;
  static const auto next = below(&open64, "open64");
  return next(path, flags, mode);
}

int openat(int directory, const char* path, int flags, ...) {
  va_list arguments;
  va_start(arguments, flags);
  const mode_t mode = modeOf(flags, arguments);
  va_end(arguments);
  if (mustFail(Call::kOpen)) return -1;
  static const auto next = below(&openat, "openat");
  return next(directory, path, flags, mode);
}

void* mmap(void* address, size_t size, int protection, int flags, int file,
           off_t offset) noexcept {
  if (mustFail(Call::kMap)) return MAP_FAILED;
  static const auto next = below(&mmap, "mmap");
  return next(address, size, protection, flags, file, offset);
}

void* mmap64(void* address, size_t size, int protection, int flags, int file,
             off64_t offset) noexcept {
  if (mustFail(Call::kMap)) return MAP_FAILED;
  static const auto next = below(&mmap64, "mmap64");
  return next(address, size, protection, flags, file, offset);
}

int pthread_create(pthread_t* thread, const pthread_attr_t* attributes,
                   void* (*body)(void*), void* argument) noexcept {
  if (mustFail(Call::kThread)) return errno;
  static const auto next = below(&pthread_create, "pthread_create");
  return next(thread, attributes, body, argument);
}

}  // extern "C"
