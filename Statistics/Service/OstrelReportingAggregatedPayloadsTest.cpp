#include "Statistics/Service/OstrelReportingAggregatedPayloads.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <vector>

#include "Statistics/CoreTestFixture.h"

namespace ostrel {
namespace {

std::vector<std::string> entriesOf(
    const OstrelReportingAggregatedPayloads::Snapshot& snapshot) {
  std::vector<std::string> entries;
  snapshot.forEach([&](ValueView entry) { entries.push_back(description(entry)); });
  return entries;
}

TEST(OstrelReportingAggregatedPayloads, BeginsEmpty) {
  const OstrelReportingAggregatedPayloads list;

  EXPECT_TRUE(list.empty());
  EXPECT_EQ(list.size(), 0u);
  EXPECT_EQ(entriesOf(list.snapshot()), std::vector<std::string>{});
}

TEST(OstrelReportingAggregatedPayloads, HoldsEntriesInOrder) {
  OstrelReportingAggregatedPayloads list;

  list.append("first", {{"a", 1}});
  list.append({{"b", 2}, {"c", 3}});
  list.append("", Dictionary());

  EXPECT_EQ(list.size(), 3u);
  EXPECT_EQ(entriesOf(list.snapshot()),
            (std::vector<std::string>{"{first: {a: 1}}", "{b: 2, c: 3}", "{: {}}"}));
}

TEST(OstrelReportingAggregatedPayloads, OutlivesWhatWasAppended) {
  OstrelReportingAggregatedPayloads list;
  {
    const Dictionary payload{{"a", std::string(100, 'x')}};
    list.append(std::string("first"), payload);
  }

  EXPECT_EQ(entriesOf(list.snapshot()),
            std::vector<std::string>{"{first: {a: " + std::string(100, 'x') + "}}"});
}

TEST(OstrelReportingAggregatedPayloads, HoldsEntriesOfEverySize) {
  OstrelReportingAggregatedPayloads list;
  std::vector<std::string> expected;
  for (const std::size_t size :
       {0u, 1u, 1000u, 1023u, 1024u, 1025u, 262143u, 262144u, 262145u, 600000u, 3u}) {
    const std::string text(size, 'x');
    list.append("k", {{"t", text}});
    expected.push_back("{k: {t: " + text + "}}");
  }

  EXPECT_EQ(entriesOf(list.snapshot()), expected);
}

TEST(OstrelReportingAggregatedPayloads, SnapshotDoesNotShowWhatComesLater) {
  OstrelReportingAggregatedPayloads list;
  list.append("a", Dictionary());

  const auto snapshot = list.snapshot();
  list.append("b", Dictionary());
  list.insertFront(std::make_shared<MutableDictionary>());

  EXPECT_EQ(entriesOf(snapshot), std::vector<std::string>{"{a: {}}"});
}

TEST(OstrelReportingAggregatedPayloads, SnapshotOutlivesTheList) {
  auto list = std::make_unique<OstrelReportingAggregatedPayloads>();
  list->append("a", {{"x", 1}});
  const auto snapshot = list->snapshot();

  list.reset();

  EXPECT_EQ(entriesOf(snapshot), std::vector<std::string>{"{a: {x: 1}}"});
}

TEST(OstrelReportingAggregatedPayloads, SnapshotIsReadWhileEntriesAreAppended) {
  OstrelReportingAggregatedPayloads list;
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

TEST(OstrelReportingAggregatedPayloads, PutsWhatIsInsertedLastFirst) {
  OstrelReportingAggregatedPayloads list;
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

TEST(OstrelReportingAggregatedPayloads, ShowsWhatIsMergedLaterInLaterSnapshots) {
  OstrelReportingAggregatedPayloads list;
  const auto userInfo = std::make_shared<MutableDictionary>();
  list.insertFront(userInfo);
  const auto before = list.snapshot();

  userInfo->merge({{"a", 1}});

  EXPECT_EQ(entriesOf(before), std::vector<std::string>{"{}"});
  EXPECT_EQ(entriesOf(list.snapshot()), std::vector<std::string>{"{a: 1}"});
}

}  // namespace
}  // namespace ostrel
