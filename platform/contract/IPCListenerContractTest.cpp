#include <sys/socket.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <mutex>
#include <thread>

#include "Statistics/Service/OstrelReportingServiceProtocol.h"
#include "platform/contract/Time.h"
#include "platform/fake/EventLog.h"
#include "platform/fake/FakeIPCListener.h"
#include "platform/linux/TestSockets.h"
#include "platform/linux/TestSupport.h"
#include "platform/linux/UnixSocketIPCListener.h"

namespace ostrel {
namespace {

using testing::ElementsAre;

/// Notes the one request that the clients of these tests make.
class NotingService final : public OstrelReportingServiceProtocol {
 public:
  explicit NotingService(SharedEventLog events) : events_(std::move(events)) {}
  ~NotingService() override { events_->add("released"); }

  void getAllReporters(ReporterIDsReply) override { events_->add("request"); }

  void createReportingSession(ReporterID, BoolReply) override {}
  void setServiceType(ServiceType, ReporterID, BoolReply) override {}
  void getServiceNameForReporterID(ReporterID, ServiceTypeReply) override {}
  void setConfiguration(std::optional<Dictionary>, ReporterID, BoolReply) override {}
  void startReportingSessionForID(ReporterID, BoolReply) override {}
  void sendMessage(Dictionary, MessageCategory, MessageType, std::optional<ReporterIDs>,
                   ErrorReply) override {}
  void stopReportingSessionForID(ReporterID, BoolReply) override {}
  void destroyReportingSession(ReporterID, BoolReply) override {}
  void reporterIDValid(ReporterID, DictionaryReply) override {}
  void killService(BoolReply) override {}

 private:
  const SharedEventLog events_;
};

/// Sets each connection up as the service does, and notes what happens to it.
class NotingDelegate final : public IPCListenerDelegate {
 public:
  explicit NotingDelegate(SharedEventLog events) : events_(std::move(events)) {}

  bool listenerShouldAcceptNewConnection(
      IPCListener&, const std::shared_ptr<IPCConnection>& connection) override {
    {
      const std::lock_guard lock(mutex_);
      pid_ = connection->processIdentifier();
      description_ = connection->description();
    }
    if (refuses) {
      events_->add("refused");
      return false;
    }
    const auto service = std::make_shared<NotingService>(events_);
    connection->setExportedObject(service);
    EXPECT_EQ(connection->exportedObject(), service);
    connection->setInterruptionHandler(
        [events = events_] { events->add("interrupted"); });
    connection->setInvalidationHandler(
        [events = events_] { events->add("invalidated"); });
    connection->resume();
    events_->add("accepted");
    return true;
  }

  ProcessID pid() const {
    const std::lock_guard lock(mutex_);
    return pid_;
  }
  std::string description() const {
    const std::lock_guard lock(mutex_);
    return description_;
  }

  std::atomic<bool> refuses{false};

 private:
  const SharedEventLog events_;
  mutable std::mutex mutex_;
  ProcessID pid_ = 0;
  std::string description_;
};

/// One client of a fake listener.
class ListenerInMemory {
 public:
  ListenerInMemory() { listener_.setDelegate(&delegate); }

  void connect() { connection_ = listener_.accept(/*pid=*/77); }
  void request() { connection_->exportedObject()->getAllReporters(nullptr); }
  void endWell() { connection_->invalidate(); }
  void vanish() { connection_->interrupt(); }
  bool comesTo(const std::function<bool()>& isSo) { return isSo(); }

  const SharedEventLog events = std::make_shared<EventLog>();
  NotingDelegate delegate{events};

 private:
  FakeIPCListener listener_{std::make_shared<EventLog>()};
  std::shared_ptr<FakeIPCConnection> connection_;
};

/// One client of a listener on a socket, writing its frames by hand.
class ListenerOnASocket {
 public:
  ListenerOnASocket() {
    auto opened = UnixSocketIPCListener::open(path_, std::make_shared<PeerRegistry>());
    if (!opened.value) {
      ADD_FAILURE() << (opened.error ? opened.error->description : "no listener");
      return;
    }
    listener_ = std::move(*opened.value);
    listener_->setDelegate(&delegate);
    thread_ = std::thread([this] { listener_->resume(); });
  }
  ~ListenerOnASocket() {
    if (listener_) listener_->stop();
    if (thread_.joinable()) thread_.join();
  }
  ListenerOnASocket(const ListenerOnASocket&) = delete;
  ListenerOnASocket& operator=(const ListenerOnASocket&) = delete;

  void connect() {
    client_ = testing_support::connectedSocket(path_);
    ASSERT_TRUE(client_) << std::strerror(errno);
  }
  void request() { write({0x82, 0x0A, 0x00}); }  // [10, 0]
  void endWell() {
    write({0x81, 0x00});  // [0]
    client_.reset();
  }
  void vanish() { client_.reset(); }
  bool comesTo(const std::function<bool()>& isSo) { return time_.reaches(isSo); }

  const SharedEventLog events = std::make_shared<EventLog>();
  NotingDelegate delegate{events};

 private:
  void write(std::vector<std::uint8_t> item) {
    std::vector<std::uint8_t> frame{static_cast<std::uint8_t>(item.size()), 0, 0, 0};
    frame.insert(frame.end(), item.begin(), item.end());
    ASSERT_EQ(send(client_.get(), frame.data(), frame.size(), MSG_NOSIGNAL),
              static_cast<ssize_t>(frame.size()));
  }

  testing_support::TemporaryDirectory directory_;
  const std::string path_ = directory_ / "reporting.sock";
  std::unique_ptr<UnixSocketIPCListener> listener_;
  std::thread thread_;
  FileDescriptor client_;
  RealTime time_;
};

template <typename Subject>
class IPCListenerContract : public testing::Test {
 protected:
  // Waits until `event` is there as the last one.
  bool endsWith(const std::string& event) {
    return subject_.comesTo([&] {
      const auto all = subject_.events->all();
      return !all.empty() && all.back() == event;
    });
  }
  std::vector<std::string> events() { return subject_.events->all(); }

  Subject subject_;
};
using Subjects = testing::Types<ListenerInMemory, ListenerOnASocket>;
TYPED_TEST_SUITE(IPCListenerContract, Subjects);

TYPED_TEST(IPCListenerContract, ShowsTheDelegateWhoConnects) {
  this->subject_.connect();
  ASSERT_TRUE(this->endsWith("accepted"));
  EXPECT_GT(this->subject_.delegate.pid(), 0);
  EXPECT_FALSE(this->subject_.delegate.description().empty());
  EXPECT_EQ(this->subject_.delegate.description().find('\n'), std::string::npos);
}

TYPED_TEST(IPCListenerContract, CallsTheExportedObjectForEachRequest) {
  this->subject_.connect();
  ASSERT_TRUE(this->endsWith("accepted"));
  this->subject_.request();
  this->subject_.request();
  EXPECT_TRUE(this->subject_.comesTo(
      [&] { return this->subject_.events->count("request") == 2; }));
}

TYPED_TEST(IPCListenerContract, OnlyInvalidatesAConnectionThatEndsWell) {
  this->subject_.connect();
  this->subject_.request();
  this->subject_.endWell();
  ASSERT_TRUE(this->endsWith("released"));
  EXPECT_THAT(this->events(),
              ElementsAre("accepted", "request", "invalidated", "released"));
}

TYPED_TEST(IPCListenerContract, InterruptsThenInvalidatesAConnectionThatVanishes) {
  this->subject_.connect();
  this->subject_.request();
  this->subject_.vanish();
  ASSERT_TRUE(this->endsWith("released"));
  EXPECT_THAT(this->events(), ElementsAre("accepted", "request", "interrupted",
                                          "invalidated", "released"));
}

TYPED_TEST(IPCListenerContract, InterruptsAConnectionThatNeverAskedForAnything) {
  this->subject_.connect();
  this->subject_.vanish();
  ASSERT_TRUE(this->endsWith("released"));
  EXPECT_THAT(this->events(),
              ElementsAre("accepted", "interrupted", "invalidated", "released"));
}

TYPED_TEST(IPCListenerContract, ServesNobodyWhomTheDelegateRefuses) {
  this->subject_.delegate.refuses = true;
  this->subject_.connect();
  ASSERT_TRUE(this->endsWith("refused"));
  this->subject_.delegate.refuses = false;
  this->subject_.connect();
  ASSERT_TRUE(this->endsWith("accepted"));
  EXPECT_THAT(this->events(), ElementsAre("refused", "accepted"));
}

}  // namespace
}  // namespace ostrel
