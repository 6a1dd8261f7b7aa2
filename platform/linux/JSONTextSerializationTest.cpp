#include "platform/linux/JSONTextSerialization.h"

#include <limits>

namespace ostrel {
namespace {

ElementSource sourceOf(const Array& array) {
  return [array](const std::function<void(ValueView)>& take) {
    for (const ValueView element : array) take(element);
  };
}

std::string textOf(const TextSource& source) {
  std::string text;
  source([&](std::string_view piece) { text += piece; });
  return text;
}

TEST(JSONTextSerialization, WritesAnArrayOfDictionaries) {
  const Array array =
      ArrayBuilder()
          .append(Value(Dictionary{{"user", Value("info")}}))
          .append(Value(Dictionary{{"A_B_1", Value(Dictionary{{"n", Value(1)}})}}))
          .append(Value(Dictionary()))
          .build();
  const auto outcome = JSONTextSerialization().prettyPrintedArray(sourceOf(array));
  EXPECT_EQ(outcome.error, std::nullopt);
  ASSERT_TRUE(outcome.value);
  EXPECT_EQ(textOf(*outcome.value),
            "[\n  {\n    \"user\": \"info\"\n  },\n"
            "  {\n    \"A_B_1\": {\n      \"n\": 1\n    }\n  },\n  {}\n]");
}

TEST(JSONTextSerialization, WritesAnEmptyArray) {
  const auto outcome = JSONTextSerialization().prettyPrintedArray(sourceOf(Array()));
  ASSERT_TRUE(outcome.value);
  EXPECT_EQ(textOf(*outcome.value), "[]");
}

TEST(JSONTextSerialization, WritesTheSameTextEachTime) {
  const Array array = ArrayBuilder().append(Value(Date{0})).append(Value(0.5)).build();
  const auto outcome = JSONTextSerialization().prettyPrintedArray(sourceOf(array));
  ASSERT_TRUE(outcome.value);
  EXPECT_EQ(textOf(*outcome.value), "[\n  \"1970-01-01T00:00:00.000Z\",\n  0.5\n]");
  EXPECT_EQ(textOf(*outcome.value), textOf(*outcome.value));
}

TEST(JSONTextSerialization, GivesAnErrorAndNoTextForWhatJSONCannotSay) {
  const Array array = ArrayBuilder()
                          .append(Value(1))
                          .append(Value(std::numeric_limits<double>::infinity()))
                          .append(Value(2))
                          .build();
  const auto outcome = JSONTextSerialization().prettyPrintedArray(sourceOf(array));
  EXPECT_FALSE(outcome.value);
  ASSERT_TRUE(outcome.error);
  EXPECT_EQ(outcome.error->description,
            "a number that is not finite has no form in JSON");
}

TEST(JSONTextSerialization, RefusesKeysThatAreNotText) {
  DictionaryBuilder builder;
  builder.set(Value(1).view(), Value(1).view());
  const Array array = ArrayBuilder().append(Value(builder.build())).build();
  const auto outcome = JSONTextSerialization().prettyPrintedArray(sourceOf(array));
  EXPECT_FALSE(outcome.value);
  EXPECT_TRUE(outcome.error);
}

}  // namespace
}  // namespace ostrel
