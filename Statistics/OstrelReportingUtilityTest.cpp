#include "Statistics/OstrelReportingUtility.h"

#include <gtest/gtest.h>

#include <atomic>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "Statistics/CoreTestFixture.h"

namespace ostrel {
namespace {

using OstrelReportingUtility = CoreTest;

std::string category(std::uint32_t code) { return CategoryName(MessageCategory{code}); }

TEST(ServiceTypeName, NamesEachCode) {
  const std::vector<std::string> names = {
      "generic",          "vocea",         "telephony",
      "haptics",          "alarms",        "standalone",
      "soundautoconfig",  "longformaudio", "nonlongformaudio",
      "audiodeviceusage", "alerts",        "test"};
  for (std::uint16_t code = 0; code < names.size(); ++code) {
    EXPECT_EQ(ServiceTypeName(ServiceType{code}), names[code]);
  }
  EXPECT_EQ(ServiceTypeName(ServiceType{65535}), "unknown");
}

TEST(ServiceTypeName, IsUnknownForCodesWithoutAName) {
  EXPECT_EQ(ServiceTypeName(ServiceType{12}), "unknown");
  EXPECT_EQ(ServiceTypeName(ServiceType{65534}), "unknown");
}

TEST(CategoryName, JoinsDomainAndKind) {
  EXPECT_EQ(category(0x40000007), "Routing_RouteChange");
  EXPECT_EQ(category(0x08000001), "Session_Generic");
  EXPECT_EQ(category(0x80000008), "Toolbox_Error");
  EXPECT_EQ(category(0x20000009), "HAL_Chanreporting");
  EXPECT_EQ(category(0x1000000A), "DSP_Performance");
  EXPECT_EQ(category(0x0800000B), "Session_Volume");
}

TEST(CategoryName, NamesEachKind) {
  const std::vector<std::string> names = {"Undefined",     "Generic",           "Record",
                                          "Playback",      "PlaybackAndRecord", "Setup",
                                          "ClientRequest", "RouteChange",       "Error",
                                          "Chanreporting", "Performance",       "Volume"};
  for (std::uint32_t kind = 0; kind < names.size(); ++kind) {
    EXPECT_EQ(category(kind), names[kind]);
  }
}

TEST(CategoryName, HasNoUnderscoreWithoutADomain) {
  EXPECT_EQ(category(0x00000003), "Playback");
  EXPECT_EQ(category(0x00000000), "Undefined");
  EXPECT_EQ(category(0x0000000C), "Undefined");
  EXPECT_EQ(category(0x0000FFFF), "Undefined");
}

TEST(CategoryName, IsUndefinedForAKindWithoutAName) {
  EXPECT_EQ(category(0x40000000), "Routing_Undefined");
  EXPECT_EQ(category(0x4000000C), "Routing_Undefined");
}

TEST(CategoryName, KeepsLeadingUnderscoreForUnnamedDomain) {
  EXPECT_EQ(category(0x00010000), "_Undefined");
  EXPECT_EQ(category(0x00010003), "_Playback");
  EXPECT_EQ(category(0x0003000C), "_Undefined");
  EXPECT_EQ(category(0xFFFF0001), "_Generic");
  EXPECT_EQ(category(0x48000007), "_RouteChange");  // Two named bits are no name.
}

TEST(CategoryName, KeepsAllOnesCategoryWithoutDomain) {
  EXPECT_EQ(category(0xFFFFFFFF), "Undefined");
  EXPECT_EQ(category(0xFFFFFFFE), "_Undefined");
}

TEST(CategoryName, AppendsToANameOfSeveralParts) {
  std::string name = "before.";

  appendCategoryName(name, MessageCategory{0x40000007});

  EXPECT_EQ(name, "before.Routing_RouteChange");
}

TEST(MessageTypeName, NamesEachCode) {
  const std::vector<std::string> names = {"Generic", "Start", "Stop",
                                          "Setup",   "Error", "IssueDetector"};
  for (std::uint16_t code = 0; code < names.size(); ++code) {
    EXPECT_EQ(MessageTypeName(MessageType{code}), names[code]);
  }
  EXPECT_EQ(MessageTypeName(MessageType{65535}), "Unknown");
}

TEST(MessageTypeName, IsUndefinedForCodesWithoutAName) {
  EXPECT_EQ(MessageTypeName(MessageType{6}), "Undefined");
  EXPECT_EQ(MessageTypeName(MessageType{65534}), "Undefined");
}

TEST(MessageNames, AreFewWhateverCodesThereAre) {
  constexpr std::size_t kDomains = 7;  // Without, of five names, and of none.
  constexpr std::size_t kKinds = 12;
  constexpr std::size_t kTypes = 8;
  constexpr std::uint32_t kSomeDomains[] = {0,          0x00010000, 0x08000000,
                                            0x10000000, 0x20000000, 0x40000000,
                                            0x80000000, 0xFFFF0000};
  std::set<std::string> serviceTypes;
  std::set<std::string> types;
  std::set<std::string> categories;
  std::set<const void*> names;
  for (std::uint32_t code = 0; code <= 0xFFFF; ++code) {
    serviceTypes.emplace(ServiceTypeName(static_cast<ServiceType>(code)));
    types.emplace(MessageTypeName(static_cast<MessageType>(code)));
    for (const std::uint32_t domain : kSomeDomains) {
      categories.insert(category(domain | code));
      names.insert(&messageNames(MessageCategory{domain | code},
                                 static_cast<MessageType>(code * 7)));
    }
  }
  EXPECT_EQ(serviceTypes.size(), 13u);
  EXPECT_EQ(types.size(), kTypes);
  EXPECT_EQ(categories.size(), kDomains * kKinds);
  EXPECT_LE(names.size(), kDomains * kKinds * kTypes);
}

TEST(HostApplicationID, IsUnknownWithoutAnApplication) {
  EXPECT_EQ(HostApplicationID(Dictionary()), Value("Unknown"));
  EXPECT_EQ(HostApplicationID({{"other", "x"}}), Value("Unknown"));
}

TEST(HostApplicationID, IsWhatIsStoredOfWhateverKind) {
  EXPECT_EQ(HostApplicationID({{"HostApplicationDisplayID", "ExampleApp"}}),
            Value("ExampleApp"));
  EXPECT_EQ(HostApplicationID({{"HostApplicationDisplayID", 7}}), Value(7));
  EXPECT_EQ(HostApplicationID({{"HostApplicationDisplayID", ""}}), Value(""));
}

TEST(HostApplicationID, OutlivesTheUserInfo) {
  std::optional<Dictionary> userInfo = Dictionary{{"HostApplicationDisplayID", "App"}};

  const Value id = HostApplicationID(*userInfo);
  userInfo.reset();

  EXPECT_EQ(id, Value("App"));
}

TEST_F(OstrelReportingUtility, IsNotInternalBuildWithoutAnAnswer) {
  EXPECT_FALSE(IsInternalBuild(platform));
}

TEST_F(OstrelReportingUtility, ReadsTheAnswerAsABoolean) {
  const std::vector<std::pair<Value, bool>> answers = {
      {true, true},       {false, false},       {1, true},    {0, false},
      {-1, true},         {0.5, true},          {0.0, false}, {"yes", false},
      {UINT64_MAX, true}, {Dictionary(), false}};
  for (const auto& [answer, isInternal] : answers) {
    forgetIsInternalBuildForTesting();
    fakes.deviceInfo->setAnswer("InternalBuild", answer);

    EXPECT_EQ(IsInternalBuild(platform), isInternal) << description(answer);
  }
}

TEST_F(OstrelReportingUtility, AsksForInternalBuildOnce) {
  makeInternalBuild();

  EXPECT_TRUE(IsInternalBuild(platform));
  fakes.deviceInfo->setAnswer("InternalBuild", false);
  EXPECT_TRUE(IsInternalBuild(platform));

  EXPECT_EQ(takeEvents(), std::vector<std::string>{"device.answer InternalBuild"});
}

TEST_F(OstrelReportingUtility, AsksForInternalBuildOnceFromManyThreads) {
  makeInternalBuild();
  std::atomic<int> internalCount{0};

  std::vector<std::thread> threads;
  for (int i = 0; i < 8; ++i) {
    threads.emplace_back([&] { internalCount += IsInternalBuild(platform) ? 1 : 0; });
  }
  for (std::thread& thread : threads) thread.join();

  EXPECT_EQ(internalCount, 8);
  EXPECT_EQ(fakes.events->count("device.answer InternalBuild"), 1u);
}

TEST(ThrottleExcludedKeys, AreFiveInTheirOrder) {
  const std::vector<std::string_view> keys(ThrottleExcludedKeys.begin(),
                                           ThrottleExcludedKeys.end());
  EXPECT_EQ(keys, (std::vector<std::string_view>{
                      "systemuptime_sec", "processuptime_ms", "ostrelreporting_timestamp",
                      "_comparison_field_blacklist", "_throttle_seconds"}));
}

TEST(BackendWaitTimeout, IsNineSeconds) {
  EXPECT_EQ(BackendWaitTimeout, std::chrono::seconds(9));
}

}  // namespace
}  // namespace ostrel
