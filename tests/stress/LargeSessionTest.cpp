// The end of a session that kept very many messages, a million in an optimised build, on
// the real queues and with a real session log, beside a session that goes on.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>
#include <string>

#include "Statistics/OstrelReportingUtility.h"
#include "Statistics/Service/OstrelReportingSession.h"
#include "platform/fake/FakePlatform.h"
#include "platform/linux/DirectoryFileSystem.h"
#include "platform/linux/JSONTextSerialization.h"
#include "platform/linux/RealQueues.h"
#include "platform/linux/TestSupport.h"
#include "platform/linux/ThreadPoolWorkQueues.h"

namespace ostrel {
namespace {

using std::chrono::steady_clock;

// Fewer where the compiler was told not to be fast.
#if defined(OSTREL_SANITIZED) || !defined(__OPTIMIZE__)
constexpr int kMessages = 50'000;
#else
constexpr int kMessages = 1'000'000;
#endif

class LargeSession : public testing::Test {
 protected:
  LargeSession() {
    forgetIsInternalBuildForTesting();
    fakes.deviceInfo->setAnswer("InternalBuild", Value(true));
    platform = fakes.platform();
    queues = testing_support::putOnRealQueues(platform);
    platform.fileSystem = std::make_shared<DirectoryFileSystem>(directory.path());
    platform.json = std::make_shared<JSONTextSerialization>();
  }
  ~LargeSession() override {
    queues->drain(steady_clock::now() + std::chrono::seconds(60));
    forgetIsInternalBuildForTesting();
  }

  std::shared_ptr<OstrelReportingSession> startedSession(int id) {
    auto session = OstrelReportingSession::initWithID(
        ReporterID{id}, /*processIdentifiers=*/{1}, platform);
    session->start();
    deliver(*session);
    return session;
  }

  /// How long a message takes from here through the session.
  std::chrono::nanoseconds deliver(OstrelReportingSession& session) {
    std::promise<void> delivered;
    const auto begin = steady_clock::now();
    session.sendMessage(
        Dictionary{{"a", 1}}, MessageCategory{1}, MessageType{1},
        [&](const std::optional<ErrorObject>&) { delivered.set_value(); });
    delivered.get_future().wait();
    return steady_clock::now() - begin;
  }

  testing_support::TemporaryDirectory directory;
  FakePlatform fakes;
  std::shared_ptr<ThreadPoolWorkQueues> queues;
  OstrelReportingPlatform platform;
};

TEST_F(LargeSession, EndsWithItsWholeRecordAndStallsNoOtherSession) {
  const auto large = startedSession(1);
  const auto other = startedSession(2);
  const Dictionary payload{{"text", "a message of the usual kind"}, {"n", 12345}};
  for (int i = 0; i < kMessages; ++i) {
    large->aggregatedPayloadData()->lock()->append("Session_Generic_" + std::to_string(i),
                                                   payload);
  }

  std::promise<void> stopped;
  large->setTransactionCompleteBlock([&](bool) { stopped.set_value(); });
  large->stop();
  auto end = stopped.get_future();
  std::chrono::nanoseconds longest{0};
  int deliveries = 0;
  while (end.wait_for(std::chrono::milliseconds(5)) == std::future_status::timeout) {
    longest = std::max(longest, deliver(*other));
    ++deliveries;
  }

  EXPECT_GT(deliveries, 5);
  EXPECT_LT(longest, std::chrono::seconds(1));
  const auto messages = fakes.telemetryBackend->session(1)->messages();
  ASSERT_EQ(messages.size(), 2u);
  EXPECT_EQ(messages.back().payload.size(), kMessages + 2u);
  std::size_t entries = 0;
  for (const auto& file :
       std::filesystem::directory_iterator(directory / "Audio/Reporting")) {
    std::ifstream text(file.path());
    for (std::string line; std::getline(text, line);) {
      if (line.find("\"Session_Generic_") != std::string::npos) ++entries;
    }
  }
  EXPECT_EQ(entries, static_cast<std::size_t>(kMessages));
  other->stop();
}

}  // namespace
}  // namespace ostrel
