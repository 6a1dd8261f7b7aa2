#include "platform/linux/SystemdService.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <climits>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <string>

#include "platform/linux/FileDescriptor.h"

namespace ostrel {
namespace {

// None for anything but a whole number from 0 on.
std::optional<int> numberOf(std::string_view text) {
  int number = 0;
  const auto [end, error] =
      std::from_chars(text.data(), text.data() + text.size(), number);
  if (error != std::errc() || end != text.data() + text.size() || number < 0) {
    return std::nullopt;
  }
  return number;
}

int countPassedSockets() {
  const char* process = std::getenv("LISTEN_PID");
  const char* count = std::getenv("LISTEN_FDS");
  if (process == nullptr || count == nullptr) return 0;
  const auto pid = numberOf(process);
  const auto sockets = numberOf(count);
  if (!pid) return -EINVAL;
  if (*pid != ::getpid()) return 0;  // Meant for another.
  if (!sockets || *sockets > INT_MAX - kFirstPassedSocket) return -EINVAL;
  for (int i = 0; i < *sockets; ++i) {
    const int flags = ::fcntl(kFirstPassedSocket + i, F_GETFD);
    if (flags < 0) return -errno;
    ::fcntl(kFirstPassedSocket + i, F_SETFD, flags | FD_CLOEXEC);
  }
  return *sockets;
}

int option(int descriptor, int name) {
  int value = -1;
  socklen_t size = sizeof value;
  return ::getsockopt(descriptor, SOL_SOCKET, name, &value, &size) == 0 ? value : -1;
}

}  // namespace

int takePassedSockets() {
  const int count = countPassedSockets();
  ::unsetenv("LISTEN_PID");
  ::unsetenv("LISTEN_FDS");
  ::unsetenv("LISTEN_FDNAMES");
  return count;
}

bool isListeningUnixStream(int descriptor) {
  return option(descriptor, SO_DOMAIN) == AF_UNIX &&
         option(descriptor, SO_TYPE) == SOCK_STREAM &&
         option(descriptor, SO_ACCEPTCONN) == 1;
}

void notifySystemd(std::string_view state) {
  const char* path = std::getenv("NOTIFY_SOCKET");
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  const std::string_view name = path != nullptr ? path : "";
  if (name.size() < 2 || name.size() > sizeof address.sun_path) return;
  std::memcpy(address.sun_path, name.data(), name.size());
  if (name.front() == '@') address.sun_path[0] = '\0';  // Not in the file system.
  const FileDescriptor socket(
      ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, /*protocol=*/0));
  ::sendto(socket.get(), state.data(), state.size(), MSG_NOSIGNAL,
           reinterpret_cast<const sockaddr*>(&address),
           static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + name.size()));
}

}  // namespace ostrel
