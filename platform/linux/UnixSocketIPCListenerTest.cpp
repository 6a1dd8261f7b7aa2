#include "platform/linux/UnixSocketIPCListener.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/sockios.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <functional>
#include <iterator>
#include <mutex>
#include <optional>
#include <thread>

#include "Statistics/Service/OstrelReportingServiceProtocol.h"
#include "platform/linux/ChildProcess.h"
#include "platform/linux/ProcProcessInfo.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using namespace std::chrono_literals;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::UnorderedElementsAre;
using testing_support::CapturedLog;
using testing_support::TemporaryDirectory;

constexpr auto kSoon = 5s;

/// What the service is asked, in order. Replies at once unless told to hold.
class RecordingService final : public OstrelReportingServiceProtocol {
 public:
  void createReportingSession(ReporterID id, BoolReply reply) override {
    record(format("create %lli", id));
    answer([reply] {
      if (reply) reply(true);
    });
  }
  void setServiceType(ServiceType type, ReporterID id, BoolReply reply) override {
    record(format("setServiceType %i %lli", type, id));
    if (reply) reply(true);
  }
  void getServiceNameForReporterID(ReporterID id, ServiceTypeReply reply) override {
    record(format("getServiceName %lli", id));
    if (!reply) return;
    reply(ServiceType{2});
    if (id == kNoReporter) reply(ServiceType{3});
  }
  void setConfiguration(std::optional<Dictionary> configuration, ReporterID id,
                        BoolReply reply) override {
    record(format("setConfiguration %@ %lli", configuration, id));
    if (reply) reply(true);
  }
  void startReportingSessionForID(ReporterID id, BoolReply reply) override {
    record(format("start %lli", id));
    const std::lock_guard lock(mutex_);
    startReply_ = std::move(reply);
  }
  void sendMessage(Dictionary message, MessageCategory category, MessageType type,
                   std::optional<ReporterIDs> ids, ErrorReply reply) override {
    record(format("send %@ %u %i %@", message, category, type, ids));
    answer([message, reply] {
      if (reply) reply(std::nullopt);
    });
  }
  void stopReportingSessionForID(ReporterID id, BoolReply reply) override {
    record(format("stop %lli", id));
    if (reply) reply(true);
  }
  void destroyReportingSession(ReporterID id, BoolReply reply) override {
    record(format("destroy %lli", id));
    if (reply) reply(true);
  }
  void reporterIDValid(ReporterID id, DictionaryReply reply) override {
    record(format("valid %lli", id));
    if (reply) reply(Dictionary{{"reporterID", 7}});
  }
  void getAllReporters(ReporterIDsReply reply) override {
    record("getAllReporters");
    answer([reply, ids = ids_] {
      if (reply) reply(ids);
    });
  }
  void killService(BoolReply) override { record("kill"); }

  void holdReplies() {
    const std::lock_guard lock(mutex_);
    isHolding_ = true;
  }
  void releaseReplies() {
    std::vector<std::function<void()>> held;
    {
      const std::lock_guard lock(mutex_);
      isHolding_ = false;
      held.swap(held_);
    }
    for (const auto& give : held) give();
  }
  void setReporters(ReporterIDs ids) { ids_ = std::move(ids); }

  std::vector<std::string> calls() const {
    const std::lock_guard lock(mutex_);
    return calls_;
  }
  bool waitForCalls(std::size_t count) const {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, kSoon, [&] { return calls_.size() >= count; });
  }

 private:
  void record(std::string call) {
    const std::lock_guard lock(mutex_);
    calls_.push_back(std::move(call));
    changed_.notify_all();
  }
  void answer(std::function<void()> give) {
    {
      const std::lock_guard lock(mutex_);
      if (isHolding_) {
        held_.push_back(std::move(give));
        return;
      }
    }
    give();
  }

  mutable std::mutex mutex_;
  mutable std::condition_variable changed_;
  std::vector<std::string> calls_;
  std::vector<std::function<void()>> held_;
  BoolReply startReply_;
  ReporterIDs ids_;
  bool isHolding_ = false;
};

/// A client that says what it is told to, byte by byte if need be.
class RawClient {
 public:
  explicit RawClient(const std::string& path) {
    socket_ = FileDescriptor(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    isConnected_ = ::connect(socket_.get(), reinterpret_cast<const sockaddr*>(&address),
                             sizeof address) == 0;
  }

  bool isConnected() const { return isConnected_; }
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
  bool isConnected_ = false;
  bool hasEnded_ = false;
};

wire::Request createRequest(wire::RequestNumber number, std::int64_t id) {
  wire::Request request;
  request.operation = wire::Operation::kCreateReportingSession;
  request.number = number;
  request.reporterID = ReporterID{id};
  return request;
}

wire::Request destroyRequest(wire::RequestNumber number, std::int64_t id) {
  wire::Request request = createRequest(number, id);
  request.operation = wire::Operation::kDestroyReportingSession;
  return request;
}

wire::Request messageRequest(wire::RequestNumber number, const std::string& text) {
  wire::Request request;
  request.operation = wire::Operation::kSendMessage;
  request.number = number;
  request.dictionary = Dictionary{{"text", text}};
  request.reporterIDs = ReporterIDs{ReporterID{1}};
  return request;
}

wire::Request reportersRequest(wire::RequestNumber number) {
  wire::Request request;
  request.operation = wire::Operation::kGetAllReporters;
  request.number = number;
  return request;
}

std::string hex(std::string_view bytes) {
  std::string text;
  for (const char byte : bytes) {
    char digits[3];
    std::snprintf(digits, sizeof digits, "%02x", static_cast<unsigned char>(byte));
    text += digits;
  }
  return text;
}

std::size_t openDescriptors() {
  return static_cast<std::size_t>(
      std::distance(std::filesystem::directory_iterator("/proc/self/fd"),
                    std::filesystem::directory_iterator()));
}

class UnixSocketListener : public testing::Test, public IPCListenerDelegate {
 protected:
  ~UnixSocketListener() override { stop(); }

  void serve(ListenerLimits limits = {}) {
    auto opened = UnixSocketIPCListener::open(path, peers, limits, misuse);
    ASSERT_TRUE(opened.value) << opened.error->description;
    listener = *std::move(opened.value);
    listener->setDelegate(this);
    thread = std::thread([this] { listener->resume(); });
  }
  void stop() {
    if (!thread.joinable()) return;
    listener->stop();
    thread.join();
    listener.reset();
  }

  bool listenerShouldAcceptNewConnection(
      IPCListener&, const std::shared_ptr<IPCConnection>& connection) override {
    const std::string pid = std::to_string(connection->processIdentifier());
    connection->setExportedObject(service);
    connection->setInterruptionHandler([this] { note("interrupted"); });
    connection->setInvalidationHandler([this] { note("invalidated"); });
    connection->resume();
    note("accepted " + pid);
    return true;
  }

  void note(const std::string& event) {
    const std::lock_guard lock(mutex);
    events.push_back(event);
    changed.notify_all();
  }
  std::vector<std::string> eventsAfter(std::size_t count) {
    std::unique_lock lock(mutex);
    changed.wait_for(lock, kSoon, [&] { return events.size() >= count; });
    return events;
  }
  static std::string accepted() { return "accepted " + std::to_string(::getpid()); }

  TemporaryDirectory directory;
  const std::string path = directory / "run/reporting.sock";
  const std::shared_ptr<PeerRegistry> peers = std::make_shared<PeerRegistry>();
  const std::shared_ptr<MisuseLog> misuse = std::make_shared<MisuseLog>();
  const std::shared_ptr<RecordingService> service = std::make_shared<RecordingService>();
  std::unique_ptr<UnixSocketIPCListener> listener;
  std::thread thread;
  std::mutex mutex;
  std::condition_variable changed;
  std::vector<std::string> events;
};

TEST_F(UnixSocketListener, CarriesOutRequestsInTheirOrder) {
  serve();
  RawClient client(path);

  client.send(createRequest(1, -5));
  client.send(messageRequest(2, "hello"));
  client.send(reportersRequest(3));

  ASSERT_TRUE(service->waitForCalls(3));
  EXPECT_THAT(service->calls(),
              ElementsAre("create -5", "send {text: hello} 0 0 (1)", "getAllReporters"));
}

TEST_F(UnixSocketListener, RepliesUnderTheRequestsNumber) {
  serve();
  service->setReporters({ReporterID{1}, ReporterID{-2}});
  RawClient client(path);

  client.send(createRequest(1, 7));
  client.send(messageRequest(500, "x"));
  client.send(reportersRequest(70000));

  EXPECT_EQ(hex(*client.receive()), "8201f5");
  EXPECT_EQ(hex(*client.receive()), "821901f4f6");
  EXPECT_EQ(hex(*client.receive()), "821a00011170820121");
}

TEST_F(UnixSocketListener, SendsEveryReplyOfARequest) {
  serve();
  RawClient client(path);
  wire::Request request;
  request.operation = wire::Operation::kGetServiceNameForReporterID;
  request.number = 9;

  client.send(request);

  EXPECT_EQ(hex(*client.receive()), "820902");
  EXPECT_EQ(hex(*client.receive()), "820903");
}

TEST_F(UnixSocketListener, SendsNoReplyToNumberZero) {
  serve();
  RawClient client(path);

  client.send(createRequest(0, 7));
  client.send(createRequest(1, 8));

  EXPECT_EQ(hex(*client.receive()), "8201f5");
}

TEST_F(UnixSocketListener, TakesAFrameInSingleBytes) {
  serve();
  RawClient client(path);
  std::string frames;
  wire::appendRequest(frames, messageRequest(1, std::string(300, 'x')));
  wire::appendRequest(frames, createRequest(2, 7));

  for (const char byte : frames) client.send(std::string_view(&byte, 1));

  EXPECT_EQ(hex(*client.receive()), "8201f6");
  EXPECT_EQ(hex(*client.receive()), "8202f5");
}

TEST_F(UnixSocketListener, TakesThousandsOfFramesAtOnce) {
  serve();
  RawClient client(path);
  std::string frames;
  for (int i = 1; i <= 20'000; ++i) wire::appendRequest(frames, messageRequest(0, "x"));
  wire::appendRequest(frames, createRequest(1, 7));

  std::thread sender([&] { client.send(frames); });
  const auto reply = client.receive(20s);
  sender.join();

  ASSERT_TRUE(reply);
  EXPECT_EQ(service->calls().size(), 20'001);
}

TEST_F(UnixSocketListener, JoinsTheBeginningOfAFrameWithItsRestAtEveryLength) {
  serve();
  RawClient client(path);
  std::string frame;
  wire::appendRequest(frame, messageRequest(1, std::string(4200, 'x')));
  std::string second;
  wire::appendRequest(second, createRequest(2, 7));

  for (const std::size_t split : {1, 3, 4, 5, 2047, 2048, 2049, 4096, 4200}) {
    client.send(frame.substr(0, split));
    EXPECT_FALSE(client.receive(20ms)) << split;
    client.send(frame.substr(split) + second);
    EXPECT_EQ(hex(client.receive().value_or("")), "8201f6") << split;
    EXPECT_EQ(hex(client.receive().value_or("")), "8202f5") << split;
  }
}

TEST_F(UnixSocketListener, ChargesAllThatAMessageKeepsInMemory) {
  ListenerLimits limits;
  limits.queuedBytes = 64 * 1024;
  serve(limits);
  service->holdReplies();
  RawClient client(path);
  // One held message among others that are done with at once: a few kilobytes of
  // input stay alive for it.
  std::string burst;
  wire::appendRequest(burst, messageRequest(0, "held"));
  for (int i = 0; i < 200; ++i) {
    wire::Request request;
    request.operation = wire::Operation::kReporterIDValid;
    wire::appendRequest(burst, request);
  }
  constexpr std::size_t kBursts = 400;

  std::thread sender([&] {
    for (std::size_t i = 0; i < kBursts; ++i) client.send(burst);
  });
  ASSERT_TRUE(service->waitForCalls(201));
  std::this_thread::sleep_for(100ms);
  const std::size_t whileHeld = service->calls().size();
  service->releaseReplies();

  EXPECT_TRUE(service->waitForCalls(kBursts * 201));
  sender.join();
  const std::size_t inputBytes = whileHeld / 201 * burst.size();
  EXPECT_LE(inputBytes, 2 * limits.queuedBytes + 64 * 1024);
}

TEST_F(UnixSocketListener, TakesAFrameOfTheLargestSizeAndNoneLarger) {
  ListenerLimits limits;
  limits.frameBytes = 1000;
  serve(limits);
  std::string empty;
  wire::appendRequest(empty, messageRequest(1, std::string(300, 'x')));
  const std::size_t rest = empty.size() - wire::kFrameHeaderSize - 300;
  for (const std::size_t size : {std::size_t{999}, std::size_t{1000}}) {
    RawClient client(path);
    client.send(messageRequest(1, std::string(size - rest, 'x')));
    EXPECT_EQ(hex(*client.receive()), "8201f6") << size;
  }

  RawClient client(path);
  client.send(messageRequest(1, std::string(1001 - rest, 'x')));

  EXPECT_EQ(client.receiveClosing(), "a frame is too large");
  EXPECT_TRUE(client.isEnded());
}

TEST_F(UnixSocketListener, EndsAClientWhoseFrameIsEmptyOrClaimsTheMost) {
  serve();
  RawClient empty(path);
  RawClient largest(path);

  empty.send(std::string(4, '\0'));
  largest.send(std::string(4, '\xFF'));

  EXPECT_EQ(empty.receiveClosing(), "a frame is empty");
  EXPECT_EQ(largest.receiveClosing(), "a frame is too large");
}

TEST_F(UnixSocketListener, TellsAClientThatBreaksTheRulesWhyAndCallsItInterrupted) {
  serve();
  RawClient client(path);

  client.send(std::string("\x01\0\0\0\x00", 5));

  EXPECT_EQ(client.receiveClosing(), "the frame is not a request");
  EXPECT_TRUE(client.isEnded());
  EXPECT_THAT(eventsAfter(3), ElementsAre(accepted(), "interrupted", "invalidated"));
}

TEST_F(UnixSocketListener, DoesNotCallAFarewellAnInterruption) {
  serve();
  RawClient client(path);
  std::string farewell;
  wire::appendFarewell(farewell);

  client.send(farewell);

  EXPECT_TRUE(client.isEnded());
  EXPECT_THAT(eventsAfter(2), ElementsAre(accepted(), "invalidated"));
}

TEST_F(UnixSocketListener, CallsAClientThatVanishesInterruptedOnce) {
  serve();
  RawClient client(path);
  eventsAfter(1);

  client.hangUp();

  EXPECT_THAT(eventsAfter(3), ElementsAre(accepted(), "interrupted", "invalidated"));
}

TEST_F(UnixSocketListener, CarriesOutWhatAClientSentBeforeItVanished) {
  serve();
  {
    RawClient client(path);
    for (int i = 0; i < 100; ++i) client.send(messageRequest(1, "x"));
  }

  EXPECT_TRUE(service->waitForCalls(100));
  EXPECT_THAT(eventsAfter(3), ElementsAre(accepted(), "interrupted", "invalidated"));
  EXPECT_EQ(service->calls().size(), 100);
}

TEST_F(UnixSocketListener, ForgetsAFrameThatNeverBecomesWhole) {
  serve();
  {
    RawClient client(path);
    std::string frame;
    wire::appendRequest(frame, createRequest(1, 7));
    client.send(frame.substr(0, frame.size() - 1));
  }

  EXPECT_THAT(eventsAfter(3), ElementsAre(accepted(), "interrupted", "invalidated"));
  EXPECT_THAT(service->calls(), ElementsAre());
}

TEST_F(UnixSocketListener, HoldsBackAClientWithTooMuchUnderWayAndLosesNothing) {
  ListenerLimits limits;
  limits.queuedBytes = 64 * 1024;
  serve(limits);
  service->holdReplies();
  constexpr std::size_t kMessages = 2000;
  RawClient greedy(path);
  RawClient other(path);

  std::thread sender([&] {
    for (std::size_t i = 0; i < kMessages; ++i) {
      greedy.send(messageRequest(0, std::string(1000, 'x')));
    }
    greedy.send(reportersRequest(5));
  });
  ASSERT_TRUE(service->waitForCalls(40));
  std::this_thread::sleep_for(100ms);
  const std::size_t whileHeld = service->calls().size();
  other.send([] {
    wire::Request request;
    request.operation = wire::Operation::kReporterIDValid;
    request.number = 1;
    return request;
  }());
  EXPECT_TRUE(other.receive()) << "somebody else is served meanwhile";
  service->releaseReplies();

  EXPECT_TRUE(greedy.receive(20s));
  sender.join();
  EXPECT_LT(whileHeld, 80u) << "64 KiB of messages of more than 1,000 bytes";
  EXPECT_EQ(service->calls().size(), kMessages + 2);
}

TEST_F(UnixSocketListener, HoldsBackAClientThatFloodsRequestsWithoutPayload) {
  ListenerLimits limits;
  limits.queuedBytes = 64 * 1024;
  serve(limits);
  service->holdReplies();
  constexpr std::size_t kRequests = 5000;
  RawClient client(path);

  std::thread sender([&] {
    for (std::size_t i = 0; i < kRequests; ++i) client.send(createRequest(0, 7));
  });
  ASSERT_TRUE(service->waitForCalls(100));
  std::this_thread::sleep_for(100ms);
  const std::size_t whileHeld = service->calls().size();
  service->releaseReplies();

  EXPECT_TRUE(service->waitForCalls(kRequests));
  sender.join();
  EXPECT_LE(whileHeld, 64u * 1024 / limits::kRequestBytes + 1);
}

TEST_F(UnixSocketListener, CutsNobodyOffWhoIsMerelyHeldBack) {
  ListenerLimits limits;
  limits.ofUser.queuedBytes = 64 * 1024;
  limits.halfFrameBytesOfUser = 64 * 1024;
  serve(limits);
  service->holdReplies();
  constexpr std::size_t kClients = 8;
  constexpr std::size_t kMessages = 300;
  std::string burst;
  for (std::size_t i = 0; i < kMessages; ++i) {
    wire::appendRequest(burst, messageRequest(0, std::string(200, 'x')));
  }
  std::vector<std::unique_ptr<RawClient>> clients;
  std::vector<std::thread> senders;
  for (std::size_t i = 0; i < kClients; ++i) {
    clients.push_back(std::make_unique<RawClient>(path));
    senders.emplace_back([&burst, client = clients.back().get()] {
      // In pieces that end within frames.
      for (std::size_t at = 0; at < burst.size(); at += 5000) {
        client->send(std::string_view(burst).substr(at, 5000));
      }
    });
  }
  ASSERT_TRUE(service->waitForCalls(10));
  std::this_thread::sleep_for(100ms);
  service->releaseReplies();
  for (std::thread& sender : senders) sender.join();

  EXPECT_TRUE(service->waitForCalls(kClients * kMessages));
  EXPECT_EQ(misuse->counts(), MisuseLog::Counts());
}

TEST_F(UnixSocketListener, ChargesEachDeliveryOfAMessage) {
  ListenerLimits limits;
  limits.queuedBytes = 64 * 1024;
  serve(limits);
  service->holdReplies();
  constexpr std::size_t kDeliveries = 32;
  constexpr std::size_t kMessages = 50;
  wire::Request message = messageRequest(0, "x");
  message.reporterIDs = ReporterIDs(kDeliveries, ReporterID{1});
  RawClient client(path);

  for (std::size_t i = 0; i < kMessages; ++i) client.send(message);
  ASSERT_TRUE(service->waitForCalls(1));
  std::this_thread::sleep_for(100ms);
  const std::size_t whileHeld = service->calls().size();
  service->releaseReplies();

  EXPECT_TRUE(service->waitForCalls(kMessages));
  EXPECT_LE(whileHeld,
            limits.queuedBytes / ((kDeliveries - 1) * limits::kDeliveryBytes) + 1);
}

TEST_F(UnixSocketListener, AcceptsAgainOnceThereAreDescriptors) {
  const CapturedLog log;
  serve();
  rlimit usual{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &usual), 0);
  // One for the client, none for the service.
  FileDescriptor next(::dup(0));
  const rlimit scarce{static_cast<rlim_t>(next.get()) + 1, usual.rlim_max};
  next.reset();
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &scarce), 0);
  RawClient client(path);
  client.send(createRequest(1, 7));
  EXPECT_FALSE(client.receive(20ms));
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &usual), 0);

  EXPECT_EQ(hex(client.receive().value_or("")), "8201f5");
  const auto lines = log.lines(LogLevel::kError);
  ASSERT_FALSE(lines.empty());
  EXPECT_THAT(lines.front(), HasSubstr("no connection can be accepted now"));
  EXPECT_LT(lines.size(), 100u) << "it is tried ten times a second";
}

TEST_F(UnixSocketListener, CutsOffAClientThatNeverReadsItsReplies) {
  ListenerLimits limits;
  limits.unreadReplyBytes = 256 * 1024;
  limits.unreadReplyBytesToPause = 64 * 1024;
  limits.unreadPatience = 200ms;
  serve(limits);
  service->setReporters(ReporterIDs(5000, ReporterID{INT64_MAX}));
  RawClient client(path);

  const timeval patience{/*tv_sec=*/5, /*tv_usec=*/0};
  ::setsockopt(client.socket(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
  while (client.send(reportersRequest(1))) {
  }

  EXPECT_THAT(eventsAfter(3), ElementsAre(accepted(), "interrupted", "invalidated"));
}

TEST_F(UnixSocketListener, CutsOffWhoIsLongestInAFrameWhereAUserHasTooManyHalves) {
  ListenerLimits limits;
  limits.halfFrameBytesOfUser = 90 * 1024;
  serve(limits);
  const std::string half =
      std::string("\x00\x00\x01\x00", 4) + std::string(30 * 1024 - 4, '\x81');
  std::vector<std::unique_ptr<RawClient>> clients;
  const auto begin = [&] {
    clients.push_back(std::make_unique<RawClient>(path));
    clients.back()->send(half);
    // Whoever is served later began later.
    RawClient other(path);
    other.send(createRequest(1, 7));
    EXPECT_TRUE(other.receive());
  };

  for (int i = 0; i < 3; ++i) begin();
  clients.push_back(std::make_unique<RawClient>(path));
  clients.back()->send(createRequest(1, 7));
  EXPECT_TRUE(clients.back()->receive()) << "at the limit";
  EXPECT_EQ(misuse->counts()[static_cast<std::size_t>(MisuseLog::Kind::kCutOff)], 0u);
  begin();

  EXPECT_EQ(clients.front()->receiveClosing(), "too many frames are not whole");
  EXPECT_EQ(misuse->counts()[static_cast<std::size_t>(MisuseLog::Kind::kCutOff)], 1u);
}

TEST_F(UnixSocketListener, ServesAClientWithLittleUnderWayHoweverMuchItsUserHas) {
  ListenerLimits limits;
  limits.ofUser.queuedBytes = 1024;
  limits.reservedQueuedBytes = 2 * limits::kRequestBytes;
  serve(limits);
  service->holdReplies();
  RawClient greedy(path);
  greedy.send(messageRequest(1, std::string(4096, 'x')));
  ASSERT_TRUE(service->waitForCalls(1));

  RawClient modest(path);
  for (int i = 0; i < 10; ++i) modest.send(createRequest(0, 7));
  ASSERT_TRUE(service->waitForCalls(3)) << "up to the reserve, and once at it";
  std::this_thread::sleep_for(50ms);
  EXPECT_LE(service->calls().size(), 1 + 3u);
  service->releaseReplies();

  EXPECT_TRUE(service->waitForCalls(11));
}

TEST_F(UnixSocketListener, LeavesWhatItCannotCarryOutInTheSocket) {
  ListenerLimits limits;
  limits.ofUser.queuedBytes = 1024;
  limits.reservedQueuedBytes = 0;
  serve(limits);
  service->holdReplies();
  RawClient first(path);
  first.send(messageRequest(1, std::string(4096, 'x')));
  ASSERT_TRUE(service->waitForCalls(1));

  RawClient second(path);
  second.send(createRequest(0, 7));
  ASSERT_TRUE(service->waitForCalls(2));
  second.send(messageRequest(1, std::string(4096, 'x')));
  std::this_thread::sleep_for(50ms);
  int inSocket = 0;
  ::ioctl(second.socket(), SIOCOUTQ, &inSocket);
  EXPECT_GT(inSocket, 4096);
  service->releaseReplies();

  EXPECT_TRUE(second.receive());
}

TEST_F(UnixSocketListener, SendsALargeReplyToAClientThatReadsSlowly) {
  serve();
  service->setReporters(ReporterIDs(60'000, ReporterID{INT64_MAX}));
  RawClient client(path);

  client.send(reportersRequest(1));
  std::this_thread::sleep_for(50ms);

  const auto reply = client.receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->size(), 1 + 1 + 3 + 60'000 * 9u);
}

TEST_F(UnixSocketListener, ServesAsManyConnectionsAsAllowedAndSaysWhyNoMore) {
  ListenerLimits limits;
  limits.connectionsOfUser = 3;
  serve(limits);
  std::vector<std::unique_ptr<RawClient>> clients;
  for (int i = 0; i < 3; ++i) {
    clients.push_back(std::make_unique<RawClient>(path));
    clients.back()->send(createRequest(1, 7));
    EXPECT_TRUE(clients.back()->receive());
  }

  RawClient tooMany(path);

  EXPECT_EQ(tooMany.receiveClosing(), "there are too many connections");
  EXPECT_TRUE(tooMany.isEnded());
  clients.pop_back();
  eventsAfter(5);
  RawClient next(path);
  next.send(createRequest(1, 7));
  EXPECT_TRUE(next.receive());
}

TEST_F(UnixSocketListener, MakesAsManySessionsAsAllowedAndAnswersYesForOneMore) {
  ListenerLimits limits;
  limits.ofUser.sessions = 3;
  serve(limits);
  RawClient one(path);
  RawClient two(path);
  const auto isAnsweredYes = [](RawClient& client, const std::string& reply) {
    return hex(client.receive().value_or("")) == reply;
  };
  one.send(createRequest(1, 11));
  one.send(createRequest(2, 12));
  EXPECT_TRUE(isAnsweredYes(one, "8201f5"));
  EXPECT_TRUE(isAnsweredYes(one, "8202f5"));
  two.send(createRequest(1, 11));
  EXPECT_TRUE(isAnsweredYes(two, "8201f5"));
  two.send(createRequest(2, 22));
  EXPECT_TRUE(isAnsweredYes(two, "8202f5"));
  one.send(createRequest(3, 12));
  EXPECT_TRUE(isAnsweredYes(one, "8203f5")) << "a session made anew is none more";

  EXPECT_THAT(service->calls(), ElementsAre("create 11", "create 12", "create 11",
                                            "setConfiguration (null) 0", "create 12"));
  EXPECT_EQ(misuse->counts(), (MisuseLog::Counts{0, 0, 1}));
}

TEST_F(UnixSocketListener, MakesASessionAgainOnceOneIsDestroyedOrItsClientGone) {
  ListenerLimits limits;
  limits.sessions = 2;
  serve(limits);
  RawClient stays(path);
  stays.send(createRequest(1, 11));
  stays.send(createRequest(2, 0));
  stays.send(destroyRequest(3, 0));
  stays.send(createRequest(4, 12));
  stays.send(destroyRequest(5, 11));
  stays.send(destroyRequest(6, 11));
  stays.send(createRequest(7, 13));
  for (int i = 0; i < 7; ++i) ASSERT_TRUE(stays.receive());
  EXPECT_THAT(service->calls(), ElementsAre("create 11", "create 0", "destroy 0",
                                            "setConfiguration (null) 0", "destroy 11",
                                            "destroy 11", "create 13"));
  stays.hangUp();
  ASSERT_THAT(eventsAfter(3), ElementsAre(accepted(), "interrupted", "invalidated"));
  RawClient next(path);
  next.send(createRequest(1, 21));
  next.send(createRequest(2, 22));
  ASSERT_TRUE(next.receive());
  ASSERT_TRUE(next.receive());
  EXPECT_EQ(service->calls().back(), "create 22");
}

TEST_F(UnixSocketListener, LogsOneKindOfMisuseOfAUserOnceAMinuteAndCountsAll) {
  ListenerLimits limits;
  limits.ofUser.sessions = 0;
  const CapturedLog log;
  serve(limits);
  for (int i = 0; i < 3; ++i) {
    RawClient client(path);
    client.send(createRequest(1, 7));
    ASSERT_TRUE(client.receive());
    client.send(std::string(4, '\0'));
    EXPECT_EQ(client.receiveClosing(), "a frame is empty");
    EXPECT_TRUE(client.isEnded());
  }
  EXPECT_EQ(misuse->counts(), (MisuseLog::Counts{3, 0, 3}));
  EXPECT_THAT(log.lines(LogLevel::kError),
              UnorderedElementsAre(HasSubstr("gets no session: there are too many"),
                                   HasSubstr("is cut off: a frame is empty")));
}

TEST_F(UnixSocketListener, TakesNoDescriptorsFromAClient) {
  serve();
  RawClient client(path);
  client.send(createRequest(1, 7));
  ASSERT_TRUE(client.receive());
  const std::size_t before = openDescriptors();
  char byte = 0;
  iovec place{&byte, 1};
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))]{};
  msghdr message{};
  message.msg_iov = &place;
  message.msg_iovlen = 1;
  message.msg_control = control;
  message.msg_controllen = sizeof control;
  cmsghdr* header = CMSG_FIRSTHDR(&message);
  header->cmsg_level = SOL_SOCKET;
  header->cmsg_type = SCM_RIGHTS;
  header->cmsg_len = CMSG_LEN(sizeof(int));
  const int passed = client.socket();
  std::memcpy(CMSG_DATA(header), &passed, sizeof passed);

  ASSERT_EQ(::sendmsg(client.socket(), &message, MSG_NOSIGNAL), 1);

  EXPECT_EQ(client.receiveClosing(), "descriptors are not taken");
  eventsAfter(3);
  EXPECT_LT(openDescriptors(), before);
}

TEST_F(UnixSocketListener, GivesBackEveryDescriptorOfManyConnections) {
  serve();
  const std::size_t before = openDescriptors();

  for (int i = 0; i < 500; ++i) {
    RawClient client(path);
    client.send(createRequest(1, 7));
    EXPECT_TRUE(client.receive());
  }

  EXPECT_EQ(eventsAfter(1500).size(), 1500);
  EXPECT_LE(openDescriptors(), before + 1);
}

TEST_F(UnixSocketListener, KnowsWhichProcessConnected) {
  serve();
  RawClient client(path);

  EXPECT_THAT(eventsAfter(1), ElementsAre(accepted()));
}

TEST_F(UnixSocketListener, TellsEveryClientOfItsEndAndInvalidatesThem) {
  serve();
  RawClient client(path);
  client.send(createRequest(1, 7));
  ASSERT_TRUE(client.receive());

  stop();

  EXPECT_EQ(client.receiveClosing(), "the service ends");
  EXPECT_THAT(eventsAfter(2), ElementsAre(accepted(), "invalidated"));
}

TEST_F(UnixSocketListener, RefusesToShareItsSocketAndTheFirstGoesOn) {
  serve();

  const auto second = UnixSocketIPCListener::open(path, peers);

  ASSERT_FALSE(second.value);
  EXPECT_THAT(second.error->description, HasSubstr("already listening"));
  RawClient client(path);
  client.send(createRequest(1, 7));
  EXPECT_TRUE(client.receive());
}

TEST_F(UnixSocketListener, ReplacesWhatADeadServiceLeft) {
  std::filesystem::create_directories(directory / "run");
  directory.write("run/reporting.sock", "stale");

  serve();

  RawClient client(path);
  client.send(createRequest(1, 7));
  EXPECT_TRUE(client.receive());
}

TEST_F(UnixSocketListener, LetsOwnerAndGroupConnectAndNobodyElse) {
  serve();
  struct stat status {};
  ASSERT_EQ(::stat(path.c_str(), &status), 0);

  EXPECT_EQ(status.st_mode & 0777, 0660u);
}

TEST_F(UnixSocketListener, LeavesNoSocketBehind) {
  serve();

  stop();

  EXPECT_FALSE(std::filesystem::exists(path));
}

TEST_F(UnixSocketListener, SaysToTheServiceManagerThatItIsReady) {
  const std::string notify = directory / "notify";
  FileDescriptor manager(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  notify.copy(address.sun_path, sizeof address.sun_path - 1);
  ASSERT_EQ(
      ::bind(manager.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address),
      0);
  ::setenv("NOTIFY_SOCKET", notify.c_str(), /*replace=*/1);

  serve();

  pollfd waited{manager.get(), POLLIN, 0};
  EXPECT_EQ(::poll(&waited, 1, 5000), 1);
  char text[64]{};
  EXPECT_GT(::recv(manager.get(), text, sizeof text - 1, 0), 0);
  EXPECT_STREQ(text, "READY=1");
  stop();
  ::unsetenv("NOTIFY_SOCKET");
}

TEST(ProcProcessInfo, NamesAProcessThatIsConnected) {
  testing_support::ChildProcess sleeper({"sleep", "60"});
  const auto peers = std::make_shared<PeerRegistry>();
  peers->peerConnected(sleeper.pid(), /*connection=*/1, openProcess(sleeper.pid()));
  const ProcProcessInfo info(peers);

  // The name is the new program's as soon as it runs.
  std::optional<std::string> name;
  for (int i = 0; i < 500 && name != "sleep"; ++i) {
    std::this_thread::sleep_for(10ms);
    name = info.commandName(sleeper.pid());
  }

  EXPECT_EQ(name, "sleep");
}

TEST(ProcProcessInfo, DoesNotNameAProcessThatHasEndedOrThatIsNone) {
  const auto peers = std::make_shared<PeerRegistry>();
  ProcessID pid = 0;
  {
    testing_support::ChildProcess sleeper({"sleep", "60"});
    pid = sleeper.pid();
    peers->peerConnected(pid, /*connection=*/1, openProcess(pid));
  }
  const ProcProcessInfo info(peers);

  EXPECT_EQ(info.commandName(pid), std::nullopt);
  EXPECT_EQ(info.commandName(0), std::nullopt);
  EXPECT_EQ(info.commandName(-1), std::nullopt);
}

TEST(ProcProcessInfo, DoesNotNameAnotherProcessThatHasTheIDByNow) {
  TemporaryDirectory proc;
  std::filesystem::create_directories(proc / std::to_string(::getpid() + 1));
  proc.write(std::to_string(::getpid() + 1) + "/comm", "impostor\n");
  const auto peers = std::make_shared<PeerRegistry>();
  testing_support::ChildProcess gone({"true"});
  FileDescriptor process = openProcess(gone.pid());
  gone.wait();
  peers->peerConnected(::getpid() + 1, /*connection=*/1, std::move(process));

  EXPECT_EQ(ProcProcessInfo(peers, proc.path()).commandName(::getpid() + 1),
            std::nullopt);
}

TEST(ProcProcessInfo, DoesNotNameAClientThatHasDisconnected) {
  testing_support::ChildProcess sleeper({"sleep", "60"});
  const auto peers = std::make_shared<PeerRegistry>();
  peers->peerConnected(sleeper.pid(), /*connection=*/1, openProcess(sleeper.pid()));
  peers->peerDisconnected(sleeper.pid(), /*connection=*/1);

  EXPECT_EQ(ProcProcessInfo(peers).commandName(sleeper.pid()), std::nullopt);
}

TEST(ProcProcessInfo, PassesOverANameThatIsNotText) {
  TemporaryDirectory proc;
  testing_support::ChildProcess sleeper({"sleep", "60"});
  std::filesystem::create_directories(proc / std::to_string(sleeper.pid()));
  proc.write(std::to_string(sleeper.pid()) + "/comm", "\xFF\xFE\n");

  EXPECT_EQ(ProcProcessInfo(std::make_shared<PeerRegistry>(), proc.path())
                .commandName(sleeper.pid()),
            std::nullopt);
}

}  // namespace
}  // namespace ostrel
