#include "Statistics/Service/OstrelReportingSessionSummary.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <limits>
#include <random>
#include <utility>

#include "Statistics/Service/SessionTestFixture.h"

namespace ostrel {
namespace {

using Events = std::vector<std::string>;

constexpr std::uint16_t kTelephony = 2;
constexpr std::uint16_t kHaptics = 3;
constexpr std::uint16_t kLongFormAudio = 7;

const std::string kDirectory = "/logs/Audio/Reporting";
const std::string kFile = kDirectory + "/20260131-120000+0000-ostrel-App-haptics.json";
const ErrorObject kJSONError{"json", /*code=*/1, "no JSON"};
const ErrorObject kDirectoryError{"POSIX", /*code=*/13, "no directory"};
const ErrorObject kWriteError{"POSIX", /*code=*/28, "no space"};

class OstrelReportingSessionSummary : public SessionTest {
 protected:
  std::shared_ptr<OstrelReportingSession> makeWithEntry(std::uint16_t serviceType) {
    auto session = makeStarted(serviceType);
    session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "App"}});
    send(*session, {{"a", 1}}, 1, 0);
    forgetRecords();
    return session;
  }

  /// The lines of error level of one making of the summary.
  std::vector<std::string> errorsOfSummary(OstrelReportingSession& session) {
    fakes.log->clear();
    EXPECT_EQ(session.createSummaryEventForSession(), kSummaryOfEntry);
    for (const auto& line : fakes.log->lines()) EXPECT_EQ(line.scopeCode, "osrr");
    return fakes.log->texts(LogLevel::kError);
  }

  const Dictionary kSummaryOfEntry{{"Ostrel_Session_Summary_Event", "3"},
                                   {"Generic_Generic_1", "{a: 1}"}};
};

// The summary event.

TEST_F(OstrelReportingSessionSummary, IsNoneWhenNothingWasDelivered) {
  makeInternalBuild();
  const auto session = makeStarted(kHaptics);

  EXPECT_EQ(session->createSummaryEventForSession(), std::nullopt);

  EXPECT_EQ(entriesOf(*session), Events{});
  EXPECT_EQ(takeEvents(), Events{});
}

TEST_F(OstrelReportingSessionSummary, IsNoneWithoutAList) {
  makeInternalBuild();
  const auto session = makeWithEntry(kHaptics);
  session->setAggregatedPayloadData(nullptr);

  EXPECT_EQ(session->createSummaryEventForSession(), std::nullopt);

  EXPECT_TRUE(fakes.fileSystem->files().empty());
}

TEST_F(OstrelReportingSessionSummary, NamesTheServiceTypeByItsNumber) {
  const auto session = makeWithEntry(kHaptics);

  EXPECT_EQ(session->createSummaryEventForSession(), kSummaryOfEntry);
}

TEST_F(OstrelReportingSessionSummary, JoinsThePayloadsOfOneIdentifier) {
  OstrelReportingAggregatedPayloads list(*fakes.entryStorage, ReporterID{42});
  list.append("Generic_Generic_1", {{"a", 1}});
  list.append("Other_1", {{"b", "x"}});
  list.append("Generic_Generic_1", {{"a", 2}});
  list.append("Generic_Generic_1", Dictionary());

  EXPECT_EQ(summaryEvent(ServiceType{65535}, list.snapshot()),
            (Dictionary{{"Ostrel_Session_Summary_Event", "65535"},
                        {"Generic_Generic_1", "{a: 1},{a: 2},{}"},
                        {"Other_1", "{b: x}"}}));
}

// The same, made the plain way.
Dictionary plainSummary(const std::vector<Dictionary>& entries) {
  std::vector<std::pair<std::string, std::string>> groups;
  for (const Dictionary& entry : entries) {
    for (const auto& [key, value] : entry) {
      const std::string name(*key.string());
      const auto group =
          std::find_if(groups.begin(), groups.end(),
                       [&](const auto& known) { return known.first == name; });
      if (group == groups.end()) {
        groups.emplace_back(name, description(value));
      } else {
        group->second += ',' + description(value);
      }
    }
  }
  DictionaryBuilder summary;
  summary.set("Ostrel_Session_Summary_Event", "3");
  for (const auto& [key, text] : groups) summary.set(key, Value(text));
  return summary.build();
}

TEST_F(OstrelReportingSessionSummary, GroupsAnyEntriesInTheOrderOfTheirFirstKeys) {
  std::mt19937 random(3);
  for (const std::size_t keys : {1u, 31u, 32u, 33u, 1000u}) {
    OstrelReportingAggregatedPayloads list(*fakes.entryStorage, ReporterID{42});
    std::vector<Dictionary> entries;
    for (int i = 0; i < 400; ++i) {
      DictionaryBuilder entry;
      for (std::size_t values = random() % 3; values != 0; --values) {
        entry.set("k" + std::to_string(random() % keys),
                  std::string(random() % 300, static_cast<char>('a' + i % 26)));
      }
      entries.push_back(entry.build());
      list.append(entries.back());
    }
    const Dictionary summary = summaryEvent(ServiceType{3}, list.snapshot());
    const Dictionary expected = plainSummary(entries);
    ASSERT_TRUE(std::ranges::equal(summary.value().bytes(), expected.value().bytes()))
        << keys;
  }
}

TEST_F(OstrelReportingSessionSummary, IsADictionaryStillWhenTheListCannotBeRead) {
  OstrelReportingAggregatedPayloads list(*fakes.entryStorage, ReporterID{42});
  list.append("a", {{"x", 1}});
  fakes.entryStorage->setReadableRuns(0);
  EXPECT_EQ(summaryEvent(ServiceType{3}, list.snapshot()),
            (Dictionary{{"Ostrel_Session_Summary_Event", "3"}}));
}

TEST_F(OstrelReportingSessionSummary, HasBlanksForWhatCouldBeReadOnlyOnce) {
  OstrelReportingAggregatedPayloads list(*fakes.entryStorage, ReporterID{42});
  for (int i = 0; i < 4; ++i) list.append(i % 2 == 0 ? "a" : "b", {{"x", i}});
  fakes.entryStorage->setReadableRuns(3);  // Two of the first walk, one of the second.
  EXPECT_EQ(summaryEvent(ServiceType{3}, list.snapshot()),
            (Dictionary{{"Ostrel_Session_Summary_Event", "3"},
                        {"a", "{x: 0},{x: 2}"},
                        {"b", "{x: 1}       "}}));
}

// A list of two entries that gives its first when it is read first, and its second when
// it is read again.
class EntriesThatChange final : public StoredEntries {
 public:
  bool append(std::span<const Bytes> parts,
              const std::shared_ptr<PayloadAccount>& /*account*/) override {
    std::string& entry = entries_->emplace_back();
    for (const Bytes part : parts) entry.append(part.begin(), part.end());
    return true;
  }
  std::shared_ptr<const Snapshot> snapshot() override {
    return std::make_shared<Reading>(entries_);
  }

 private:
  using Entries = std::vector<std::string>;
  class Reading final : public Snapshot {
   public:
    explicit Reading(std::shared_ptr<const Entries> entries)
        : entries_(std::move(entries)) {}
    bool forEachRun(const RunCallback& callback) const override {
      const std::string& entry = entries_->at(readings_++);
      callback({reinterpret_cast<const std::uint8_t*>(entry.data()), entry.size()});
      return true;
    }

   private:
    const std::shared_ptr<const Entries> entries_;
    mutable std::size_t readings_ = 0;
  };

  const std::shared_ptr<Entries> entries_ = std::make_shared<Entries>();
};

class StorageThatChanges final : public EntryStorage {
 public:
  std::unique_ptr<StoredEntries> makeEntries(ReporterID /*session*/) override {
    return std::make_unique<EntriesThatChange>();
  }
};

Dictionary summaryOfAListThatReads(int first, int second) {
  StorageThatChanges storage;
  OstrelReportingAggregatedPayloads list(storage, ReporterID{42});
  list.append("a", {{"x", first}});
  list.append("a", {{"x", second}});
  return summaryEvent(ServiceType{3}, list.snapshot());
}

TEST_F(OstrelReportingSessionSummary, HasBlanksWhereAListReadsShorterTheSecondTime) {
  EXPECT_EQ(summaryOfAListThatReads(1000, 1),
            (Dictionary{{"Ostrel_Session_Summary_Event", "3"}, {"a", "{x: 1}   "}}));
}

TEST_F(OstrelReportingSessionSummary, HasNoMoreThanItsPlaceOfAListThatReadsLonger) {
  EXPECT_EQ(summaryOfAListThatReads(1, 1000),
            (Dictionary{{"Ostrel_Session_Summary_Event", "3"}, {"a", "{x: 10"}}));
}

TEST_F(OstrelReportingSessionSummary, GroupsEachKeyOfAnEntryOfSeveral) {
  OstrelReportingAggregatedPayloads list(*fakes.entryStorage, ReporterID{42});
  list.append({{"device_orientation", "normal"}, {"device_orientation_time", 1.5}});
  list.append({{"device_orientation", "left-up"}, {"device_orientation_time", 2.25}});

  EXPECT_EQ(summaryEvent(ServiceType{2}, list.snapshot()),
            (Dictionary{{"Ostrel_Session_Summary_Event", "2"},
                        {"device_orientation", "normal,left-up"},
                        {"device_orientation_time", "1.5,2.25"}}));
}

TEST_F(OstrelReportingSessionSummary, JoinsUnderItsOwnKeyToo) {
  OstrelReportingAggregatedPayloads list(*fakes.entryStorage, ReporterID{42});
  list.append("Ostrel_Session_Summary_Event", {{"a", 1}});

  EXPECT_EQ(summaryEvent(ServiceType{3}, list.snapshot()),
            (Dictionary{{"Ostrel_Session_Summary_Event", "3,{a: 1}"}}));
}

TEST_F(OstrelReportingSessionSummary, IsAsLongAsItsSessionWasBusy) {
  const auto session = makeStarted(kHaptics);
  constexpr int kMessages = 5000;
  for (int i = 0; i < kMessages; ++i) {
    session->sendMessage({{"i", i}}, MessageCategory{1}, MessageType{0},
                         /*reply=*/nullptr);
  }
  fakes.runUntilIdle();

  const auto summary = session->createSummaryEventForSession();

  ASSERT_TRUE(summary);
  EXPECT_EQ(summary->size(), kMessages + 1u);
  EXPECT_EQ(summary->get("Generic_Generic_5000"), Value("{i: 4999}"));
}

TEST_F(OstrelReportingSessionSummary, NeverContainsTheUserInfo) {
  const auto session = makeWithEntry(kHaptics);

  const auto summary = session->createSummaryEventForSession();

  ASSERT_TRUE(summary);
  EXPECT_FALSE(summary->contains("HostApplicationDisplayID"));
}

TEST_F(OstrelReportingSessionSummary, KeepsUserInfoInsertedAtEverySummary) {
  const auto session = makeWithEntry(kHaptics);  // No internal build.

  session->createSummaryEventForSession();
  EXPECT_EQ(entriesOf(*session),
            (Events{"{HostApplicationDisplayID: App}", "{Generic_Generic_1: {a: 1}}"}));
  const auto again = session->createSummaryEventForSession();

  EXPECT_EQ(entriesOf(*session),
            (Events{"{HostApplicationDisplayID: App}", "{HostApplicationDisplayID: App}",
                    "{Generic_Generic_1: {a: 1}}"}));
  ASSERT_TRUE(again);
  EXPECT_EQ(again->get("HostApplicationDisplayID"), Value("App"));
}

// The session log.

TEST_F(OstrelReportingSessionSummary, WritesNoLogUnlessTheBuildIsInternal) {
  const auto session = makeWithEntry(kHaptics);

  session->createSummaryEventForSession();

  EXPECT_EQ(takeEvents(), Events{});
  EXPECT_TRUE(fakes.fileSystem->files().empty());
}

TEST_F(OstrelReportingSessionSummary, WritesTheUserInfoAndEveryEntryOnInternalBuilds) {
  makeInternalBuild();
  const auto session = makeWithEntry(kHaptics);
  send(*session, {{"b c", 2}}, 0x40000007, 1);
  forgetRecords();

  session->createSummaryEventForSession();

  EXPECT_EQ(takeEvents(), (Events{"json.prettyPrintedArray",
                                  "files.createDirectory /logs/Audio/Reporting 0777",
                                  "files.write " + kFile}));
  EXPECT_EQ(fakes.fileSystem->file(kFile),
            "[\n{HostApplicationDisplayID: App}\n{Generic_Generic_1: {a: 1}}\n"
            "{Routing_RouteChange_Start_1: {b_c: 2}}\n]\n");
  EXPECT_EQ(takeLines(), LogLines{});
}

TEST_F(OstrelReportingSessionSummary, NamesTheLogAfterTimeApplicationAndService) {
  makeInternalBuild();
  fakes.clock->setZone(std::chrono::hours(1));
  fakes.clock->setWallClock(Date{ManualClock::kStart.secondsSince1970 + 61});
  const auto session = makeWithEntry(kLongFormAudio);

  session->createSummaryEventForSession();

  EXPECT_TRUE(fakes.fileSystem->file(
      kDirectory + "/20260131-130101+0100-ostrel-App-longformaudio.json"));
}

TEST_F(OstrelReportingSessionSummary, NamesAMissingApplicationNull) {
  makeInternalBuild();
  const auto session = makeStarted(kHaptics);
  send(*session, {{"a", 1}}, 1, 0);

  session->createSummaryEventForSession();

  EXPECT_TRUE(fakes.fileSystem->file(kDirectory +
                                     "/20260131-120000+0000-ostrel-(null)-haptics.json"));
}

TEST_F(OstrelReportingSessionSummary, NamesAnApplicationThatIsNoTextByItsDescription) {
  makeInternalBuild();
  const auto session = makeWithEntry(kHaptics);
  session->setConfiguration(Dictionary{{"HostApplicationDisplayID", 17}});

  session->createSummaryEventForSession();

  EXPECT_TRUE(fakes.fileSystem->file(kDirectory +
                                     "/20260131-120000+0000-ostrel-17-haptics.json"));
}

TEST_F(OstrelReportingSessionSummary, GoesOnWithoutJSON) {
  makeInternalBuild();
  const auto session = makeWithEntry(kHaptics);
  fakes.json->setResult(Outcome<TextSource>{std::nullopt, kJSONError});
  fakes.fileSystem->setWriteResult(Success{false, kWriteError});

  EXPECT_EQ(errorsOfSummary(*session),
            (Events{"dataWithJSONObject: no JSON", "jsonOutput writeToURL: no space"}));
  EXPECT_EQ(takeEvents(), (Events{"json.prettyPrintedArray",
                                  "files.createDirectory /logs/Audio/Reporting 0777",
                                  "files.write " + kFile}));
}

TEST_F(OstrelReportingSessionSummary, FailsOnWhatJSONCannotSay) {
  makeInternalBuild();
  const auto session = makeStarted(kHaptics);
  send(*session, {{"a", std::numeric_limits<double>::infinity()}}, 1, 0);
  forgetRecords();

  EXPECT_TRUE(session->createSummaryEventForSession());

  ASSERT_FALSE(fakes.log->texts(LogLevel::kError).empty());
  EXPECT_EQ(fakes.log->texts(LogLevel::kError)[0],
            "dataWithJSONObject: a number is not finite");
}

TEST_F(OstrelReportingSessionSummary, GoesOnWithoutADirectory) {
  makeInternalBuild();
  const auto session = makeWithEntry(kHaptics);
  fakes.fileSystem->setDirectoryResult(Success{false, kDirectoryError});
  fakes.fileSystem->setWriteResult(Success{false, kWriteError});

  EXPECT_EQ(errorsOfSummary(*session),
            (Events{"can't create logging directory at /logs/Audio/Reporting: no "
                    "directory",
                    "jsonOutput writeToURL: no space"}));
}

TEST_F(OstrelReportingSessionSummary, SaysNullForADirectoryFailureWithoutAnError) {
  makeInternalBuild();
  const auto session = makeWithEntry(kHaptics);
  fakes.fileSystem->setDirectoryResult(Success{false, std::nullopt});
  fakes.fileSystem->setWriteResult(Success{true, std::nullopt});

  EXPECT_EQ(errorsOfSummary(*session),
            Events{"can't create logging directory at /logs/Audio/Reporting: (null)"});
}

TEST_F(OstrelReportingSessionSummary, ShowsTheEarlierErrorForADirectoryWithoutOne) {
  makeInternalBuild();
  const auto session = makeWithEntry(kHaptics);
  fakes.json->setResult(Outcome<TextSource>{std::nullopt, kJSONError});
  fakes.fileSystem->setDirectoryResult(Success{false, std::nullopt});
  fakes.fileSystem->setWriteResult(Success{true, std::nullopt});

  EXPECT_EQ(errorsOfSummary(*session),
            (Events{"dataWithJSONObject: no JSON",
                    "can't create logging directory at /logs/Audio/Reporting: no JSON",
                    "jsonOutput writeToURL: no JSON"}));
}

TEST_F(OstrelReportingSessionSummary, LogsAFailedWrite) {
  makeInternalBuild();
  const auto session = makeWithEntry(kHaptics);
  fakes.fileSystem->setWriteResult(Success{false, kWriteError});

  EXPECT_EQ(errorsOfSummary(*session), Events{"jsonOutput writeToURL: no space"});
}

TEST_F(OstrelReportingSessionSummary, SaysNothingOfAFailedWriteWithoutAnError) {
  makeInternalBuild();
  const auto session = makeWithEntry(kHaptics);
  fakes.fileSystem->setWriteResult(Success{false, std::nullopt});

  EXPECT_EQ(errorsOfSummary(*session), Events{});
}

TEST_F(OstrelReportingSessionSummary, KeepsSecondLogOfAnEarlierErrorAsWriteError) {
  makeInternalBuild();
  const auto session = makeWithEntry(kHaptics);
  fakes.fileSystem->setDirectoryResult(Success{false, kDirectoryError});
  fakes.fileSystem->setWriteResult(Success{true, std::nullopt});

  EXPECT_EQ(errorsOfSummary(*session),
            (Events{"can't create logging directory at /logs/Audio/Reporting: no "
                    "directory",
                    "jsonOutput writeToURL: no directory"}));
}

TEST_F(OstrelReportingSessionSummary, ShowsTheErrorOfSerialisationForTheWriteToo) {
  makeInternalBuild();
  const auto session = makeWithEntry(kHaptics);
  fakes.json->setResult(Outcome<TextSource>{std::nullopt, kJSONError});
  fakes.fileSystem->setWriteResult(Success{true, std::nullopt});

  EXPECT_EQ(errorsOfSummary(*session),
            (Events{"dataWithJSONObject: no JSON", "jsonOutput writeToURL: no JSON"}));
}

TEST_F(OstrelReportingSessionSummary, IgnoresTheErrorOfACallThatSucceeded) {
  makeInternalBuild();
  const auto session = makeWithEntry(kHaptics);
  fakes.fileSystem->setDirectoryResult(Success{true, kDirectoryError});
  fakes.fileSystem->setWriteResult(Success{true, kWriteError});

  EXPECT_EQ(errorsOfSummary(*session), Events{});
}

TEST_F(OstrelReportingSessionSummary, IsWrittenByAStopBeforeTheSummaryIsSent) {
  makeInternalBuild();
  const auto session = makeWithEntry(kHaptics);

  stop(*session);

  EXPECT_EQ(takeEvents(), (Events{"trace 0x21042830", "json.prettyPrintedArray",
                                  "files.createDirectory /logs/Audio/Reporting 0777",
                                  "files.write " + kFile,
                                  "analytics com.orbisk.ostrel.Undefined.Unknown",
                                  "trace 0x21042838", "backend.sendMessage 1 65535 65535",
                                  "backend.flush 1", "backend.release 1"}));
}

// Whether orientation belongs into the record.

class OstrelReportingSessionShouldReportOrientation : public SessionTest {
 protected:
  std::shared_ptr<OstrelReportingSession> makeOfType(std::uint16_t serviceType) {
    auto session = makeSession(42);
    session->setServiceType(ServiceType{serviceType});
    fakes.runUntilIdle();
    session->setOrientationCallbackID("id");
    forgetRecords();
    return session;
  }
};

TEST_F(OstrelReportingSessionShouldReportOrientation, HoldsForTelephonyAndLongForm) {
  makeInternalBuild();

  EXPECT_TRUE(makeOfType(kTelephony)->shouldReportOrientation());
  EXPECT_TRUE(makeOfType(kLongFormAudio)->shouldReportOrientation());
}

TEST_F(OstrelReportingSessionShouldReportOrientation, HoldsForNoOtherType) {
  makeInternalBuild();

  for (std::uint16_t type = 0; type <= 12; ++type) {
    if (type == kTelephony || type == kLongFormAudio) continue;
    EXPECT_FALSE(makeOfType(type)->shouldReportOrientation()) << type;
  }
  EXPECT_FALSE(makeOfType(65535)->shouldReportOrientation());
}

TEST_F(OstrelReportingSessionShouldReportOrientation, NeedsACallbackIDFirst) {
  makeInternalBuild();
  const auto session = makeOfType(kTelephony);
  session->setOrientationCallbackID(std::nullopt);

  EXPECT_FALSE(session->shouldReportOrientation());

  EXPECT_EQ(fakes.events->all(), Events{});
}

TEST_F(OstrelReportingSessionShouldReportOrientation, NeedsAnInternalBuild) {
  const auto session = makeOfType(kTelephony);

  EXPECT_FALSE(session->shouldReportOrientation());

  EXPECT_EQ(fakes.events->all(), Events{"device.answer InternalBuild"});
}

TEST_F(OstrelReportingSessionShouldReportOrientation, NeedsADeviceOfAnotherClassThan6) {
  makeInternalBuild();
  const auto session = makeOfType(kTelephony);

  for (const std::int32_t deviceClass : {-1, 0, 5, 7}) {
    fakes.deviceInfo->setDeviceClass(deviceClass);
    EXPECT_TRUE(session->shouldReportOrientation()) << deviceClass;
  }
  fakes.deviceInfo->setDeviceClass(6);
  EXPECT_FALSE(session->shouldReportOrientation());
}

TEST_F(OstrelReportingSessionShouldReportOrientation, AsksForTheDeviceClassLast) {
  makeInternalBuild();
  const auto generic = makeOfType(0);

  EXPECT_FALSE(generic->shouldReportOrientation());

  EXPECT_EQ(fakes.events->count("device.class"), 0u);
}

}  // namespace
}  // namespace ostrel
