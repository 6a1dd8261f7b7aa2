// Unix sockets for the tests of the Linux bindings.
#pragma once

#include <sys/socket.h>
#include <sys/un.h>

#include <cstddef>
#include <string>

#include "platform/linux/FileDescriptor.h"

namespace ostrel::testing_support {

/// The address of a path, or of a name without a file, which begins with "@".
class UnixAddress {
 public:
  explicit UnixAddress(const std::string& path)
      : size_(static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + path.size())) {
    address_.sun_family = AF_UNIX;
    path.copy(address_.sun_path, sizeof address_.sun_path);
    if (path.front() == '@') address_.sun_path[0] = '\0';
  }

  const sockaddr* get() const { return reinterpret_cast<const sockaddr*>(&address_); }
  socklen_t size() const { return size_; }

 private:
  sockaddr_un address_{};
  const socklen_t size_;
};

/// A socket at `path`, SOCK_STREAM or SOCK_DGRAM; none when that cannot be had.
inline FileDescriptor boundSocket(int type, const std::string& path) {
  FileDescriptor socket(::socket(AF_UNIX, type | SOCK_CLOEXEC, /*protocol=*/0));
  const UnixAddress address(path);
  if (::bind(socket.get(), address.get(), address.size()) != 0) return {};
  return socket;
}

/// A stream socket that takes connections at `path`; none when that cannot be had.
inline FileDescriptor listeningSocket(const std::string& path) {
  FileDescriptor socket = boundSocket(SOCK_STREAM, path);
  if (::listen(socket.get(), /*n=*/8) != 0) return {};
  return socket;
}

/// A connection to the socket at `path`; none, and errno, when it is not taken.
inline FileDescriptor connectedSocket(const std::string& path) {
  FileDescriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, /*protocol=*/0));
  const UnixAddress address(path);
  if (::connect(socket.get(), address.get(), address.size()) != 0) return {};
  return socket;
}

/// Whether a connection to the socket at `path` is taken. The file is there a moment
/// before anybody listens.
inline bool isListenedTo(const std::string& path) {
  return static_cast<bool>(connectedSocket(path));
}

}  // namespace ostrel::testing_support
