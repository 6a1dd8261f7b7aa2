#include "Statistics/OstrelReportingWattlogUtility.h"

#include <gtest/gtest.h>

#include "Statistics/CoreTestFixture.h"

namespace ostrel {
namespace {

class OstrelReportingWattlogUtilityTest : public CoreTest {
 protected:
  void handle(const Dictionary& payload, const Dictionary& userInfo) {
    OstrelReportingWattlogUtility::handleEvent(
        platform, &payload, MessageCategory{0x40000007}, MessageType{1}, userInfo);
  }
};

TEST_F(OstrelReportingWattlogUtilityTest, LogsHowLongTheEngineRan) {
  handle({{"EngineOnTime", 1.5}, {"ostrelreporting_timestamp", 1000}, {"more", 1}},
         {{"HostApplicationDisplayID", "ExampleApp"}});

  const auto logged = fakes.wattlogSink->logged();
  ASSERT_EQ(logged.size(), 1u);
  EXPECT_EQ(logged[0].clientID, 28);
  EXPECT_EQ(logged[0].name, "Mediora_Haptics");
  EXPECT_EQ(logged[0].event, (Dictionary{{"EngineOnDuration", 1.5},
                                         {"ApplicationName", "ExampleApp"},
                                         {"TimestampEnd", 1000}}));
  EXPECT_EQ(logged[0].attachment, std::nullopt);
  EXPECT_EQ(takeLines(), LogLines{});
}

TEST_F(OstrelReportingWattlogUtilityTest, LogsAnEventWithoutTimestampAndSaysSo) {
  handle({{"EngineOnTime", 1.5}}, {{"HostApplicationDisplayID", "ExampleApp"}});

  ASSERT_EQ(fakes.wattlogSink->logged().size(), 1u);
  EXPECT_EQ(fakes.wattlogSink->logged()[0].event,
            (Dictionary{{"EngineOnDuration", 1.5}, {"ApplicationName", "ExampleApp"}}));
  EXPECT_EQ(
      takeLines(),
      LogLines{errorLine("osrp", "failed to get OstrelReporting timestamp for wattlog")});
}

TEST_F(OstrelReportingWattlogUtilityTest, NamesAnUnknownApplication) {
  handle({{"EngineOnTime", 2}, {"ostrelreporting_timestamp", 1}}, Dictionary());

  ASSERT_EQ(fakes.wattlogSink->logged().size(), 1u);
  EXPECT_EQ(
      fakes.wattlogSink->logged()[0].event,
      (Dictionary{
          {"EngineOnDuration", 2}, {"ApplicationName", "Unknown"}, {"TimestampEnd", 1}}));
}

TEST_F(OstrelReportingWattlogUtilityTest, PassesTheValuesOnAsTheyAre) {
  handle({{"EngineOnTime", "long"}, {"ostrelreporting_timestamp", Date{5}}},
         {{"HostApplicationDisplayID", 7}});

  ASSERT_EQ(fakes.wattlogSink->logged().size(), 1u);
  EXPECT_EQ(fakes.wattlogSink->logged()[0].event,
            (Dictionary{{"EngineOnDuration", "long"},
                        {"ApplicationName", 7},
                        {"TimestampEnd", Date{5}}}));
}

TEST_F(OstrelReportingWattlogUtilityTest, IgnoresEveryOtherMessageSilently) {
  handle({{"ostrelreporting_timestamp", 1000}, {"engineontime", 1}}, Dictionary());
  handle(Dictionary(), Dictionary());
  OstrelReportingWattlogUtility::handleEvent(
      platform, /*payload=*/nullptr, MessageCategory{1}, MessageType{0}, Dictionary());

  EXPECT_TRUE(fakes.wattlogSink->logged().empty());
  EXPECT_EQ(takeLines(), LogLines{});
}

TEST_F(OstrelReportingWattlogUtilityTest, DoesNotLookAtCategoryAndType) {
  const Dictionary payload{{"EngineOnTime", 1}, {"ostrelreporting_timestamp", 1}};

  OstrelReportingWattlogUtility::handleEvent(
      platform, &payload, MessageCategory{0xFFFFFFFF}, MessageType{0xFFFF}, Dictionary());

  EXPECT_EQ(fakes.wattlogSink->logged().size(), 1u);
}

}  // namespace
}  // namespace ostrel
