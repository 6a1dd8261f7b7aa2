// The listener on a live socket, with the core behind it on real queues and what is
// around that in memory: whatever requests come, in whatever pieces, from clients that
// come and go, the next one is served.
#include <poll.h>
#include <sys/socket.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <thread>

#include "Statistics/Service/OstrelReportingServiceMain.h"
#include "fuzz/Fuzzing.h"
#include "platform/fake/FakePlatform.h"
#include "platform/linux/RealQueues.h"
#include "platform/linux/TestSockets.h"
#include "platform/linux/TestSupport.h"
#include "platform/linux/ThreadPoolWorkQueues.h"
#include "platform/linux/UnixSocketIPCListener.h"

namespace {

using namespace ostrel;
using fuzzing::expect;
using fuzzing::Input;
using wire::Operation;

constexpr int kPatience = 60'000;  // Milliseconds.

/// The service in this process, on a socket of its own.
class Service {
 public:
  explicit Service(const std::string& path) : path_(path) {
    queues_ = testing_support::putOnRealQueues(platform_);
    auto opened = UnixSocketIPCListener::open(path, std::make_shared<PeerRegistry>());
    expect(opened.value.has_value());
    listener_ = *std::move(opened.value);
    thread_ = std::thread(
        [this] { expect(OstrelReportingServiceMain(platform_, *listener_) == 0); });
  }
  ~Service() {
    listener_->stop();
    thread_.join();
    expect(queues_->drain(std::chrono::steady_clock::now() + std::chrono::minutes(1)));
  }

  FileDescriptor connect() const {
    FileDescriptor socket = testing_support::connectedSocket(path_);
    expect(static_cast<bool>(socket));
    return socket;
  }

 private:
  const std::string path_;
  FakePlatform fakes_;
  OstrelReportingPlatform platform_ = fakes_.platform();
  std::shared_ptr<ThreadPoolWorkQueues> queues_;
  std::unique_ptr<UnixSocketIPCListener> listener_;
  std::thread thread_;
};

void send(const FileDescriptor& socket, const std::string& bytes) {
  // What it does not take now it does not get.
  [[maybe_unused]] const ssize_t sent =
      ::send(socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
}

std::string validFrame(Operation operation, Input& input) {
  wire::Request request;
  request.operation = operation;
  request.number = input.byte() % 3;
  // Few, so that they meet; 0 is nobody.
  request.reporterID = ReporterID{input.byte() % 4};
  if (operation == Operation::kSetServiceType) {
    request.serviceType = ServiceType{input.byte()};
  }
  if (operation == Operation::kSetConfiguration && input.byte() % 4 != 0) {
    request.dictionary = Dictionary{{"key " + std::to_string(input.byte() % 3), 1}};
  }
  if (operation == Operation::kSendMessage) {
    request.dictionary = Dictionary{{"text of it", std::string(input.byte(), 'x')}};
    request.category = MessageCategory{input.byte()};
    request.type = MessageType{input.byte()};
    const std::uint8_t ids = input.byte() % 8;
    if (ids != 7) request.reporterIDs.emplace();
    for (int i = 0; i < ids && request.reporterIDs; ++i) {
      request.reporterIDs->push_back(ReporterID{input.byte() % 4});
    }
  }
  std::string frame;
  wire::appendRequest(frame, request);
  return frame;
}

void act(Service& service, FileDescriptor& client, Input& input) {
  constexpr unsigned kOperations = 11;
  const unsigned action = input.byte() % 20;
  if (!client) client = service.connect();
  if (action >= 1 && action <= kOperations) {
    send(client, validFrame(static_cast<Operation>(action), input));
    return;
  }
  std::array<char, 4096> replies;
  switch (action) {
    case 12:
      send(client, input.bytes(input.byte()));
      return;
    case 13: {
      const std::string frame = validFrame(Operation::kSendMessage, input);
      send(client, frame.substr(0, input.byte()));
      return;
    }
    case 14: {
      const std::string item = input.bytes(input.byte());
      const auto size = static_cast<char>(item.size());
      send(client, std::string{size, 0, 0, 0} + item);
      return;
    }
    case 15:
      client.reset();
      return;
    case 16:
      ::shutdown(client.get(), SHUT_WR);
      return;
    case 17: {
      std::string farewell;
      wire::appendFarewell(farewell);
      send(client, farewell);
      return;
    }
    default:
      [[maybe_unused]] const ssize_t count =
          ::recv(client.get(), replies.data(), replies.size(), MSG_DONTWAIT);
      return;
  }
}

void expectServed(const Service& service) {
  const FileDescriptor client = service.connect();
  wire::Request request;
  request.operation = Operation::kReporterIDValid;
  request.number = 1;
  std::string frame;
  wire::appendRequest(frame, request);
  send(client, frame);
  pollfd reply{client.get(), POLLIN, /*revents=*/0};
  int ready = -1;
  while (ready < 0) ready = ::poll(&reply, 1, kPatience);  // The fuzzer's alarm.
  expect(ready == 1);
  std::array<char, 256> bytes;
  const ssize_t count = ::recv(client.get(), bytes.data(), bytes.size(), 0);
  expect(count > 6 && bytes[5] == 1);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const testing_support::TemporaryDirectory directory;
  Input input(data, size);
  Service service(directory / "socket");
  std::array<FileDescriptor, 3> clients;
  while (!input.isOver()) act(service, clients[input.byte() % clients.size()], input);
  expectServed(service);
  return 0;
}
