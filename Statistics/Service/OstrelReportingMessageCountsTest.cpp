#include "Statistics/Service/OstrelReportingMessageCounts.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <limits>

namespace ostrel {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using testing::Pair;

const MessageNames& routeChange(MessageType type) {
  return messageNames(MessageCategory{0x40000007}, type);
}

TEST(OstrelReportingMessageCounts, NumbersTheMessagesOfEachName) {
  MessageCounts counts;
  const MessageNames& start = routeChange(MessageType{1});
  const MessageNames& stop = routeChange(MessageType{2});
  EXPECT_EQ(counts.next(start).text(), "Routing_RouteChange_Start_1");
  EXPECT_EQ(counts.next(stop).text(), "Routing_RouteChange_Stop_1");
  EXPECT_EQ(counts.next(stop).text(), "Routing_RouteChange_Stop_2");
  EXPECT_EQ(counts.next(start).text(), "Routing_RouteChange_Start_2");
  EXPECT_THAT(counts.byName(), ElementsAre(Pair("Routing_RouteChange_Start", 2),
                                           Pair("Routing_RouteChange_Stop", 2)));
}

TEST(OstrelReportingMessageCounts, HasNothingBeforeTheFirstMessage) {
  EXPECT_THAT(MessageCounts().byName(), IsEmpty());
}

TEST(OstrelReportingMessageCounts, TellsAllNamesApart) {
  MessageCounts counts;
  std::size_t names = 0;
  for (const std::uint32_t domain : {0x0u, 0x10000u, 0x08000000u, 0x10000000u,
                                     0x20000000u, 0x40000000u, 0x80000000u}) {
    for (std::uint32_t kind = 0; kind < 12; ++kind) {
      for (const std::uint16_t type : {0, 1, 2, 3, 4, 5, 6, 0xFFFF}) {
        const MessageNames& ofCode =
            messageNames(MessageCategory{domain | kind}, MessageType{type});
        EXPECT_EQ(counts.next(ofCode).text(), ofCode.identifier + "_1");
        EXPECT_EQ(counts.next(ofCode).text(), ofCode.identifier + "_2");
        ++names;
      }
    }
  }
  EXPECT_EQ(counts.byName().size(), names);
}

TEST(OstrelReportingMessageCounts, HasRoomForTheLongestIdentifier) {
  const MessageNames& longest = messageNames(MessageCategory{0x08000004}, MessageType{5});
  EXPECT_EQ(longest.identifier, "Session_PlaybackAndRecord_IssueDetector");
  EXPECT_EQ(
      MessageIdentifier(longest.identifier, std::numeric_limits<std::int64_t>::max())
          .text(),
      "Session_PlaybackAndRecord_IssueDetector_9223372036854775807");
}

}  // namespace
}  // namespace ostrel
