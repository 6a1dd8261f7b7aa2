// The listener before a service that writes down what it is asked, for the tests.
#pragma once

#include <gtest/gtest.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <functional>
#include <latch>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Statistics/Service/OstrelReportingServiceProtocol.h"
#include "platform/linux/RawClient.h"
#include "platform/linux/TestSupport.h"
#include "platform/linux/UnixSocketIPCListener.h"

namespace ostrel::testing_support {

/// What the service is asked, in order. Replies at once unless told to hold.
class RecordingService : public OstrelReportingServiceProtocol {
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
  void expectMessage(ReporterID id) override {
    const std::lock_guard lock(mutex_);
    expected_.emplace_back(id, calls_.size());
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

  /// Whom messages were expected for, and after how many calls.
  std::vector<std::pair<ReporterID, std::size_t>> expected() const {
    const std::lock_guard lock(mutex_);
    return expected_;
  }
  std::vector<std::string> calls() const {
    const std::lock_guard lock(mutex_);
    return calls_;
  }
  bool waitForCalls(std::size_t count, std::chrono::milliseconds patience = kSoon) const {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, patience, [&] { return calls_.size() >= count; });
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
  std::vector<std::pair<ReporterID, std::size_t>> expected_;
  std::vector<std::function<void()>> held_;
  BoolReply startReply_;
  ReporterIDs ids_;
  bool isHolding_ = false;
};

/// Stops the thread that calls `stopHere` until the test lets it go on.
class StoppingPlace {
 public:
  void stopHere() {
    hasStopped_.count_down();
    goOn_.wait();
  }
  void waitUntilStopped() const { hasStopped_.wait(); }
  void letGo() { goOn_.count_down(); }

 private:
  std::latch hasStopped_{1};
  std::latch goOn_{1};
};

/// One listener on a socket of its own, served by a thread. Each connection is accepted
/// for `service`, and what becomes of it is written down.
class UnixSocketListener : public testing::Test, public IPCListenerDelegate {
 protected:
  ~UnixSocketListener() override { stop(); }

  void serve(ListenerLimits limits = {}) {
    auto opened = UnixSocketIPCListener::open(
        path, peers,
        {limits, misuse, /*disposal=*/nullptr, /*heap=*/nullptr, identityOf, now});
    ASSERT_TRUE(opened.value) << opened.error->description;
    listener = *std::move(opened.value);
    listener->setDelegate(this);
    thread = std::thread([this] { listener->resume(); });
  }
  /// Serves, and answers nothing until the service's replies are released.
  void serveHolding(const ListenerLimits& limits) {
    serve(limits);
    service->holdReplies();
  }
  /// How many requests are carried out while replies are held, `least` or more.
  std::size_t callsWhileHeld(std::size_t least) {
    EXPECT_TRUE(service->waitForCalls(least));
    // Those that may not be would be by then.
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    return service->calls().size();
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
    if (isRefusing) return false;
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
  bool isRefusing = false;                             // All connections. Before `serve`.
  std::function<PeerIdentity(int socket)> identityOf;  // Empty: the kernel's.
  std::function<PeerConnection::Clock::time_point()> now;  // Empty: steady time.
  const std::shared_ptr<RecordingService> service = std::make_shared<RecordingService>();
  std::unique_ptr<UnixSocketIPCListener> listener;
  std::thread thread;
  std::mutex mutex;
  std::condition_variable changed;
  std::vector<std::string> events;
};

}  // namespace ostrel::testing_support
