#include "platform/linux/ValueJSONReader.h"

#include <limits>

#include "platform/ValueJSON.h"
#include "platform/linux/Limits.h"

namespace ostrel {
namespace {

std::optional<Value> read(std::string_view text, JSONDates dates) {
  std::string error;
  auto value = valueFromJSON(text, dates, error);
  EXPECT_EQ(value.has_value(), error.empty()) << error;
  return value;
}

std::string errorOf(std::string_view text) {
  std::string error;
  EXPECT_FALSE(valueFromJSON(text, JSONDates::kTagged, error));
  return error;
}

TEST(ValueJSONReader, KeepsIntegersExactOverBothRanges) {
  EXPECT_EQ(read("-9223372036854775808", JSONDates::kPlain),
            Value(std::numeric_limits<std::int64_t>::min()));
  EXPECT_EQ(read("18446744073709551615", JSONDates::kPlain),
            Value(std::numeric_limits<std::uint64_t>::max()));
  EXPECT_EQ(read("9007199254740993", JSONDates::kPlain),
            Value(std::int64_t{9007199254740993}));
}

TEST(ValueJSONReader, RefusesIntegersOutsideBothRanges) {
  EXPECT_EQ(errorOf("18446744073709551616"),
            "the integer 18446744073709551616 does not fit into 64 bits");
  EXPECT_EQ(errorOf("[-9223372036854775809]"),
            "the integer -9223372036854775809 does not fit into 64 bits");
}

TEST(ValueJSONReader, ReadsNumbersWithAFractionOrAnExponentAsDoubles) {
  EXPECT_EQ(read("1.0", JSONDates::kPlain), Value(1.0));
  EXPECT_EQ(read("1e3", JSONDates::kPlain), Value(1000.0));
  EXPECT_EQ(read("18446744073709551616.0", JSONDates::kPlain),
            Value(18446744073709551616.0));
  EXPECT_EQ(errorOf("1e999"), "a number is too large for a double");
}

TEST(ValueJSONReader, ReadsTaggedDatesOnlyWhenAsked) {
  const char* const text = R"({"$date": "2026-01-31T12:00:00.250Z"})";
  EXPECT_EQ(read(text, JSONDates::kTagged), Value(Date{1769860800.25}));
  EXPECT_EQ(read(text, JSONDates::kPlain),
            Value(Dictionary{{"$date", Value("2026-01-31T12:00:00.250Z")}}));
  EXPECT_EQ(errorOf(R"({"$date": 5})"), "\"$date\" needs a date in ISO 8601");
}

TEST(ValueJSONReader, KeepsTheLastOfEqualKeys) {
  EXPECT_EQ(read(R"({"a": 1, "a": [true, "x\u0000"]})", JSONDates::kPlain),
            Value(Dictionary{{"a", Value(ArrayBuilder()
                                             .append(Value(true))
                                             .append(Value(std::string_view("x\0", 2)))
                                             .build())}}));
}

TEST(ValueJSONReader, SaysWhereATextIsNotJSON) {
  EXPECT_EQ(errorOf("{\"a\": }"), "not JSON at byte 7");
  EXPECT_NE(errorOf(""), "");
  EXPECT_NE(errorOf("{} {}"), "");
  EXPECT_NE(errorOf("\"\xFF\""), "");
  EXPECT_EQ(errorOf("[null]"), "null stands for no value");
}

TEST(ValueJSONReader, LimitsTheNesting) {
  const auto nested = [](std::size_t depth) {
    return std::string(depth, '[') + std::string(depth, ']');
  };
  EXPECT_TRUE(read(nested(limits::kNesting), JSONDates::kPlain));
  EXPECT_EQ(errorOf(nested(limits::kNesting + 1)), "nested too deeply");
  EXPECT_EQ(errorOf(std::string(1000000, '[')), "nested too deeply");
}

TEST(ValueJSONReader, ReadsWhatTheWriterWrote) {
  const Value value(Dictionary{{"d", Value(0.1)},
                               {"i", Value(-5)},
                               {"t", Value("\n\"ü")},
                               {"l", Value(ArrayBuilder().append(Value(1.0)).build())}});
  std::string text;
  appendJSON(text, value, JSONLayout::kPretty, JSONStrictness::kError, /*indent=*/0);
  EXPECT_EQ(read(text, JSONDates::kPlain), value);
}

TEST(DateFromISO8601, ReadsOffsetsAndFractions) {
  EXPECT_EQ(dateFromISO8601("1970-01-01T00:00:00Z"), Date{0});
  EXPECT_EQ(dateFromISO8601("2026-01-31T13:00:00.25+01:00"), Date{1769860800.25});
  EXPECT_EQ(dateFromISO8601("2026-01-31T06:30:00-0530"), Date{1769860800});
  EXPECT_EQ(dateFromISO8601("1969-12-31T23:59:59.5Z"), Date{-0.5});
}

TEST(DateFromISO8601, RefusesEverythingElse) {
  for (const char* text :
       {"", "2026-01-31", "2026-02-30T00:00:00Z", "2026-01-31T24:00:00Z",
        "2026-01-31T12:00:00", "2026-01-31T12:00:00.Z", "2026-01-31T12:00:00Zx",
        "2026-01-31T12:00:00+25:00", "26-01-31T12:00:00Z"}) {
    EXPECT_EQ(dateFromISO8601(text), std::nullopt) << text;
  }
}

}  // namespace
}  // namespace ostrel
