// What the tests of the service host share.
#pragma once

#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Statistics/CoreTestFixture.h"
#include "Statistics/Service/OstrelReportingServiceDelegate.h"

namespace ostrel {

/// A service whose clients are connections of the fake listener. Nothing is
/// verbose. What starting it wrote and did is forgotten.
class ServiceTest : public CoreTest {
 protected:
  using Replies = std::vector<std::string>;

  ServiceTest() { restart(); }

  /// A registered client and the root object hold each other.
  ~ServiceTest() override {
    for (const auto& connection : connections_) connection->releaseCallbacks();
    for (const auto& each : roots_) {
      onServerQueue([&] { removeClients(*each); });
    }
    fakes.runUntilIdle();
  }

  /// Makes the service anew, for what it notices only when it starts. Clients of
  /// the earlier one are not to be used any more.
  void restart() {
    root = OstrelReportingServiceDelegate::init(platform);
    roots_.push_back(root);
    fakes.listener->setDelegate(root.get());
    forgetRecords();
  }

  /// A client of that process, not registered yet.
  std::shared_ptr<FakeIPCConnection> accept(ProcessID pid) {
    connections_.push_back(fakes.listener->accept(pid));
    return connections_.back();
  }

  /// A registered client's server instance; lines and events are forgotten.
  std::shared_ptr<OstrelReportingServerInstance> connect(ProcessID pid) {
    const auto connection = accept(pid);
    fakes.runUntilIdle();
    forgetRecords();
    return instanceOf(*connection);
  }

  static std::shared_ptr<OstrelReportingServerInstance> instanceOf(
      const FakeIPCConnection& connection) {
    return std::static_pointer_cast<OstrelReportingServerInstance>(
        connection.exportedObject());
  }

  /// A session of that client's, not started; lines and events are forgotten.
  std::shared_ptr<OstrelReportingSession> create(OstrelReportingServerInstance& client,
                                                 std::int64_t reporterID) {
    client.createReportingSession(ReporterID{reporterID}, /*reply=*/nullptr);
    fakes.runUntilIdle();
    forgetRecords();
    return sessionOf(client, reporterID);
  }

  /// As `create`, started.
  std::shared_ptr<OstrelReportingSession> createStarted(
      OstrelReportingServerInstance& client, std::int64_t reporterID) {
    auto session = create(client, reporterID);
    client.startReportingSessionForID(ReporterID{reporterID}, /*reply=*/nullptr);
    fakes.runUntilIdle();
    EXPECT_TRUE(session->started());
    forgetRecords();
    return session;
  }

  /// The client's own session; none when it has none under that ID.
  std::shared_ptr<OstrelReportingSession> sessionOf(OstrelReportingServerInstance& client,
                                                    std::int64_t reporterID) {
    std::shared_ptr<OstrelReportingSession> session;
    onServerQueue([&] { session = findOwn(client, reporterID); });
    return session;
  }

  /// The clients in the list, by process id.
  std::vector<ProcessID> registeredClients() {
    std::vector<ProcessID> pids;
    onServerQueue([&] { collectClients(pids); });
    return pids;
  }

  void onServerQueue(const std::function<void()>& action) {
    std::static_pointer_cast<ManualWorkQueue>(serverQueue())->runAs(action);
  }

  void switchReporting(bool on) {
    fakes.userDefaults->setSuite("com.orbisk.ostrel", {{"disable_reporting", !on}});
    postDefaultsChange();
    EXPECT_EQ(root->reportingEnabled(), on);
    forgetRecords();
  }

  void postDefaultsChange() {
    fakes.notifications->post("com.orbisk.ostrel.reporting");
    fakes.runUntilIdle();
  }

  void forgetRecords() {
    fakes.log->clear();
    fakes.events->clear();
  }

  /// The lines of the service host alone.
  LogLines takeHostLines() {
    LogLines lines = takeLines();
    std::erase_if(lines, [](const auto& line) { return line.scopeCode != "osrs"; });
    return lines;
  }

  // Replies that write down what they got.
  BoolReply boolReply() {
    return [this](bool value) { replies.push_back(value ? "true" : "false"); };
  }
  ServiceTypeReply typeReply() {
    return [this](ServiceType type) {
      replies.push_back(std::to_string(static_cast<std::uint16_t>(type)));
    };
  }
  ErrorReply errorReply() {
    return [this](const std::optional<ErrorObject>& error) {
      replies.push_back(error ? error->domain + ' ' + std::to_string(error->code)
                              : "no error");
    };
  }
  DictionaryReply dictionaryReply() {
    return [this](const Dictionary& value) { replies.push_back(description(value)); };
  }
  ReporterIDsReply idsReply() {
    return [this](const ReporterIDs& ids) { replies.push_back(format("%@", ids)); };
  }

  std::shared_ptr<OstrelReportingServiceDelegate> root;
  Replies replies;

 private:
  static std::shared_ptr<OstrelReportingSession> findOwn(
      OstrelReportingServerInstance& client, std::int64_t reporterID) {
    assertOnServerQueue();
    const auto& map = client.clientReportingSessionMap();
    const auto found = map.find(ReporterID{reporterID});
    return found != map.end() ? found->second : nullptr;
  }
  void collectClients(std::vector<ProcessID>& pids) {
    assertOnServerQueue();
    for (const auto& client : root->clients()) pids.push_back(client->clientID());
  }

  static void removeClients(OstrelReportingServiceDelegate& from) {
    assertOnServerQueue();
    for (const auto& client : from.clients()) client->handleConnectionError();
  }

  std::vector<std::shared_ptr<OstrelReportingServiceDelegate>> roots_;
  std::vector<std::shared_ptr<FakeIPCConnection>> connections_;
};

}  // namespace ostrel
