#include "ostrel/Message.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>

#include "platform/Value.h"
#include "platform/linux/Limits.h"
#include "platform/linux/wire/Frame.h"

namespace ostrel::reporting {
namespace {

/// What the service would make of it; none when it would refuse it.
std::optional<Dictionary> decoded(const Message& message) {
  const auto* bytes = reinterpret_cast<const std::uint8_t*>(message.encoded().data());
  const std::size_t size = message.encoded().size();
  const auto decoded = wire::decodeDictionary(
      {bytes, size}, {limits::kNesting, limits::kNodes, limits::kKeyBytes},
      /*owner=*/{});
  return decoded.size == size ? decoded.dictionary : std::nullopt;
}

TEST(Message, HoldsEveryKindOfValueExactly) {
  const Message message{{"text", "ü"},
                        {"yes", true},
                        {"least", std::numeric_limits<std::int64_t>::min()},
                        {"most", std::numeric_limits<std::uint64_t>::max()},
                        {"fraction", 0.1},
                        {"when", Date(std::chrono::milliseconds(1'769'860'800'250))},
                        {"list", List{1, "two", 3.0}},
                        {"part", Message{{"inner", -1}}}};

  const auto value = decoded(message);

  ASSERT_TRUE(value);
  EXPECT_EQ(value->find("text")->string(), "ü");
  EXPECT_EQ(value->find("yes")->boolean(), true);
  EXPECT_EQ(value->find("least")->signedInteger(),
            std::numeric_limits<std::int64_t>::min());
  EXPECT_EQ(value->find("most")->unsignedInteger(),
            std::numeric_limits<std::uint64_t>::max());
  EXPECT_EQ(value->find("fraction")->floatingPoint(), 0.1);
  EXPECT_EQ(iso8601(*value->find("when")->date()), "2026-01-31T12:00:00.250Z");
  EXPECT_EQ(description(*value->find("list")), "[1, two, 3]");
  EXPECT_EQ(value->find("part")->entries().find("inner")->signedInteger(), -1);
}

TEST(Message, TakesTheLaterOfTwoValuesOfOneKey) {
  Message message{{"a", 1}, {"b", 2}};

  message.set("a", "again");

  EXPECT_EQ(message.size(), 2u);
  EXPECT_EQ(decoded(message)->find("a")->string(), "again");
}

TEST(Message, FindsRepeatedKeysAmongThousands) {
  Message message;
  for (int round = 0; round < 2; ++round) {
    for (int i = 0; i < 3000; ++i) message.set("key" + std::to_string(i), round);
  }

  const auto value = decoded(message);

  ASSERT_TRUE(value);
  EXPECT_EQ(value->size(), 3000u);
  EXPECT_EQ(value->find("key2999")->signedInteger(), 1);
}

TEST(Message, MergesAnotherOverItsOwnEntries) {
  Message message{{"a", 1}, {"b", 2}};

  message.merge({{"b", 3}, {"c", 4}});

  EXPECT_EQ(*decoded(message), (Dictionary{{"a", 1}, {"b", 3}, {"c", 4}}));
}

TEST(Message, IsInvalidWithTextThatIsNotUTF8) {
  EXPECT_FALSE((Message{{"a", "\xFF"}}).isValid());
  EXPECT_FALSE((Message{{"\xC3", 1}}).isValid());
  EXPECT_TRUE((Message{{"a", "\xC3\xBC"}}).isValid());
}

TEST(Message, IsValidUpToTheDeepestNestingThatTheServiceTakes) {
  Message message;
  for (std::size_t depth = 1; depth < limits::kNesting; ++depth) {
    Message outer;
    outer.set("in", message);
    message = outer;
  }
  EXPECT_TRUE(message.isValid());
  EXPECT_TRUE(decoded(message));

  Message tooDeep;
  tooDeep.set("in", message);

  EXPECT_FALSE(tooDeep.isValid());
}

TEST(Message, IsValidUpToTheLongestKey) {
  EXPECT_TRUE((Message{{std::string(limits::kKeyBytes, 'k'), 1}}).isValid());
  EXPECT_FALSE((Message{{std::string(limits::kKeyBytes + 1, 'k'), 1}}).isValid());
}

/// The message in a prepared frame, as the service reads it.
wire::Request requestOf(const PreparedMessage& message) {
  wire::Request request;
  const auto* bytes = reinterpret_cast<const std::uint8_t*>(message.frame().data());
  const auto error = wire::decodeRequest(
      {bytes + wire::kFrameHeaderSize, message.frame().size() - wire::kFrameHeaderSize},
      {limits::kNesting, limits::kNodes, limits::kKeyBytes}, limits::kReporterIDs,
      /*owner=*/{}, request);
  EXPECT_FALSE(error) << *error;
  return request;
}

TEST(PreparedMessage, IsTheRequestThatSendMessageMakes) {
  const PreparedMessage message(Message{{"a", 1}}, Category{0x40000007}, MessageType{2},
                                ReporterIDs{ReporterID{7}, ReporterID{-1}});

  const wire::Request request = requestOf(message);

  EXPECT_EQ(request.number, 0u);
  EXPECT_EQ(*request.dictionary, (Dictionary{{"a", 1}}));
  EXPECT_EQ(static_cast<std::uint32_t>(request.category), 0x40000007u);
  EXPECT_EQ(request.reporterIDs->size(), 2u);
}

TEST(PreparedMessage, ChangesItsNumbersInPlace) {
  PreparedMessage message(Message{{"small", 1}, {"other", "text"}, {"real", 2.5}},
                          Category{1}, MessageType{2}, std::nullopt);
  const auto small = message.field("small");
  const auto real = message.field("real");

  message.set(small, std::numeric_limits<std::int64_t>::min());
  message.set(real, 1e300);

  EXPECT_EQ(*requestOf(message).dictionary,
            (Dictionary{{"small", std::numeric_limits<std::int64_t>::min()},
                        {"other", "text"},
                        {"real", 1e300}}));
}

TEST(PreparedMessage, HasNoFieldWhereThereIsNoNumber) {
  PreparedMessage message(Message{{"text", "x"}}, Category{1}, MessageType{2},
                          std::nullopt);

  const auto text = message.field("text");
  const auto missing = message.field("missing");
  message.set(text, 5);

  EXPECT_FALSE(text);
  EXPECT_FALSE(missing);
  EXPECT_EQ(*requestOf(message).dictionary, (Dictionary{{"text", "x"}}));
}

TEST(PreparedMessage, IsInvalidWithMoreIDsThanTheServiceTakes) {
  const auto prepared = [](std::size_t count) {
    return PreparedMessage(Message{{"a", 1}}, Category{1}, MessageType{2},
                           ReporterIDs(count, ReporterID{7}));
  };

  EXPECT_TRUE(prepared(limits::kReporterIDs).isValid());
  EXPECT_FALSE(prepared(limits::kReporterIDs + 1).isValid());
}

}  // namespace
}  // namespace ostrel::reporting
