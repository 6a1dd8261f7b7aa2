#include "client/ClientSocket.h"

#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

namespace ostrel {
namespace {

ErrorObject connectError(const std::string& path, int code) {
  return {std::string(kPOSIXErrorDomain), code,
          "cannot reach the reporting service at " + path + ": " + std::strerror(code)};
}

}  // namespace

OwnedDescriptor& OwnedDescriptor::operator=(OwnedDescriptor&& other) noexcept {
  if (this != &other) {
    reset();
    descriptor_ = other.release();
  }
  return *this;
}

int OwnedDescriptor::release() { return std::exchange(descriptor_, -1); }

void OwnedDescriptor::reset() {
  if (descriptor_ >= 0) ::close(std::exchange(descriptor_, -1));
}

Outcome<ClientSocket> ClientSocket::connect(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof address.sun_path) {
    return {{}, connectError(path, path.empty() ? EINVAL : ENAMETOOLONG)};
  }
  std::memcpy(address.sun_path, path.data(), path.size());

  OwnedDescriptor descriptor(
      ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, /*protocol=*/0));
  if (!descriptor) return {{}, connectError(path, errno)};
  int result;
  do {
    result = ::connect(descriptor.get(), reinterpret_cast<const sockaddr*>(&address),
                       sizeof address);
  } while (result != 0 && errno == EINTR);
  if (result != 0) return {{}, connectError(path, errno)};
  return {ClientSocket(std::move(descriptor)), {}};
}

std::optional<std::size_t> ClientSocket::send(std::string_view bytes) {
  while (true) {
    const auto sent = ::send(descriptor_.get(), bytes.data(), bytes.size(),
                             MSG_NOSIGNAL | MSG_DONTWAIT);
    if (sent >= 0) return static_cast<std::size_t>(sent);
    if (errno == EAGAIN || errno == ENOBUFS || errno == ENOMEM) return 0;
    if (errno != EINTR) return std::nullopt;
  }
}

ClientSocket::Received ClientSocket::receive(std::span<std::uint8_t> room,
                                             std::size_t& size) {
  while (true) {
    // Without a buffer for control messages, descriptors that a peer passes are
    // closed by the kernel.
    const auto received =
        ::recv(descriptor_.get(), room.data(), room.size(), MSG_DONTWAIT);
    if (received > 0) {
      size = static_cast<std::size_t>(received);
      return Received::kBytes;
    }
    if (received == 0) return Received::kEnd;
    if (errno == EAGAIN) return Received::kNothingYet;
    if (errno != EINTR) return Received::kEnd;
  }
}

Outcome<WakeEvent> WakeEvent::make() {
  OwnedDescriptor descriptor(::eventfd(/*initval=*/0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!descriptor) {
    return {{},
            ErrorObject{std::string(kPOSIXErrorDomain), errno,
                        std::string("cannot make an event: ") + std::strerror(errno)}};
  }
  return {WakeEvent(std::move(descriptor)), {}};
}

void WakeEvent::wake() {
  const std::uint64_t one = 1;
  // Only a full counter refuses, and then the thread is woken already.
  while (::write(descriptor_.get(), &one, sizeof one) < 0 && errno == EINTR) {
  }
}

void WakeEvent::clear() {
  std::uint64_t count;
  while (::read(descriptor_.get(), &count, sizeof count) < 0 && errno == EINTR) {
  }
}

}  // namespace ostrel
