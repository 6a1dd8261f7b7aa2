#include "Statistics/Service/OstrelReportingAggregatedPayloads.h"

#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "Statistics/CoreTestFixture.h"
#include "platform/KeptBytes.h"
#include "platform/fake/CountingAccount.h"

namespace ostrel {
namespace {

std::vector<std::string> entriesOf(
    const OstrelReportingAggregatedPayloads::Snapshot& snapshot) {
  std::vector<std::string> entries;
  snapshot.forEach([&](ValueView entry) { entries.push_back(description(entry)); });
  return entries;
}

class OstrelReportingAggregatedPayloadsTest : public CoreTest {
 protected:
  EntryStorage& storage_ = *fakes.entryStorage;
};

TEST_F(OstrelReportingAggregatedPayloadsTest, BeginsEmpty) {
  const OstrelReportingAggregatedPayloads list(storage_, ReporterID{42});

  EXPECT_TRUE(list.empty());
  EXPECT_EQ(list.size(), 0u);
  EXPECT_EQ(entriesOf(list.snapshot()), std::vector<std::string>{});
}

TEST_F(OstrelReportingAggregatedPayloadsTest, HoldsEntriesInOrder) {
  OstrelReportingAggregatedPayloads list(storage_, ReporterID{42});

  list.append("first", {{"a", 1}});
  list.append({{"b", 2}, {"c", 3}});
  list.append("", Dictionary());

  EXPECT_EQ(list.size(), 3u);
  EXPECT_EQ(entriesOf(list.snapshot()),
            (std::vector<std::string>{"{first: {a: 1}}", "{b: 2, c: 3}", "{: {}}"}));
}

TEST_F(OstrelReportingAggregatedPayloadsTest, OutlivesWhatWasAppended) {
  OstrelReportingAggregatedPayloads list(storage_, ReporterID{42});
  {
    const Dictionary payload{{"a", std::string(100, 'x')}};
    list.append(std::string("first"), payload);
  }

  EXPECT_EQ(entriesOf(list.snapshot()),
            std::vector<std::string>{"{first: {a: " + std::string(100, 'x') + "}}"});
}

TEST_F(OstrelReportingAggregatedPayloadsTest, HoldsEntriesOfEverySize) {
  OstrelReportingAggregatedPayloads list(storage_, ReporterID{42});
  std::vector<std::string> expected;
  for (const std::size_t size :
       {0u, 1u, 1000u, 1023u, 1024u, 1025u, 262143u, 262144u, 262145u, 600000u, 3u}) {
    const std::string text(size, 'x');
    list.append("k", {{"t", text}});
    expected.push_back("{k: {t: " + text + "}}");
  }

  EXPECT_EQ(entriesOf(list.snapshot()), expected);
}

TEST_F(OstrelReportingAggregatedPayloadsTest, SnapshotDoesNotShowWhatComesLater) {
  OstrelReportingAggregatedPayloads list(storage_, ReporterID{42});
  list.append("a", Dictionary());

  const auto snapshot = list.snapshot();
  list.append("b", Dictionary());
  list.insertFront(std::make_shared<MutableDictionary>());

  EXPECT_EQ(entriesOf(snapshot), std::vector<std::string>{"{a: {}}"});
}

TEST_F(OstrelReportingAggregatedPayloadsTest, SnapshotOutlivesTheList) {
  auto list =
      std::make_unique<OstrelReportingAggregatedPayloads>(storage_, ReporterID{42});
  list->append("a", {{"x", 1}});
  const auto snapshot = list->snapshot();

  list.reset();

  EXPECT_EQ(entriesOf(snapshot), std::vector<std::string>{"{a: {x: 1}}"});
}

TEST_F(OstrelReportingAggregatedPayloadsTest, SnapshotIsReadWhileEntriesAreAppended) {
  OstrelReportingAggregatedPayloads list(storage_, ReporterID{42});
  for (int i = 0; i < 100; ++i) list.append("a", {{"i", i}});
  const auto snapshot = list.snapshot();

  std::size_t seen = 0;
  std::thread reader([&] {
    for (int i = 0; i < 50; ++i) snapshot.forEach([&](ValueView) { ++seen; });
  });
  for (int i = 0; i < 5000; ++i) list.append("b", {{"i", i}});
  reader.join();

  EXPECT_EQ(seen, 5000u);
}

TEST_F(OstrelReportingAggregatedPayloadsTest, PutsWhatIsInsertedLastFirst) {
  OstrelReportingAggregatedPayloads list(storage_, ReporterID{42});
  list.append("a", Dictionary());
  const auto first = std::make_shared<MutableDictionary>();
  first->merge({{"first", 1}});
  const auto second = std::make_shared<MutableDictionary>();
  second->merge({{"second", 2}});

  list.insertFront(first);
  list.insertFront(second);

  EXPECT_EQ(list.size(), 3u);
  EXPECT_EQ(entriesOf(list.snapshot()),
            (std::vector<std::string>{"{second: 2}", "{first: 1}", "{a: {}}"}));
}

TEST_F(OstrelReportingAggregatedPayloadsTest, ShowsWhatIsMergedLaterInLaterSnapshots) {
  OstrelReportingAggregatedPayloads list(storage_, ReporterID{42});
  const auto userInfo = std::make_shared<MutableDictionary>();
  list.insertFront(userInfo);
  const auto before = list.snapshot();

  userInfo->merge({{"a", 1}});

  EXPECT_EQ(entriesOf(before), std::vector<std::string>{"{}"});
  EXPECT_EQ(entriesOf(list.snapshot()), std::vector<std::string>{"{a: 1}"});
}

TEST_F(OstrelReportingAggregatedPayloadsTest, LeavesOutWhatTheStorageRefuses) {
  OstrelReportingAggregatedPayloads list(storage_, ReporterID{42});
  list.append("a", {{"x", 1}});
  fakes.entryStorage->setMostBytesOfList(14);

  list.append("b", {{"text", "too long"}});
  list.append("c", {{"x", 2}});

  EXPECT_EQ(list.size(), 2u);
  EXPECT_EQ(entriesOf(list.snapshot()),
            (std::vector<std::string>{"{a: {x: 1}}", "{c: {x: 2}}"}));
}

TEST_F(OstrelReportingAggregatedPayloadsTest, SaysWhenItCouldNotReadAll) {
  OstrelReportingAggregatedPayloads list(storage_, ReporterID{42});
  list.append("a", Dictionary());
  list.insertFront(std::make_shared<MutableDictionary>());
  EXPECT_TRUE(list.snapshot().forEach([](ValueView) {}));

  fakes.entryStorage->setReadableRuns(0);

  EXPECT_FALSE(list.snapshot().forEach([](ValueView) {}));
  EXPECT_EQ(entriesOf(list.snapshot()), std::vector<std::string>{"{}"});
}

// A dictionary of that size, encoded.
Dictionary payloadOf(std::size_t bytes) {
  const std::size_t heads = bytes <= 65535 + 9 ? 9 : 11;
  return {{"text", std::string(bytes - heads, 'x')}};
}

TEST_F(OstrelReportingAggregatedPayloadsTest, RefersToALargePayloadOfTheService) {
  OstrelReportingAggregatedPayloads list(storage_, ReporterID{42});
  fakes.entryStorage->setMostBytesOfList(64);
  std::vector<std::string> expected;
  for (const std::size_t size : {65535u, 65536u, 65537u}) {
    const Dictionary payload = payloadOf(size);
    ASSERT_EQ(payload.owner().size(), size);
    list.append("small", Dictionary());
    list.append("large", payload);
    expected.emplace_back("{small: {}}");
    if (size >= 65536) expected.push_back("{large: " + description(payload) + "}");
  }
  list.append("last", Dictionary());
  expected.emplace_back("{last: {}}");

  EXPECT_EQ(list.size(), expected.size());
  EXPECT_EQ(entriesOf(list.snapshot()), expected);
}

TEST_F(OstrelReportingAggregatedPayloadsTest, ReferenceOutlivesWhatWasAppended) {
  OstrelReportingAggregatedPayloads list(storage_, ReporterID{42});
  std::optional<Dictionary> payload = payloadOf(70'000);
  const std::string expected = "{large: " + description(*payload) + "}";
  list.append("large", *payload);
  const auto snapshot = list.snapshot();
  list.append("larger", *payload);
  payload.reset();

  EXPECT_EQ(entriesOf(snapshot), std::vector<std::string>{expected});
  EXPECT_EQ(list.size(), 2u);
}

TEST_F(OstrelReportingAggregatedPayloadsTest, ChargesTheClientForWhatItKeeps) {
  const auto client = std::make_shared<CountingAccount>();
  {
    OstrelReportingAggregatedPayloads list(storage_, ReporterID{42});
    const Dictionary small{{"a", 1}};
    list.append("id", chargedTo(client, small));
    const std::size_t entry = 1 + 3 + small.value().bytes().size();
    EXPECT_EQ(client->kept(), KeptBytes::inUnits(entry));
    const Dictionary large = payloadOf(100'000);
    list.append("id", chargedTo(client, large));  // Copied: it is the client's.
    EXPECT_EQ(client->kept(), KeptBytes::inUnits(entry + 1 + 3 + 100'000));
    list.append("id", small);
    EXPECT_EQ(client->kept(), KeptBytes::inUnits(entry + 1 + 3 + 100'000));
    EXPECT_EQ(list.size(), 3u);
  }
  EXPECT_EQ(client->kept(), 0u);
}

}  // namespace
}  // namespace ostrel
