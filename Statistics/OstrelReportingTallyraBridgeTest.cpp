#include "Statistics/OstrelReportingTallyraBridge.h"

#include <gtest/gtest.h>

#include "Statistics/CoreTestFixture.h"

namespace ostrel {
namespace {

class OstrelReportingTallyraBridgeTest : public CoreTest {
 protected:
  void handle(const Dictionary* payload, std::uint32_t category, std::uint16_t type,
              const Dictionary& userInfo) {
    OstrelReportingTallyraBridge::handleEvent(
        platform, payload, MessageCategory{category}, MessageType{type}, userInfo);
  }
};

TEST_F(OstrelReportingTallyraBridgeTest, NamesTheEventAfterCategoryAndType) {
  const Dictionary payload;

  handle(&payload, 0x40000007, 1, Dictionary());
  handle(&payload, 0x00000000, 7, Dictionary());
  handle(&payload, 0xFFFFFFFF, 0xFFFF, Dictionary());
  handle(&payload, 0x08000004, 5, Dictionary());

  EXPECT_EQ(
      fakes.analyticsSink->names(),
      (std::vector<std::string>{
          "com.orbisk.ostrel.Routing_RouteChange.Start",
          "com.orbisk.ostrel.Undefined.Undefined", "com.orbisk.ostrel.Undefined.Unknown",
          "com.orbisk.ostrel.Session_PlaybackAndRecord.IssueDetector"}));
}

TEST_F(OstrelReportingTallyraBridgeTest, AddsTheHostApplicationToThePayload) {
  const Dictionary payload{{"a key", 1}};

  handle(&payload, 1, 0, {{"HostApplicationDisplayID", "ExampleApp"}});

  EXPECT_EQ(fakes.analyticsSink->payload(0),
            (Dictionary{{"a key", 1}, {"HostApplicationDisplayID", "ExampleApp"}}));
}

TEST_F(OstrelReportingTallyraBridgeTest, SaysUnknownWithoutAHostApplication) {
  const Dictionary payload;

  handle(&payload, 1, 0, Dictionary());

  EXPECT_EQ(fakes.analyticsSink->payload(0),
            (Dictionary{{"HostApplicationDisplayID", "Unknown"}}));
}

TEST_F(OstrelReportingTallyraBridgeTest, ReplacesAHostApplicationOfTheClients) {
  const Dictionary payload{{"HostApplicationDisplayID", "Forged"}};

  handle(&payload, 1, 0, {{"HostApplicationDisplayID", "ExampleApp"}});

  EXPECT_EQ(fakes.analyticsSink->payload(0),
            (Dictionary{{"HostApplicationDisplayID", "ExampleApp"}}));
}

TEST_F(OstrelReportingTallyraBridgeTest, NeverChangesTheCallersPayload) {
  const Dictionary payload{{"HostApplicationDisplayID", "Forged"}, {"a", 1}};

  handle(&payload, 1, 0, {{"HostApplicationDisplayID", "ExampleApp"}});
  fakes.analyticsSink->payload(0);

  EXPECT_EQ(payload, (Dictionary{{"HostApplicationDisplayID", "Forged"}, {"a", 1}}));
}

TEST_F(OstrelReportingTallyraBridgeTest, SendsAnAbsentPayloadAsAnEmptyOne) {
  handle(/*payload=*/nullptr, 1, 0, Dictionary());

  EXPECT_EQ(fakes.analyticsSink->payload(0),
            (Dictionary{{"HostApplicationDisplayID", "Unknown"}}));
}

TEST_F(OstrelReportingTallyraBridgeTest, ProviderOutlivesWhatItWasMadeFrom) {
  std::optional<Dictionary> payload = Dictionary{{"a", 1}};
  std::optional<Dictionary> userInfo = Dictionary{{"HostApplicationDisplayID", "App"}};
  handle(&*payload, 1, 0, *userInfo);
  payload.reset();
  userInfo.reset();

  EXPECT_EQ(fakes.analyticsSink->payload(0),
            (Dictionary{{"a", 1}, {"HostApplicationDisplayID", "App"}}));
}

}  // namespace
}  // namespace ostrel
