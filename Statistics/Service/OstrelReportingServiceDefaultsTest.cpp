#include <gtest/gtest.h>

#include "Statistics/Service/ServiceTestFixture.h"

namespace ostrel {
namespace {

using Events = std::vector<std::string>;

constexpr const char* kSuite = "com.orbisk.ostrel";

class OstrelReportingServiceDefaults : public ServiceTest {
 protected:
  Dictionary defaultsOf(const Dictionary& values) {
    fakes.userDefaults->setSuite(kSuite, values);
    return root->OstrelReportingDefaults();
  }
};

// Reading.

TEST_F(OstrelReportingServiceDefaults, OfAMissingSuiteSwitchReportingOn) {
  EXPECT_EQ(root->OstrelReportingDefaults(), (Dictionary{{"disable_reporting", 0}}));
}

TEST_F(OstrelReportingServiceDefaults, OfMissingKeysSwitchReportingOn) {
  EXPECT_EQ(defaultsOf({{"other", 1}}), (Dictionary{{"disable_reporting", 0}}));
}

TEST_F(OstrelReportingServiceDefaults, HoldTheDeviceNameAsText) {
  EXPECT_EQ(defaultsOf({{"device_name", "Kitchen"}}),
            (Dictionary{{"device_name", "Kitchen"}, {"disable_reporting", 0}}));
  EXPECT_EQ(defaultsOf({{"device_name", 7}}),
            (Dictionary{{"device_name", "7"}, {"disable_reporting", 0}}));
}

TEST_F(OstrelReportingServiceDefaults, HoldNoDeviceNameThatIsNoText) {
  EXPECT_EQ(defaultsOf({{"device_name", Dictionary()}}),
            (Dictionary{{"disable_reporting", 0}}));
}

TEST_F(OstrelReportingServiceDefaults, ReadTheSwitchAsABoolean) {
  const std::vector<std::pair<Value, bool>> switches = {
      {true, true}, {false, false}, {1, true},       {0, false},
      {-3, true},   {"YES", true},  {"true", true},  {"no", false},
      {"5", true},  {"0", false},   {Array(), false}};
  for (const auto& [stored, isDisabled] : switches) {
    const auto read =
        defaultsOf({{"disable_reporting", stored}}).get("disable_reporting");

    ASSERT_TRUE(read);
    EXPECT_EQ(read->view().number(), isDisabled ? 1 : 0) << description(stored);
  }
}

TEST_F(OstrelReportingServiceDefaults, OpenTheStoreAnewForEachReading) {
  root->OstrelReportingDefaults();
  root->OstrelReportingDefaults();

  EXPECT_EQ(takeEvents(), (Events{"defaults.openSuite com.orbisk.ostrel",
                                  "defaults.openSuite com.orbisk.ostrel"}));
}

// Registration.

TEST_F(OstrelReportingServiceDefaults, AreListenedForOnce) {
  EXPECT_EQ(fakes.notifications->registrationCount(), 1u);
}

TEST_F(OstrelReportingServiceDefaults, RegistrationThatFailsIsOnlyLogged) {
  fakes.notifications->failRegistrations(9);

  const auto other = OstrelReportingServiceDelegate::init(platform);

  EXPECT_TRUE(fakes.log->contains(LogLevel::kDefault, "osrs", "notify setup result 9"));
  EXPECT_TRUE(other->reportingEnabled());
  EXPECT_EQ(other->defaults(), std::nullopt);
}

// Changes.

TEST_F(OstrelReportingServiceDefaults, AreReadWhenTheNotificationIsPosted) {
  fakes.userDefaults->setSuite(kSuite, {{"device_name", "Kitchen"}});

  postDefaultsChange();

  EXPECT_EQ(root->defaults(),
            (Dictionary{{"device_name", "Kitchen"}, {"disable_reporting", 0}}));
  EXPECT_EQ(
      takeLines(),
      (LogLines{
          defaultLine("osrs", "re-reading ostrel defaults"),
          infoLine("osrs", "defaults {device_name: Kitchen, disable_reporting: 0}")}));
}

TEST_F(OstrelReportingServiceDefaults, AreReadOnTheServerQueue) {
  fakes.notifications->post("com.orbisk.ostrel.reporting");

  EXPECT_EQ(root->defaults(), std::nullopt);
  fakes.runUntilIdle();

  EXPECT_NE(root->defaults(), std::nullopt);
}

TEST_F(OstrelReportingServiceDefaults, IgnoreAForeignToken) {
  fakes.notifications->postWithToken("com.orbisk.ostrel.reporting", /*token=*/999);
  fakes.runUntilIdle();

  EXPECT_EQ(root->defaults(), std::nullopt);
  EXPECT_EQ(takeLines(), LogLines{});
  EXPECT_EQ(takeEvents(), Events{});
}

TEST_F(OstrelReportingServiceDefaults, ReplaceTheEarlierOnes) {
  fakes.userDefaults->setSuite(kSuite, {{"device_name", "Kitchen"}});
  postDefaultsChange();

  fakes.userDefaults->removeSuite(kSuite);
  postDefaultsChange();

  EXPECT_EQ(root->defaults(), (Dictionary{{"disable_reporting", 0}}));
}

TEST_F(OstrelReportingServiceDefaults, SwitchReportingOffAndOn) {
  fakes.userDefaults->setSuite(kSuite, {{"disable_reporting", true}});
  postDefaultsChange();
  EXPECT_FALSE(root->reportingEnabled());

  fakes.userDefaults->setSuite(kSuite, {{"disable_reporting", false}});
  postDefaultsChange();

  EXPECT_TRUE(root->reportingEnabled());
}

TEST_F(OstrelReportingServiceDefaults, ReachEverySessionOfEveryClientStartedOrNot) {
  const auto first = connect(1);
  const auto second = connect(2);
  const auto idle = create(*first, 7);
  const auto started = createStarted(*second, 8);
  fakes.userDefaults->setSuite(kSuite, {{"device_name", "Kitchen"}});

  postDefaultsChange();

  const Dictionary expected{{"device_name", "Kitchen"}, {"disable_reporting", 0}};
  EXPECT_EQ(idle->userInfo(), expected);
  EXPECT_EQ(started->userInfo(), expected);
}

TEST_F(OstrelReportingServiceDefaults, ReachSessionsWhileReportingIsOff) {
  const auto client = connect(1);
  const auto session = create(*client, 7);
  switchReporting(/*on=*/false);
  fakes.userDefaults->setSuite(kSuite,
                               {{"disable_reporting", true}, {"device_name", "Kitchen"}});

  postDefaultsChange();

  EXPECT_EQ(session->userInfo().get("device_name"), Value("Kitchen"));
}

TEST_F(OstrelReportingServiceDefaults, DoNotReachASessionMadeLater) {
  fakes.userDefaults->setSuite(kSuite, {{"device_name", "Kitchen"}});
  postDefaultsChange();
  const auto client = connect(1);

  const auto session = create(*client, 7);
  EXPECT_EQ(session->userInfo(), Dictionary());
  postDefaultsChange();

  EXPECT_EQ(session->userInfo().get("device_name"), Value("Kitchen"));
}

TEST_F(OstrelReportingServiceDefaults, KeepsDefaultsMergeNeverRemoving) {
  const auto client = connect(1);
  const auto session = create(*client, 7);
  fakes.userDefaults->setSuite(kSuite, {{"device_name", "Kitchen"}});
  postDefaultsChange();

  fakes.userDefaults->removeSuite(kSuite);
  postDefaultsChange();

  EXPECT_EQ(session->userInfo().get("device_name"), Value("Kitchen"));
  EXPECT_FALSE(root->defaults()->contains("device_name"));
}

TEST_F(OstrelReportingServiceDefaults, AreMergedAfterWhatTheSessionHasQueued) {
  const auto client = connect(1);
  const auto session = create(*client, 7);
  fakes.telemetryBackend->setDiscovery(FakeDiscovery::held());
  client->startReportingSessionForID(ReporterID{7}, /*reply=*/nullptr);
  fakes.runUntilIdle();

  postDefaultsChange();
  EXPECT_EQ(session->userInfo(), Dictionary());
  fakes.telemetryBackend->session(1)->answerDiscovery(Array());
  fakes.runUntilIdle();

  EXPECT_TRUE(session->userInfo().contains("disable_reporting"));
}

}  // namespace
}  // namespace ostrel
