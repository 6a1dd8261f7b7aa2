// What the tests of sessions share.
#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "Statistics/CoreTestFixture.h"
#include "Statistics/Service/OstrelReportingSession.h"

namespace ostrel {

/// A session 42 that is not started, made by the test or the fixture's
/// `makeStarted`. Debug lines of sessions are on.
class SessionTest : public CoreTest {
 protected:
  SessionTest() { makeVerbose("reporting_rtc_verbose"); }

  std::shared_ptr<OstrelReportingSession> makeSession(std::int64_t reporterID) {
    return OstrelReportingSession::initWithID(ReporterID{reporterID},
                                              /*processIdentifiers=*/{1234}, platform);
  }

  /// A session of that type, started; lines and events are forgotten.
  std::shared_ptr<OstrelReportingSession> makeStarted(std::uint16_t serviceType) {
    auto session = makeSession(42);
    session->setServiceType(ServiceType{serviceType});
    session->start();
    fakes.runUntilIdle();
    EXPECT_TRUE(session->started());
    forgetRecords();
    return session;
  }

  /// As `makeStarted`, with no telemetry session: no backends were found.
  std::shared_ptr<OstrelReportingSession> makeDetached(std::uint16_t serviceType) {
    fakes.telemetryBackend->setDiscovery(FakeDiscovery::none());
    auto session = makeSession(42);
    session->setServiceType(ServiceType{serviceType});
    session->start();
    fakes.advance(BackendWaitTimeout);
    EXPECT_TRUE(session->started());
    EXPECT_EQ(session->reportingSession(), nullptr);
    forgetRecords();
    return session;
  }

  void send(OstrelReportingSession& session, const Dictionary& message,
            std::uint32_t category, std::uint16_t type) {
    session.sendMessage(message, MessageCategory{category}, MessageType{type},
                        /*reply=*/nullptr);
    fakes.runUntilIdle();
  }

  void stop(OstrelReportingSession& session) {
    session.stop();
    fakes.runUntilIdle();
  }

  /// As the fixture's, without the questions about the device.
  std::vector<std::string> takeEvents() {
    std::vector<std::string> events = CoreTest::takeEvents();
    std::erase_if(events,
                  [](const std::string& event) { return event.starts_with("device."); });
    return events;
  }

  void forgetRecords() {
    fakes.log->clear();
    fakes.events->clear();
  }

  /// Runs `action` as a step of the session's queue.
  void onQueueOf(const OstrelReportingSession& session,
                 const std::function<void()>& action) {
    for (const auto& queue : fakes.workQueues->queues()) {
      if (queue == session.sessionReportingQueue()) queue->runAs(action);
    }
  }

  /// The descriptions of the session's list; "none" when it has no list.
  static std::vector<std::string> entriesOf(const OstrelReportingSession& session) {
    const auto list = session.aggregatedPayloadData();
    if (list == nullptr) return {"none"};
    std::vector<std::string> entries;
    list->lock()->snapshot().forEach(
        [&entries](ValueView entry) { entries.push_back(description(entry)); });
    return entries;
  }
};

}  // namespace ostrel
