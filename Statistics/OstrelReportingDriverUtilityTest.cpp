#include "Statistics/OstrelReportingDriverUtility.h"

#include <gtest/gtest.h>

#include "Statistics/CoreTestFixture.h"

namespace ostrel {
namespace {

using Fault = FakeChannelReportingService::Fault;

class OstrelReportingDriverUtilityTest : public CoreTest {
 protected:
  OstrelReportingDriverUtilityTest() { makeVerbose("reporting_driver_verbose"); }

  std::shared_ptr<OstrelReportingDriverUtility> makeUtility() {
    auto utility = OstrelReportingDriverUtility::init(platform);
    takeLines();
    takeEvents();
    return utility;
  }

  void setSpeaker(FakeChannelReportingService::Counters counters) {
    fakes.channelReportingService->setCounters("Speaker", std::nullopt,
                                               std::move(counters));
  }
  void setQDL(FakeChannelReportingService::Counters counters) {
    fakes.channelReportingService->setCounters(std::nullopt, "QDL", std::move(counters));
  }
};

ErrorObject codedError(std::int64_t code) { return {"channels", code, "trouble"}; }

TEST_F(OstrelReportingDriverUtilityTest, SubscribesInTheOrderOfTheTable) {
  for (const auto& [group, subgroup] :
       {std::pair<FakeChannelReportingService::Name, FakeChannelReportingService::Name>{
            "OrbiskVX3QDL", std::nullopt},
        {"Speaker", std::nullopt},
        {std::nullopt, "QDL"},
        {"Haptics", "Stats"}}) {
    fakes.channelReportingService->setCounters(group, subgroup, {{"channel", 1}});
  }

  const auto utility = OstrelReportingDriverUtility::init(platform);

  EXPECT_EQ(takeEvents(),
            (std::vector<std::string>{"channels.copyChannelsInGroup OrbiskVX3QDL *",
                                      "channels.createSubscription OrbiskVX3QDL *",
                                      "channels.copyChannelsInGroup Speaker *",
                                      "channels.createSubscription Speaker *",
                                      "channels.copyChannelsInGroup * QDL",
                                      "channels.createSubscription * QDL",
                                      "channels.copyChannelsInGroup Haptics Stats",
                                      "channels.createSubscription Haptics Stats"}));
  ASSERT_EQ(utility->ioChannelSubscriptions().size(), 4u);
  EXPECT_EQ(utility->ioChannelSubscriptions()[2]->driver().description(), "(null)-QDL");
  EXPECT_EQ(
      takeLines(),
      (LogLines{infoLine("osrd", "creating chanreporting driver utility"),
                defaultLine("osrd", "subscribed to group group OrbiskVX3QDL-(null)"),
                defaultLine("osrd", "subscribed to group group Speaker-(null)"),
                defaultLine("osrd", "subscribed to group group (null)-QDL"),
                defaultLine("osrd", "subscribed to group group Haptics-Stats")}));
}

TEST_F(OstrelReportingDriverUtilityTest, IsEmptyWithoutDrivers) {
  const auto utility = OstrelReportingDriverUtility::init(platform);

  EXPECT_TRUE(utility->ioChannelSubscriptions().empty());
  EXPECT_EQ(takeLines(),
            LogLines{infoLine("osrd", "creating chanreporting driver utility")});
  EXPECT_TRUE(utility->getSnapShot()->empty());
  EXPECT_EQ(utility->getDriverStatisticsRelativeToSnapShot(nullptr), std::nullopt);
  EXPECT_EQ(takeLines(), LogLines{});
}

TEST_F(OstrelReportingDriverUtilityTest, SaysThatItSubscribedToAGroupWithoutChannels) {
  setSpeaker({});

  const auto utility = OstrelReportingDriverUtility::init(platform);

  EXPECT_TRUE(utility->ioChannelSubscriptions().empty());
  EXPECT_EQ(takeLines(),
            (LogLines{infoLine("osrd", "creating chanreporting driver utility"),
                      infoLine("osrd",
                               "couldn't find any channels for driver group "
                               "Speaker-(null)"),
                      defaultLine("osrd", "subscribed to group group Speaker-(null)")}));
}

TEST_F(OstrelReportingDriverUtilityTest, LogsALookupErrorAndGoesToTheNextDriver) {
  fakes.channelReportingService->setLookupFault("Speaker", std::nullopt,
                                                Fault{false, codedError(-42)});
  setQDL({{"channel", 1}});

  const auto utility = OstrelReportingDriverUtility::init(platform);

  ASSERT_EQ(utility->ioChannelSubscriptions().size(), 1u);
  EXPECT_EQ(
      takeLines(),
      (LogLines{infoLine("osrd", "creating chanreporting driver utility"),
                errorLine("osrd", "error -42 getting channels for driver Speaker-(null)"),
                defaultLine("osrd", "subscribed to group group (null)-QDL")}));
}

TEST_F(OstrelReportingDriverUtilityTest, SubscribesToChannelsThatCameWithAnError) {
  setSpeaker({{"channel", 1}});
  fakes.channelReportingService->setLookupFault("Speaker", std::nullopt,
                                                Fault{true, codedError(3)});

  const auto utility = OstrelReportingDriverUtility::init(platform);

  EXPECT_EQ(utility->ioChannelSubscriptions().size(), 1u);
  EXPECT_EQ(
      takeLines(),
      (LogLines{infoLine("osrd", "creating chanreporting driver utility"),
                errorLine("osrd", "error 3 getting channels for driver Speaker-(null)"),
                defaultLine("osrd", "subscribed to group group Speaker-(null)")}));
}

TEST_F(OstrelReportingDriverUtilityTest, NeverNoticesADriverThatComesLater) {
  const auto utility = makeUtility();

  setSpeaker({{"channel", 1}});

  EXPECT_TRUE(utility->getSnapShot()->empty());
}

TEST_F(OstrelReportingDriverUtilityTest, SnapsEachDriverUnderItsDescription) {
  setSpeaker({{"underruns", 2}});
  setQDL({{"overruns", 0}});
  const auto utility = makeUtility();

  const auto snapShot = utility->getSnapShot();

  EXPECT_EQ(*snapShot, (DriverSnapShot{{"Speaker-(null)", {{"underruns", 2}}},
                                       {"(null)-QDL", {{"overruns", 0}}}}));
  EXPECT_EQ(takeLines(), (LogLines{infoLine("osrd", "sampling driver"),
                                   infoLine("osrd", "sampling driver")}));
}

TEST_F(OstrelReportingDriverUtilityTest, LeavesADriverThatGaveAnErrorOutOfTheSnapShot) {
  setSpeaker({{"underruns", 2}});
  setQDL({{"overruns", 1}});
  const auto utility = makeUtility();
  // The samples that come with the error do not count either.
  fakes.channelReportingService->setSamplesFault("Speaker", std::nullopt,
                                                 Fault{true, codedError(5)});

  const auto snapShot = utility->getSnapShot();

  EXPECT_EQ(*snapShot, (DriverSnapShot{{"(null)-QDL", {{"overruns", 1}}}}));
  EXPECT_EQ(takeLines(), (LogLines{infoLine("osrd", "sampling driver"),
                                   errorLine("osrd", "ChanrepCreateSamples error 5"),
                                   infoLine("osrd", "sampling driver")}));
}

TEST_F(OstrelReportingDriverUtilityTest, PassesOverADriverWithNeitherSamplesNorError) {
  setSpeaker({{"underruns", 2}});
  const auto utility = makeUtility();
  fakes.channelReportingService->setSamplesFault("Speaker", std::nullopt,
                                                 Fault{false, std::nullopt});

  EXPECT_TRUE(utility->getSnapShot()->empty());
  EXPECT_EQ(utility->getDriverStatisticsRelativeToSnapShot(nullptr), std::nullopt);
  EXPECT_TRUE(fakes.log->texts(LogLevel::kError).empty());
}

TEST_F(OstrelReportingDriverUtilityTest, ReportsOnlyWhatRose) {
  setSpeaker({{"still", 7}, {"rose", 1}, {"fell", 9}});
  const auto utility = makeUtility();
  const auto snapShot = utility->getSnapShot();
  setSpeaker({{"still", 7}, {"rose", 6}, {"fell", 8}});
  takeLines();

  const auto statistics = utility->getDriverStatisticsRelativeToSnapShot(snapShot);

  EXPECT_EQ(statistics, (Dictionary{{"rose", 5}}));
  EXPECT_EQ(takeLines(), (LogLines{infoLine("osrd", "getting latest samples"),
                                   infoLine("osrd", "done getting latest samples")}));
}

TEST_F(OstrelReportingDriverUtilityTest, ReportsNothingWhenNothingRose) {
  setSpeaker({{"still", 7}});
  const auto utility = makeUtility();
  const auto snapShot = utility->getSnapShot();

  EXPECT_EQ(utility->getDriverStatisticsRelativeToSnapShot(snapShot), std::nullopt);
}

TEST_F(OstrelReportingDriverUtilityTest,
       ReportsAbsoluteCountersOfOneAndMoreToNoSnapShot) {
  setSpeaker({{"negative", -1}, {"zero", 0}, {"one", 1}, {"many", INT64_MAX}});
  const auto utility = makeUtility();

  const auto statistics = utility->getDriverStatisticsRelativeToSnapShot(nullptr);

  EXPECT_EQ(statistics, (Dictionary{{"one", 1}, {"many", INT64_MAX}}));
  EXPECT_EQ(fakes.events->count("channels.createSamplesDelta"), 0u);
}

TEST_F(OstrelReportingDriverUtilityTest,
       AsksForADeltaToNothingWhenTheSnapShotLacksADriver) {
  setSpeaker({{"underruns", 4}});
  const auto utility = makeUtility();

  const auto statistics = utility->getDriverStatisticsRelativeToSnapShot(
      std::make_shared<const DriverSnapShot>());

  EXPECT_EQ(statistics, (Dictionary{{"underruns", 4}}));
  EXPECT_EQ(takeEvents(), (std::vector<std::string>{"channels.createSamples Speaker *",
                                                    "channels.createSamplesDelta",
                                                    "channels.iterate"}));
}

TEST_F(OstrelReportingDriverUtilityTest, LaterDriverWinsAChannelNameOfTwo) {
  setSpeaker({{"shared", 3}});
  setQDL({{"shared", 8}});
  const auto utility = makeUtility();

  EXPECT_EQ(utility->getDriverStatisticsRelativeToSnapShot(nullptr),
            (Dictionary{{"shared", 8}}));
}

TEST_F(OstrelReportingDriverUtilityTest, LogsASamplingErrorAfterTheSamplingIsDone) {
  setSpeaker({{"underruns", 4}});
  setQDL({{"overruns", 2}});
  const auto utility = makeUtility();
  fakes.channelReportingService->setSamplesFault("Speaker", std::nullopt,
                                                 Fault{true, codedError(77)});

  const auto statistics = utility->getDriverStatisticsRelativeToSnapShot(nullptr);

  EXPECT_EQ(statistics, (Dictionary{{"overruns", 2}}));
  EXPECT_EQ(takeLines(), (LogLines{infoLine("osrd", "getting latest samples"),
                                   infoLine("osrd", "done getting latest samples"),
                                   errorLine("osrd", "ChanrepCreateSamples error 77"),
                                   infoLine("osrd", "getting latest samples"),
                                   infoLine("osrd", "done getting latest samples")}));
}

TEST_F(OstrelReportingDriverUtilityTest, KeepsAbsoluteCountersWhenDeltaFails) {
  setSpeaker({{"underruns", 4}});
  const auto utility = makeUtility();
  const auto snapShot = utility->getSnapShot();
  setSpeaker({{"underruns", 6}});
  takeLines();
  // The delta that comes with the error does not count.
  fakes.channelReportingService->setDeltaFault(Fault{true, codedError(9)});

  const auto statistics = utility->getDriverStatisticsRelativeToSnapShot(snapShot);

  EXPECT_EQ(statistics, (Dictionary{{"underruns", 6}}));
  EXPECT_EQ(takeLines(),
            (LogLines{infoLine("osrd", "getting latest samples"),
                      infoLine("osrd", "done getting latest samples"),
                      errorLine("osrd", "ChanrepCreateSamplesDelta error 9")}));
}

TEST_F(OstrelReportingDriverUtilityTest, PassesOverADriverWithNeitherDeltaNorError) {
  setSpeaker({{"underruns", 4}});
  const auto utility = makeUtility();
  fakes.channelReportingService->setDeltaFault(Fault{false, std::nullopt});

  EXPECT_EQ(utility->getDriverStatisticsRelativeToSnapShot(
                std::make_shared<const DriverSnapShot>()),
            std::nullopt);
  EXPECT_EQ(fakes.events->count("channels.iterate"), 0u);
}

TEST_F(OstrelReportingDriverUtilityTest, KeepsMisspeltLogTexts) {
  setSpeaker({{"underruns", 4}});

  OstrelReportingDriverUtility::init(platform);

  EXPECT_EQ(fakes.log->count("subscribed to group group Speaker-(null)"), 1u);
}

TEST(OstrelReportingDriver, DescribesAMissingNameAsNull) {
  EXPECT_EQ(OstrelReportingDriver::driverWithGroupName("A", "B").description(), "A-B");
  EXPECT_EQ(OstrelReportingDriver::driverWithGroupName("A", std::nullopt).description(),
            "A-(null)");
  EXPECT_EQ(OstrelReportingDriver::driverWithGroupName(std::nullopt, "B").description(),
            "(null)-B");
}

TEST(OstrelReportingIOChannelSubscription, BeginsUnsubscribed) {
  const auto subscription = OstrelReportingIOChannelSubscription::initWithDriver(
      OstrelReportingDriver::driverWithGroupName("A", "B"));

  EXPECT_EQ(subscription->driver().description(), "A-B");
  EXPECT_EQ(subscription->subscription(), nullptr);
  EXPECT_EQ(subscription->subscribedChannels(), std::nullopt);
}

}  // namespace
}  // namespace ostrel
