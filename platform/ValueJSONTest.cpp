#include "platform/ValueJSON.h"

#include <cmath>
#include <limits>
#include <nlohmann/json.hpp>
#include <random>

namespace ostrel {
namespace {

constexpr double kInfinity = std::numeric_limits<double>::infinity();
constexpr double kNaN = std::numeric_limits<double>::quiet_NaN();

std::string compact(const Value& value) {
  std::string out;
  EXPECT_EQ(appendJSON(out, value, JSONLayout::kCompact, JSONStrictness::kError,
                       /*indent=*/0),
            std::nullopt);
  return out;
}

std::string lenient(const Value& value) {
  std::string out;
  EXPECT_EQ(appendJSON(out, value, JSONLayout::kCompact, JSONStrictness::kLenient,
                       /*indent=*/0),
            std::nullopt);
  return out;
}

std::optional<ErrorObject> errorOf(const Value& value) {
  std::string out = "before";
  auto error = appendJSON(out, value, JSONLayout::kCompact, JSONStrictness::kError,
                          /*indent=*/0);
  EXPECT_EQ(out, "before");
  EXPECT_EQ(findJSONError(value), error);
  return error;
}

Value withIntegerKey() {
  DictionaryBuilder builder;
  builder.set(Value(-7).view(), Value("seven").view());
  return Value(builder.build());
}

TEST(ValueJSON, WritesScalars) {
  EXPECT_EQ(compact(Value(true)), "true");
  EXPECT_EQ(compact(Value(false)), "false");
  EXPECT_EQ(compact(Value("text")), "\"text\"");
  EXPECT_EQ(compact(Value(Date{1769860800.25})), "\"2026-01-31T12:00:00.250Z\"");
}

TEST(ValueJSON, WritesAsManyBytesAsItMayAndElseNone) {
  const Value value(Dictionary{{"a", 1}, {"b", std::string(3000, '\n')}, {"c", "end"}});
  const std::string whole = compact(value);
  for (const std::size_t most : {whole.size() + 1, whole.size()}) {
    std::string out = "before";
    EXPECT_EQ(appendJSON(out, value, JSONLayout::kCompact, JSONStrictness::kError,
                         /*indent=*/0, most),
              std::nullopt);
    EXPECT_EQ(out, "before" + whole);
  }
  for (const std::size_t most : {whole.size() - 1, std::size_t{2000}, std::size_t{0}}) {
    std::string out = "before";
    const auto error = appendJSON(out, value, JSONLayout::kCompact,
                                  JSONStrictness::kError, /*indent=*/0, most);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->description, "what would be too long a text has no form in JSON");
    EXPECT_EQ(out, "before");
    EXPECT_LT(out.capacity(), most + 2048);
  }
}

TEST(ValueJSON, WritesIntegersExactlyOverBothRanges) {
  EXPECT_EQ(compact(Value(0)), "0");
  EXPECT_EQ(compact(Value(-1)), "-1");
  EXPECT_EQ(compact(Value(std::numeric_limits<std::int64_t>::min())),
            "-9223372036854775808");
  EXPECT_EQ(compact(Value(std::numeric_limits<std::int64_t>::max())),
            "9223372036854775807");
  EXPECT_EQ(compact(Value(std::numeric_limits<std::uint64_t>::max())),
            "18446744073709551615");
  for (const std::uint64_t edge : {23u, 24u, 255u, 256u, 65535u, 65536u, 4294967295u}) {
    EXPECT_EQ(compact(Value(edge)), std::to_string(edge));
    const auto below = -1 - static_cast<std::int64_t>(edge);
    EXPECT_EQ(compact(Value(below)), std::to_string(below));
  }
}

TEST(ValueJSON, WritesDoublesWithAFractionOrAnExponent) {
  EXPECT_EQ(compact(Value(1.0)), "1.0");
  EXPECT_EQ(compact(Value(-0.0)), "-0.0");
  EXPECT_EQ(compact(Value(0.1)), "0.1");
  EXPECT_EQ(compact(Value(1e300)), "1e+300");
  EXPECT_EQ(compact(Value(123456789012.0)), "123456789012.0");
  EXPECT_EQ(compact(Value(5e-324)), "5e-324");
}

TEST(ValueJSON, ReadsHalfAndSingleWidthDoubles) {
  const std::uint8_t half[] = {0xF9, 0x3E, 0x00};
  const std::uint8_t single[] = {0xFA, 0x3F, 0xC0, 0x00, 0x00};
  EXPECT_EQ(compact(Value(ValueView(half))), "1.5");
  EXPECT_EQ(compact(Value(ValueView(single))), "1.5");
}

TEST(ValueJSON, EscapesControlCharactersQuotesAndBackslashes) {
  EXPECT_EQ(compact(Value(std::string_view("a\0b", 3))), "\"a\\u0000b\"");
  EXPECT_EQ(compact(Value("\"\\\b\f\n\r\t\x1F\x7F/")),
            "\"\\\"\\\\\\b\\f\\n\\r\\t\\u001f\x7F/\"");
}

TEST(ValueJSON, WritesEveryCharacterAtEveryOffset) {
  for (int offset = 0; offset < 9; ++offset) {
    for (int c = 0; c < 0x80; ++c) {
      std::string text(static_cast<std::size_t>(offset), 'x');
      text += static_cast<char>(c);
      text += "yyyyyyyyy";
      EXPECT_EQ(nlohmann::json::parse(compact(Value(text))).get<std::string>(), text);
    }
  }
}

TEST(ValueJSON, WritesTextLongerThanItsBuffer) {
  std::string text;
  for (int i = 0; i < 3000; ++i) text += i % 7 == 0 ? "\n" : "\xC3\xBC";
  EXPECT_EQ(nlohmann::json::parse(compact(Value(text))).get<std::string>(), text);
}

TEST(ValueJSON, WritesContainersInTheOrderOfTheirEntries) {
  const Dictionary value{{"z", Value(ArrayBuilder().append(Value(1)).build())},
                         {"a", Value(Dictionary())},
                         {"m", Value(Array())}};
  EXPECT_EQ(compact(Value(value)), R"({"z":[1],"a":{},"m":[]})");
}

TEST(ValueJSON, WritesPrettyTextAtTheGivenDepth) {
  const Dictionary value{
      {"list", Value(ArrayBuilder().append(Value(1)).append(Value("x")).build())},
      {"empty", Value(Dictionary())},
      {"none", Value(Array())}};
  std::string out;
  appendJSON(out, value.value(), JSONLayout::kPretty, JSONStrictness::kError,
             /*indent=*/1);
  EXPECT_EQ(out,
            "{\n    \"list\": [\n      1,\n      \"x\"\n    ],\n"
            "    \"empty\": {},\n    \"none\": []\n  }");
}

TEST(ValueJSON, RefusesWhatJSONCannotSay) {
  EXPECT_TRUE(errorOf(Value(kNaN)));
  EXPECT_TRUE(errorOf(Value(kInfinity)));
  EXPECT_TRUE(errorOf(Value(Date{kNaN})));
  EXPECT_TRUE(errorOf(Value(Date{1e12})));
  EXPECT_TRUE(errorOf(withIntegerKey()));
  EXPECT_TRUE(errorOf(Value(Dictionary{{"deep", withIntegerKey()}})));
  EXPECT_TRUE(errorOf(Value(Dictionary{
      {"a", Value(Dictionary{{"b", Value(ArrayBuilder().append(Value(1)).build())}})},
      {"c", Value(kNaN)}})));
}

TEST(ValueJSON, GivesTheFirstErrorOfSeveral) {
  DictionaryBuilder builder;
  builder.set(Value(5).view(), Value(kNaN).view());
  EXPECT_EQ(errorOf(Value(builder.build()))->description,
            "a key that is not text has no form in JSON");
}

TEST(ValueJSON, LenientlyWritesSubstitutes) {
  EXPECT_EQ(lenient(Value(kNaN)), "\"NaN\"");
  EXPECT_EQ(lenient(Value(kInfinity)), "\"Infinity\"");
  EXPECT_EQ(lenient(Value(-kInfinity)), "\"-Infinity\"");
  EXPECT_EQ(lenient(Value(Date{kInfinity})), "\"Infinity\"");
  EXPECT_EQ(lenient(Value(Date{1e12})), "1e+12");
  EXPECT_EQ(lenient(withIntegerKey()), R"({"-7":"seven"})");
}

TEST(ValueJSON, StandsAnyNesting) {
  constexpr int kDepth = 200000;
  std::string bytes(kDepth, '\x81');
  bytes += '\x00';
  bytes.back() = '\x01';
  std::string out;
  appendJSON(out, ValueView(reinterpret_cast<const std::uint8_t*>(bytes.data())),
             JSONLayout::kCompact, JSONStrictness::kError, /*indent=*/0);
  EXPECT_EQ(out, std::string(kDepth, '[') + "1" + std::string(kDepth, ']'));
}

// A random value and the same thing as the other library sees it.
class RandomValues {
 public:
  std::pair<Value, nlohmann::json> make(int depth) {
    switch (below(depth > 0 ? 7u : 5u)) {
      case 0: {
        const bool truth = below(2) == 1;
        return {Value(truth), truth};
      }
      case 1: {
        const auto integer = static_cast<std::int64_t>(random_() >> below(64));
        return {Value(integer), integer};
      }
      case 2: {
        const std::uint64_t integer = random_() >> below(64);
        return {Value(integer), integer};
      }
      case 3: {
        double number;
        do {
          const std::uint64_t bits = random_();
          std::memcpy(&number, &bits, sizeof number);
        } while (!std::isfinite(number));
        return {Value(number), number};
      }
      case 4: {
        const std::string string = text();
        return {Value(string), string};
      }
      case 5: {
        ArrayBuilder array;
        nlohmann::json other = nlohmann::json::array();
        for (unsigned i = below(6); i != 0; --i) {
          auto [value, same] = make(depth - 1);
          array.append(value);
          other.push_back(same);
        }
        return {Value(array.build()), other};
      }
      default: {
        DictionaryBuilder dictionary;
        nlohmann::json other = nlohmann::json::object();
        for (unsigned i = below(6); i != 0; --i) {
          auto [value, same] = make(depth - 1);
          const std::string key = text();
          dictionary.set(key, value);
          other[key] = same;
        }
        return {Value(dictionary.build()), other};
      }
    }
  }

 private:
  unsigned below(unsigned bound) { return static_cast<unsigned>(random_() % bound); }
  std::string text() {
    static constexpr std::string_view kPieces[] = {"a", "\"", "\\", "\n", "\x01",
                                                   "ü", "€",  "𝄞",  "/",  "key"};
    std::string text;
    for (unsigned i = below(20); i != 0; --i) text += kPieces[below(10)];
    return text;
  }
  std::mt19937_64 random_{20260131};
};

TEST(ValueJSON, IsReadBackTheSameByAnotherLibrary) {
  RandomValues values;
  for (int i = 0; i < 20000; ++i) {
    const auto [value, same] = values.make(/*depth=*/4);
    ASSERT_EQ(nlohmann::json::parse(compact(value)), same);
    ASSERT_EQ(findJSONError(value), std::nullopt);
    std::string pretty;
    appendJSON(pretty, value, JSONLayout::kPretty, JSONStrictness::kError, /*indent=*/0);
    ASSERT_EQ(nlohmann::json::parse(pretty), same);
  }
}

}  // namespace
}  // namespace ostrel
