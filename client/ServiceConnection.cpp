// One thread a connection reads, calls replies, and writes what a caller could
// not write at once: a request goes straight to the socket unless earlier bytes
// still wait there. The thread owns the state together with the connection, so
// that a connection may be dropped from one of its own replies.
#include "client/ServiceConnection.h"

#include <poll.h>
#include <signal.h>

#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <deque>
#include <mutex>
#include <thread>
#include <utility>
#include <variant>

#include "client/ClientSocket.h"
#include "platform/linux/Limits.h"
#include "platform/linux/Places.h"
#include "platform/linux/wire/Frame.h"

namespace ostrel {
namespace {

using Clock = std::chrono::steady_clock;
using wire::Operation;
using wire::RequestNumber;

// How long `close` waits for the service to read the farewell and to hang up.
constexpr std::chrono::seconds kFarewellTimeout{3};

constexpr std::size_t kReadSize = 64 * 1024;

constexpr const char* kGone = "the service went away";

// A service whose queue of clients is full is asked again so often.
constexpr int kConnectAttempts = 200;
constexpr std::chrono::milliseconds kConnectPause{10};

constexpr wire::PayloadLimits kReplyLimits{limits::kNesting, limits::kNodes,
                                           limits::kKeyBytes};

using Handler = std::variant<BoolReply, ServiceTypeReply, ErrorReply, DictionaryReply,
                             ReporterIDsReply>;

bool isEmpty(const Handler& handler) {
  return std::visit([](const auto& reply) { return !reply; }, handler);
}

// False when the value is not of the kind that the handler takes.
bool callHandler(const Handler& handler, const wire::ReplyValue& value) {
  if (auto* reply = std::get_if<ErrorReply>(&handler)) {
    if (std::holds_alternative<std::monostate>(value)) {
      (*reply)(std::nullopt);
      return true;
    }
    const auto* error = std::get_if<ErrorObject>(&value);
    if (error) (*reply)(*error);
    return error != nullptr;
  }
  const auto callWith = [](const auto& reply, const auto* argument) {
    if (argument) reply(*argument);
    return argument != nullptr;
  };
  if (auto* reply = std::get_if<BoolReply>(&handler)) {
    return callWith(*reply, std::get_if<bool>(&value));
  }
  if (auto* reply = std::get_if<ServiceTypeReply>(&handler)) {
    return callWith(*reply, std::get_if<ServiceType>(&value));
  }
  if (auto* reply = std::get_if<DictionaryReply>(&handler)) {
    return callWith(*reply, std::get_if<Dictionary>(&value));
  }
  return callWith(std::get<ReporterIDsReply>(handler), std::get_if<ReporterIDs>(&value));
}

class ConnectionState : public std::enable_shared_from_this<ConnectionState> {
 public:
  ConnectionState(ClientSocket socket, WakeEvent wake)
      : wake_(std::move(wake)), socket_(std::move(socket)) {}

  void setClosedHandler(std::function<void(std::string)> handler) {
    const std::lock_guard lock(mutex_);
    closedHandler_ = std::move(handler);
    startThread();
  }

  void send(wire::Request request, Handler handler) {
    const std::lock_guard lock(mutex_);
    if (phase_ != Phase::kOpen) return;
    startThread();
    if (!isEmpty(handler)) {
      requests_.push_back({request.operation, std::move(handler)});
      request.number = requests_.size();
    }
    wire::appendRequest(unsent_, request);
    writeOrLeave();
  }

  void close() {
    std::unique_lock lock(mutex_);
    if (phase_ == Phase::kOpen) {
      phase_ = Phase::kClosing;
      wire::appendFarewell(unsent_);
      startThread();
      writeOrLeave();
      if (isOwnThread()) {
        lock.unlock();
        serveUntil(Clock::now() + kFarewellTimeout);
        lock.lock();
      } else {
        ended_.wait_for(lock, kFarewellTimeout, [&] { return phase_ == Phase::kEnded; });
      }
    }
    end(std::move(lock));
  }

  void abort() { end(std::unique_lock(mutex_)); }

 private:
  // Closing: the farewell is queued and replies still come.
  enum class Phase { kOpen, kClosing, kEnded };

  struct SentRequest {
    Operation operation;
    Handler handler;
  };

  bool isOwnThread() const { return std::this_thread::get_id() == threadID_; }

  void startThread() {
    if (hasThread_) return;
    hasThread_ = true;
    isRunning_ = true;
    // The host's signal handlers have no business on this thread.
    sigset_t all;
    sigset_t before;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &before);
    std::thread thread([self = shared_from_this()] { self->run(); });
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
    threadID_ = thread.get_id();
    thread.detach();
  }

  // Ends the connection without a word; on another thread, waits for a reply
  // that is being called.
  void end(std::unique_lock<std::mutex> lock) {
    phase_ = Phase::kEnded;
    if (!hasThread_) {
      socket_.close();
    } else if (!isOwnThread()) {
      wake_.wake();
      ended_.wait(lock, [&] { return !isRunning_; });
    }
  }

  void writeOrLeave() {
    if (!writeSome()) wake_.wake();
  }

  // False when the socket has no room for the rest.
  bool writeSome() {
    while (unsentBegin_ < unsent_.size()) {
      const auto sent = socket_.send(std::string_view(unsent_).substr(unsentBegin_));
      if (!sent) {
        isBroken_ = true;
        return false;
      }
      if (*sent == 0) return false;
      unsentBegin_ += *sent;
    }
    unsent_.clear();
    unsentBegin_ = 0;
    return true;
  }

  void run() {
    {
      // The thread that made this one has set `threadID_` when it lets go.
      const std::lock_guard lock(mutex_);
    }
    serveUntil(Clock::time_point::max());
    std::function<void(std::string)> handler;
    {
      const std::lock_guard lock(mutex_);
      if (phase_ == Phase::kOpen) handler = std::move(closedHandler_);
      phase_ = Phase::kEnded;
      socket_.close();
    }
    if (handler) handler(endReason_);
    handler = {};
    std::deque<SentRequest> dropped;
    {
      const std::lock_guard lock(mutex_);
      closedHandler_ = {};
      requests_.swap(dropped);
    }
    dropped.clear();
    const std::lock_guard lock(mutex_);
    isRunning_ = false;
    ended_.notify_all();
  }

  // Reads and writes until the connection is over or the time has come.
  void serveUntil(Clock::time_point deadline) {
    while (Clock::now() < deadline) {
      short events = POLLIN;
      bool isBroken;
      {
        const std::lock_guard lock(mutex_);
        if (phase_ == Phase::kEnded || !endReason_.empty()) return;
        if (!writeSome()) events |= POLLOUT;
        isBroken = isBroken_;
      }
      if (isBroken) {
        readReplies();  // What the service still said.
        if (endReason_.empty()) endReason_ = kGone;
        return;
      }
      pollfd descriptors[] = {{socket_.descriptor(), events, /*revents=*/0},
                              {wake_.descriptor(), POLLIN, /*revents=*/0}};
      ::poll(descriptors, std::size(descriptors), timeoutUntil(deadline));
      if (descriptors[1].revents != 0) wake_.clear();
      if ((descriptors[0].revents & (POLLIN | POLLHUP | POLLERR)) != 0) readReplies();
    }
  }

  static int timeoutUntil(Clock::time_point deadline) {
    if (deadline == Clock::time_point::max()) return -1;
    const auto left =
        std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now());
    return static_cast<int>(std::max<std::int64_t>(left.count(), 0));
  }

  // On the thread.
  void readReplies() {
    std::size_t size = 0;
    switch (socket_.receive(reader_.room(kReadSize), size)) {
      case ClientSocket::Received::kNothingYet:
        return;
      case ClientSocket::Received::kEnd:
        endReason_ = kGone;
        return;
      case ClientSocket::Received::kBytes:
        reader_.added(size);
        break;
    }
    std::span<const std::uint8_t> item;
    while (true) {
      switch (reader_.next(item)) {
        case wire::FrameReader::Next::kMoreNeeded:
          return;
        case wire::FrameReader::Next::kTooLarge:
        case wire::FrameReader::Next::kEmpty:
          endReason_ = "the service sent a frame of an impossible length";
          return;
        case wire::FrameReader::Next::kFrame:
          break;
      }
      if (!takeReply(item)) return;
    }
  }

  // False when no further reply is to be read.
  bool takeReply(std::span<const std::uint8_t> item) {
    wire::Reply reply;
    const auto error = wire::decodeReply(item, kReplyLimits, operationOf_, reply);
    if (error) {
      endReason_ = "the service sent a malformed reply: " + std::string(*error);
      return false;
    }
    if (reply.number == 0) {
      endReason_ = reply.closingReason.empty() ? "the service closed the connection"
                                               : reply.closingReason;
      return false;
    }
    Handler handler;
    {
      const std::lock_guard lock(mutex_);
      if (phase_ == Phase::kEnded) return false;
      handler = requests_[reply.number - 1].handler;
    }
    if (!callHandler(handler, reply.value)) {
      endReason_ = "the service sent a reply of the wrong kind";
      return false;
    }
    const std::lock_guard lock(mutex_);
    return phase_ != Phase::kEnded;
  }

  const std::function<std::optional<Operation>(RequestNumber)> operationOf_ =
      [this](RequestNumber number) -> std::optional<Operation> {
    const std::lock_guard lock(mutex_);
    if (number == 0 || number > requests_.size()) return std::nullopt;
    return requests_[number - 1].operation;
  };

  WakeEvent wake_;

  // On the connection's thread.
  wire::FrameReader reader_{limits::kFrameBytes};
  std::string endReason_;

  // Shared, with the lock. The thread alone closes the socket once it runs.
  std::mutex mutex_;
  std::condition_variable ended_;
  ClientSocket socket_;
  Phase phase_ = Phase::kOpen;
  bool isBroken_ = false;  // Writing fails.
  bool hasThread_ = false;
  bool isRunning_ = false;
  std::thread::id threadID_;
  std::function<void(std::string)> closedHandler_;
  std::string unsent_;
  std::size_t unsentBegin_ = 0;
  std::deque<SentRequest> requests_;  // Request N is at N - 1.
};

class SocketServiceConnection final : public ServiceConnection {
 public:
  SocketServiceConnection(ClientSocket socket, WakeEvent wake)
      : state_(std::make_shared<ConnectionState>(std::move(socket), std::move(wake))) {}
  ~SocketServiceConnection() override { state_->abort(); }

  void setClosedHandler(std::function<void(std::string)> handler) override {
    state_->setClosedHandler(std::move(handler));
  }
  void close() override { state_->close(); }
  void abort() override { state_->abort(); }

  void createReportingSession(ReporterID reporterID, BoolReply reply) override {
    send(Operation::kCreateReportingSession, reporterID, std::move(reply));
  }

  void setServiceType(ServiceType serviceType, ReporterID reportingSession,
                      BoolReply reply) override {
    wire::Request request;
    request.operation = Operation::kSetServiceType;
    request.serviceType = serviceType;
    request.reporterID = reportingSession;
    state_->send(std::move(request), std::move(reply));
  }

  void getServiceNameForReporterID(ReporterID reporterID,
                                   ServiceTypeReply reply) override {
    send(Operation::kGetServiceNameForReporterID, reporterID, std::move(reply));
  }

  void setConfiguration(std::optional<Dictionary> configuration, ReporterID reporterID,
                        BoolReply reply) override {
    wire::Request request;
    request.operation = Operation::kSetConfiguration;
    request.dictionary = std::move(configuration);
    request.reporterID = reporterID;
    state_->send(std::move(request), std::move(reply));
  }

  void startReportingSessionForID(ReporterID reporterID, BoolReply reply) override {
    send(Operation::kStartReportingSessionForID, reporterID, std::move(reply));
  }

  void sendMessage(Dictionary message, MessageCategory category, MessageType type,
                   std::optional<ReporterIDs> reportingIDs, ErrorReply reply) override {
    wire::Request request;
    request.operation = Operation::kSendMessage;
    request.dictionary = std::move(message);
    request.category = category;
    request.type = type;
    request.reporterIDs = std::move(reportingIDs);
    state_->send(std::move(request), std::move(reply));
  }

  void stopReportingSessionForID(ReporterID reporterID, BoolReply reply) override {
    send(Operation::kStopReportingSessionForID, reporterID, std::move(reply));
  }

  void destroyReportingSession(ReporterID reporterID, BoolReply reply) override {
    send(Operation::kDestroyReportingSession, reporterID, std::move(reply));
  }

  void reporterIDValid(ReporterID reporterID, DictionaryReply reply) override {
    send(Operation::kReporterIDValid, reporterID, std::move(reply));
  }

  void getAllReporters(ReporterIDsReply reply) override {
    send(Operation::kGetAllReporters, kNoReporter, std::move(reply));
  }

  void killService(BoolReply reply) override {
    send(Operation::kKillService, kNoReporter, std::move(reply));
  }

 private:
  template <typename Reply>
  void send(Operation operation, ReporterID reporterID, Reply reply) {
    wire::Request request;
    request.operation = operation;
    request.reporterID = reporterID;
    state_->send(std::move(request), std::move(reply));
  }

  const std::shared_ptr<ConnectionState> state_;
};

}  // namespace

std::string serviceSocketPath() {
  const char* named = std::getenv("OSTREL_REPORTING_SOCKET");
  if (named != nullptr && *named != '\0') return named;
  return reportingSocketPath();
}

Outcome<std::shared_ptr<ServiceConnection>> ServiceConnection::connect(
    const std::string& socketPath) {
  auto socket = ClientSocket::connect(socketPath);
  for (int i = 0; i < kConnectAttempts && socket.error && socket.error->code == EAGAIN;
       ++i) {
    std::this_thread::sleep_for(kConnectPause);
    socket = ClientSocket::connect(socketPath);
  }
  if (!socket.value) return {{}, std::move(socket.error)};
  auto wake = WakeEvent::make();
  if (!wake.value) return {{}, std::move(wake.error)};
  return {std::make_shared<SocketServiceConnection>(std::move(*socket.value),
                                                    std::move(*wake.value)),
          {}};
}

}  // namespace ostrel
