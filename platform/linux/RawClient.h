// A client of the service's socket that speaks in bytes, for the tests.
#pragma once

#include <poll.h>
#include <sys/socket.h>

#include <chrono>
#include <cstdint>
#include <cstdio>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Value.h"
#include "platform/linux/FileDescriptor.h"
#include "platform/linux/TestSockets.h"
#include "platform/linux/wire/Frame.h"

namespace ostrel::testing_support {

/// How long a test waits for what comes soon.
inline constexpr std::chrono::seconds kSoon{5};

/// A client that says what it is told to, byte by byte if need be.
class RawClient {
 public:
  explicit RawClient(const std::string& path) : socket_(connectedSocket(path)) {}

  int socket() const { return socket_.get(); }
  void hangUp() { socket_.reset(); }

  bool send(std::string_view bytes) {
    while (!bytes.empty()) {
      const ssize_t count =
          ::send(socket_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
      if (count <= 0) return false;
      bytes.remove_prefix(static_cast<std::size_t>(count));
    }
    return true;
  }
  bool send(const wire::Request& request) {
    std::string frame;
    wire::appendRequest(frame, request);
    return send(frame);
  }

  /// The next frame's item; none at the end of the stream or after `kSoon`.
  std::optional<std::string> receive(std::chrono::milliseconds patience = kSoon) {
    std::string header;
    if (!receiveExactly(wire::kFrameHeaderSize, header, patience)) return std::nullopt;
    const auto length =
        wire::frameLength(reinterpret_cast<const std::uint8_t*>(header.data()));
    std::string item;
    if (!receiveExactly(length, item, patience)) return std::nullopt;
    return item;
  }

  /// The reason of the closing frame that comes next.
  std::string receiveClosing() {
    const auto item = receive();
    if (!item) return "(no frame)";
    wire::Reply reply;
    const auto* bytes = reinterpret_cast<const std::uint8_t*>(item->data());
    const auto error = wire::decodeReply(
        {bytes, item->size()}, {32, 1000, 1000},
        [](wire::RequestNumber) { return std::nullopt; }, reply);
    return error ? std::string(*error) : reply.closingReason;
  }

  /// Whether the service has ended the stream, as far as was read.
  bool isCutOff() const { return hasEnded_; }
  /// Whether the service ended the stream, which it does soon.
  bool isEnded() {
    std::string rest;
    while (receiveExactly(1, rest, kSoon)) {
    }
    return hasEnded_;
  }

 private:
  bool receiveExactly(std::size_t size, std::string& bytes,
                      std::chrono::milliseconds patience) {
    bytes.clear();
    while (bytes.size() < size) {
      pollfd waited{socket_.get(), POLLIN, 0};
      if (::poll(&waited, 1, static_cast<int>(patience.count())) <= 0) return false;
      std::string piece(size - bytes.size(), '\0');
      const ssize_t count = ::recv(socket_.get(), piece.data(), piece.size(), 0);
      if (count <= 0) {
        hasEnded_ = true;
        return false;
      }
      bytes.append(piece, 0, static_cast<std::size_t>(count));
    }
    return true;
  }

  FileDescriptor socket_;
  bool hasEnded_ = false;
};

inline wire::Request createRequest(wire::RequestNumber number, std::int64_t id) {
  wire::Request request;
  request.operation = wire::Operation::kCreateReportingSession;
  request.number = number;
  request.reporterID = ReporterID{id};
  return request;
}

inline wire::Request destroyRequest(wire::RequestNumber number, std::int64_t id) {
  wire::Request request = createRequest(number, id);
  request.operation = wire::Operation::kDestroyReportingSession;
  return request;
}

inline wire::Request messageRequest(wire::RequestNumber number, const std::string& text) {
  wire::Request request;
  request.operation = wire::Operation::kSendMessage;
  request.number = number;
  request.dictionary = Dictionary{{"text", text}};
  request.reporterIDs = ReporterIDs{ReporterID{1}};
  return request;
}

inline wire::Request reportersRequest(wire::RequestNumber number) {
  wire::Request request;
  request.operation = wire::Operation::kGetAllReporters;
  request.number = number;
  return request;
}

/// Two digits a byte.
inline std::string hex(std::string_view bytes) {
  std::string text;
  for (const char byte : bytes) {
    char digits[3];
    std::snprintf(digits, sizeof digits, "%02x", static_cast<unsigned char>(byte));
    text += digits;
  }
  return text;
}

}  // namespace ostrel::testing_support
