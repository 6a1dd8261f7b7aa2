// For the tests of the forwarder: a server on this machine that answers as a test says.
#pragma once

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cctype>
#include <cstdint>
#include <cstdlib>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/linux/FileDescriptor.h"

namespace ostrel::testing_support {

/// Reads requests on connections one after the other, in a thread of its own.
class ScriptedServer {
 public:
  struct Request {
    std::string head;
    std::string body;
  };
  /// The connection on which to answer.
  class Peer {
   public:
    Peer(int socket, int end) : socket_(socket), end_(end) {}

    /// As much of it as the other side takes.
    void send(std::string_view text) const {
      while (!text.empty()) {
        const auto sent = ::send(socket_, text.data(), text.size(), MSG_NOSIGNAL);
        if (sent <= 0) return;
        text.remove_prefix(static_cast<std::size_t>(sent));
      }
    }
    void reply(const std::string& status, const std::string& headers,
               const std::string& body) const {
      send("HTTP/1.1 " + status + "\r\nContent-Length: " + std::to_string(body.size()) +
           "\r\n" + headers + "\r\n" + body);
    }
    void reply(const std::string& status) const { reply(status, "", "{}"); }
    /// Until the other side goes away, or the server ends.
    void hang() const {
      char byte = 0;
      while (waitForInput(socket_, end_) && ::recv(socket_, &byte, 1, 0) > 0) {
      }
    }

   private:
    int socket_;
    int end_;
  };
  /// Answers one request; false when the connection is to be closed.
  using Script = std::function<bool(const Request&, const Peer&)>;

  explicit ScriptedServer(Script script)
      : script_(std::move(script)),
        listener_(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)),
        end_(::eventfd(0, EFD_CLOEXEC)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t size = sizeof address;
    auto* const any = reinterpret_cast<sockaddr*>(&address);
    if (::bind(listener_.get(), any, size) != 0 || ::listen(listener_.get(), 16) != 0 ||
        ::getsockname(listener_.get(), any, &size) != 0) {
      std::abort();
    }
    port_ = ntohs(address.sin_port);
    thread_ = std::thread([this] { run(); });
  }
  ~ScriptedServer() {
    const std::uint64_t one = 1;
    if (::write(end_.get(), &one, sizeof one) < 0) std::abort();
    thread_.join();
  }
  ScriptedServer(const ScriptedServer&) = delete;
  ScriptedServer& operator=(const ScriptedServer&) = delete;

  std::string url() const { return "http://127.0.0.1:" + std::to_string(port_); }
  /// All requests so far.
  std::vector<Request> requests() const {
    const std::lock_guard lock(mutex_);
    return requests_;
  }
  int connections() const {
    const std::lock_guard lock(mutex_);
    return connections_;
  }

 private:
  // False when the server ends.
  static bool waitForInput(int socket, int end) {
    pollfd descriptors[] = {{socket, POLLIN, 0}, {end, POLLIN, 0}};
    ::poll(descriptors, 2, /*timeout=*/-1);
    return descriptors[1].revents == 0;
  }

  void run() {
    while (waitForInput(listener_.get(), end_.get())) {
      const FileDescriptor socket(
          ::accept4(listener_.get(), nullptr, nullptr, SOCK_CLOEXEC));
      {
        const std::lock_guard lock(mutex_);
        ++connections_;
      }
      Request request;
      std::string rest;
      while (read(socket.get(), rest, request)) {
        {
          const std::lock_guard lock(mutex_);
          requests_.push_back(request);
        }
        if (!script_(request, Peer(socket.get(), end_.get()))) break;
      }
    }
  }

  // `rest` is what came of the next request.
  bool read(int socket, std::string& rest, Request& request) {
    std::size_t size = std::string::npos;
    for (;;) {
      const std::size_t end = rest.find("\r\n\r\n");
      if (end != std::string::npos && size == std::string::npos) {
        request.head = rest.substr(0, end + 2);
        rest.erase(0, end + 4);
        size = lengthIn(request.head);
      }
      if (size != std::string::npos && rest.size() >= size) {
        request.body = rest.substr(0, size);
        rest.erase(0, size);
        return true;
      }
      char bytes[65536];
      if (!waitForInput(socket, end_.get())) return false;
      const ssize_t received = ::recv(socket, bytes, sizeof bytes, 0);
      if (received <= 0) return false;
      rest.append(bytes, static_cast<std::size_t>(received));
    }
  }
  static std::size_t lengthIn(const std::string& head) {
    const std::size_t place = head.find("Content-Length: ");
    return place == std::string::npos ? 0 : std::stoul(head.substr(place + 16));
  }

  const Script script_;
  const FileDescriptor listener_;
  const FileDescriptor end_;
  int port_ = 0;
  mutable std::mutex mutex_;
  std::vector<Request> requests_;
  int connections_ = 0;
  std::thread thread_;
};

}  // namespace ostrel::testing_support
