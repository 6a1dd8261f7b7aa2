#include "Statistics/Service/OstrelReportingSessionIndex.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <random>

namespace ostrel {
namespace {

// The index follows no pointer: any that differ do.
class OstrelReportingSessionIndexTest : public testing::Test {
 protected:
  using Owner = OstrelReportingSessionIndex::Owner;

  OstrelReportingServerInstance* client(std::size_t number) {
    return reinterpret_cast<OstrelReportingServerInstance*>(&memory_[number]);
  }
  OstrelReportingSession* session(std::size_t number) {
    return reinterpret_cast<OstrelReportingSession*>(&memory_[number]);
  }
  Owner owner(std::uint64_t registration, std::size_t sessionNumber) {
    return {registration, client(registration), session(sessionNumber)};
  }
  OstrelReportingSession* found(std::int64_t reporterID) const {
    return index_.find(ReporterID{reporterID});
  }

  std::array<char, 256> memory_{};
  OstrelReportingSessionIndex index_;
};

TEST_F(OstrelReportingSessionIndexTest, FindsWhatWasEntered) {
  EXPECT_EQ(found(7), nullptr);
  index_.enter(ReporterID{7}, owner(1, 10));
  index_.enter(ReporterID{-7}, owner(1, 11));
  EXPECT_EQ(found(7), session(10));
  EXPECT_EQ(found(-7), session(11));
  EXPECT_EQ(index_.clientOf(ReporterID{7}), client(1));
}

TEST_F(OstrelReportingSessionIndexTest, ReplacesTheSessionOfTheSameClient) {
  index_.enter(ReporterID{7}, owner(1, 10));
  index_.enter(ReporterID{7}, owner(1, 11));
  EXPECT_EQ(found(7), session(11));
  index_.remove(ReporterID{7}, *client(1));
  EXPECT_EQ(found(7), nullptr);
}

TEST_F(OstrelReportingSessionIndexTest, FindsTheClientThatRegisteredFirst) {
  index_.enter(ReporterID{7}, owner(2, 12));
  index_.enter(ReporterID{7}, owner(3, 13));
  index_.enter(ReporterID{7}, owner(1, 11));
  EXPECT_EQ(found(7), session(11));
  EXPECT_EQ(index_.clientOf(ReporterID{7}), client(1));
  index_.remove(ReporterID{7}, *client(1));
  EXPECT_EQ(found(7), session(12));
  EXPECT_EQ(index_.clientOf(ReporterID{7}), client(2));
  index_.remove(ReporterID{7}, *client(3));
  EXPECT_EQ(found(7), session(12));
  index_.remove(ReporterID{7}, *client(2));
  EXPECT_EQ(found(7), nullptr);
}

TEST_F(OstrelReportingSessionIndexTest, ReplacesTheSessionOfALaterClient) {
  index_.enter(ReporterID{7}, owner(1, 11));
  index_.enter(ReporterID{7}, owner(2, 12));
  index_.enter(ReporterID{7}, owner(2, 22));
  index_.remove(ReporterID{7}, *client(1));
  EXPECT_EQ(found(7), session(22));
  index_.remove(ReporterID{7}, *client(2));
  EXPECT_EQ(found(7), nullptr);
}

TEST_F(OstrelReportingSessionIndexTest, RemovesNothingOfAnotherClient) {
  index_.enter(ReporterID{7}, owner(1, 11));
  index_.remove(ReporterID{7}, *client(2));
  index_.remove(ReporterID{8}, *client(1));
  EXPECT_EQ(found(7), session(11));
}

// Many IDs come and go, in an order of their own.
TEST_F(OstrelReportingSessionIndexTest, AgreesWithAMapAfterAnyChanges) {
  std::mt19937 random(4711);
  std::map<std::int64_t, std::size_t> expected;
  const auto compare = [&] {
    for (std::int64_t id = 0; id < 600; ++id) {
      const auto known = expected.find(id);
      ASSERT_EQ(found(id), known != expected.end() ? session(known->second) : nullptr)
          << "ID " << id;
    }
  };
  for (int round = 0; round < 20000; ++round) {
    // Of all IDs more are entered first, and more removed then.
    const std::int64_t id = random() % 600;
    const bool enters = random() % 10 < (round % 10000 < 5000 ? 7u : 3u);
    if (enters) {
      const std::size_t number = 1 + random() % 200;
      index_.enter(ReporterID{id}, owner(1, number));
      expected[id] = number;
    } else {
      index_.remove(ReporterID{id}, *client(1));
      expected.erase(id);
    }
    if (round % 500 == 0) compare();
  }
  for (const auto& [id, number] : expected) index_.remove(ReporterID{id}, *client(1));
  expected.clear();
  compare();
}

}  // namespace
}  // namespace ostrel
