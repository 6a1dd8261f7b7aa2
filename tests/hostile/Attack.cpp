#include "tests/hostile/Attack.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <thread>

namespace ostrel::hostile {
namespace {

constexpr std::chrono::milliseconds kConnectPause{5};

bool isAgain() {
  return errno == EAGAIN || errno == EINTR || errno == ENOBUFS || errno == ENOMEM;
}

}  // namespace

std::string head(Major major, std::uint64_t value) {
  constexpr std::uint64_t kInHead = 23;
  int width = 0;
  unsigned code = 27;
  if (value <= kInHead) {
    code = static_cast<unsigned>(value);
  } else if (value <= UINT8_MAX) {
    code = 24, width = 1;
  } else if (value <= UINT16_MAX) {
    code = 25, width = 2;
  } else if (value <= UINT32_MAX) {
    code = 26, width = 4;
  } else {
    width = 8;
  }
  std::string bytes(1, static_cast<char>(static_cast<unsigned>(major) << 5 | code));
  while (width-- > 0) bytes.push_back(static_cast<char>(value >> (8 * width)));
  return bytes;
}

std::string integer(std::int64_t value) {
  return value >= 0 ? head(Major::kUnsigned, static_cast<std::uint64_t>(value))
                    : head(Major::kNegative, ~static_cast<std::uint64_t>(value));
}

std::string text(std::string_view value) {
  return head(Major::kText, value.size()).append(value);
}

std::string lengthField(std::uint32_t length) {
  std::string bytes;
  for (int shift = 0; shift < 32; shift += 8) {
    bytes.push_back(static_cast<char>(length >> shift));
  }
  return bytes;
}

std::string frame(std::string_view item) {
  return lengthField(static_cast<std::uint32_t>(item.size())).append(item);
}

std::string request(Operation operation, std::uint64_t number,
                    const std::vector<std::string>& arguments) {
  std::string item = head(Major::kArray, arguments.size() + 2);
  item += head(Major::kUnsigned, static_cast<std::uint64_t>(operation));
  item += head(Major::kUnsigned, number);
  for (const std::string& argument : arguments) item += argument;
  return frame(item);
}

bool Peer::waitFor(short events, TimePoint deadline) const {
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now());
  if (left.count() <= 0) return false;
  pollfd descriptor{socket_.get(), events, /*revents=*/0};
  return ::poll(&descriptor, 1, static_cast<int>(left.count())) > 0;
}

bool Peer::sendAll(std::string_view bytes, TimePoint deadline, bool drains) {
  while (socket_ && !bytes.empty()) {
    if (drains && !drain()) return false;
    const ssize_t count =
        ::send(socket_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
    if (count >= 0) {
      bytes.remove_prefix(static_cast<std::size_t>(count));
      continue;
    }
    if (!isAgain()) return false;
    const auto events = static_cast<short>(drains ? POLLOUT | POLLIN : POLLOUT);
    if (!waitFor(events, deadline)) return false;
  }
  return static_cast<bool>(socket_);
}

bool Peer::send(std::string_view bytes, TimePoint deadline) {
  return sendAll(bytes, deadline, /*drains=*/false);
}

bool Peer::sendAndDrain(std::string_view bytes, TimePoint deadline) {
  return sendAll(bytes, deadline, /*drains=*/true);
}

std::optional<std::string> Peer::receive(TimePoint deadline) {
  std::array<char, 65536> buffer;
  while (socket_) {
    if (received_.size() >= wire::kFrameHeaderSize) {
      const std::size_t length =
          wire::frameLength(reinterpret_cast<const std::uint8_t*>(received_.data()));
      if (received_.size() >= wire::kFrameHeaderSize + length) {
        std::string item = received_.substr(wire::kFrameHeaderSize, length);
        received_.erase(0, wire::kFrameHeaderSize + length);
        return item;
      }
    }
    const ssize_t count =
        ::recv(socket_.get(), buffer.data(), buffer.size(), MSG_DONTWAIT);
    if (count > 0) {
      received_.append(buffer.data(), static_cast<std::size_t>(count));
    } else if (count == 0 || !isAgain() || !waitFor(POLLIN, deadline)) {
      return std::nullopt;
    }
  }
  return std::nullopt;
}

bool Peer::drain() {
  std::array<char, 65536> buffer;
  while (socket_) {
    const ssize_t count =
        ::recv(socket_.get(), buffer.data(), buffer.size(), MSG_DONTWAIT);
    if (count == 0) return false;
    if (count < 0) return isAgain();
  }
  return false;
}

bool Peer::waitForEnd(TimePoint deadline) {
  while (drain()) {
    if (!waitFor(POLLIN, deadline) && Clock::now() >= deadline) return false;
  }
  return true;
}

void Peer::shutDown(int how) { ::shutdown(socket_.get(), how); }

void Attack::rest(std::chrono::milliseconds time) const {
  std::this_thread::sleep_until(std::min(Clock::now() + time, end_));
}

std::uint64_t Attack::pick(std::uint64_t least, std::uint64_t most) {
  return std::uniform_int_distribution<std::uint64_t>(least, most)(random_);
}

std::string Attack::randomBytes(std::size_t count) {
  std::string bytes(count, '\0');
  for (char& byte : bytes) byte = static_cast<char>(random_());
  return bytes;
}

void Attack::expect(bool isSo, const char* sentence) {
  if (isSo) return;
  if (std::ranges::find(failures_, sentence) == failures_.end()) {
    failures_.emplace_back(sentence);
  }
}

Peer Attack::connect() {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, target_.socketPath.c_str(), sizeof address.sun_path - 1);
  while (!isOver()) {
    FileDescriptor socket(
        ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    if (socket && ::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address),
                            sizeof address) == 0) {
      return Peer(std::move(socket));
    }
    rest(kConnectPause);
  }
  return {};
}

Peer Attack::admitted() {
  constexpr std::uint64_t kNumber = 1;
  while (!isOver()) {
    Peer peer = connect();
    const std::string question =
        request(Operation::kGetServiceNameForReporterID, kNumber, {integer(-1)});
    if (peer.send(question, patience())) {
      const auto reply = peer.receive(patience());
      // Else it is the closing: the service is full.
      if (reply && reply->size() > 1 && (*reply)[1] != 0) return peer;
    }
    rest(kConnectPause);
  }
  return {};
}

Peer Attack::withSessions(std::int64_t first, int count, std::uint16_t serviceType) {
  Peer peer = admitted();
  std::string frames;
  for (std::int64_t id = first; id < first + count; ++id) {
    frames += request(Operation::kCreateReportingSession, /*number=*/0, {integer(id)});
    frames += request(Operation::kSetServiceType, /*number=*/0,
                      {integer(serviceType), integer(id)});
    frames +=
        request(Operation::kStartReportingSessionForID, /*number=*/0, {integer(id)});
  }
  if (!peer.sendAndDrain(frames, end_)) peer.close();
  return peer;
}

}  // namespace ostrel::hostile
