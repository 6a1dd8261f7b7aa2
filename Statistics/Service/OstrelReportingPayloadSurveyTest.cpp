#include "Statistics/Service/OstrelReportingPayloadSurvey.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <string>

#include "Statistics/Service/OstrelReportingSessionSummary.h"

namespace ostrel {
namespace {

bool agreesOnBytes(const Dictionary& payload) {
  return std::ranges::equal(PayloadSurvey(payload).bytes(), payload.value().bytes()) &&
         PayloadSurvey(payload).bytes().data() == payload.value().data();
}

TEST(PayloadSurvey, FindsNothingInAnEmptyPayload) {
  const Dictionary payload;
  EXPECT_FALSE(PayloadSurvey(payload).hasBlankInKey());
  EXPECT_FALSE(PayloadSurvey(payload).hasEngineOnTime());
  EXPECT_TRUE(agreesOnBytes(payload));
}

TEST(PayloadSurvey, FindsABlankAtAnyPlaceOfAKeyOfAnyLength) {
  for (std::size_t length = 1; length <= 40; ++length) {
    std::string key(length, '!');  // The character next to a blank.
    EXPECT_FALSE(PayloadSurvey(Dictionary{{key, 1}}).hasBlankInKey()) << length;
    for (std::size_t at = 0; at < length; ++at) {
      key[at] = ' ';
      const Dictionary payload{{"before", 1}, {key, 2}, {"behind", 3}};
      EXPECT_TRUE(PayloadSurvey(payload).hasBlankInKey()) << length << " at " << at;
      EXPECT_NE(SanitisedPayload(payload), payload);
      key[at] = '!';
    }
  }
}

TEST(PayloadSurvey, TakesNoOtherCharacterForABlank) {
  for (int character = 1; character < 128; ++character) {
    const std::string key(9, static_cast<char>(character));
    EXPECT_EQ(PayloadSurvey(Dictionary{{key, 1}}).hasBlankInKey(), character == ' ');
  }
  EXPECT_FALSE(PayloadSurvey(Dictionary{{"äöüßäöüß", 1}}).hasBlankInKey());
}

TEST(PayloadSurvey, LooksForBlanksInKeysOfThePayloadItselfOnly) {
  const Dictionary payload{{"text", "a b"}, {"inner", Dictionary{{"a b", 1}}}};
  EXPECT_FALSE(PayloadSurvey(payload).hasBlankInKey());
  EXPECT_EQ(SanitisedPayload(payload), payload);
}

TEST(PayloadSurvey, FindsTheEngineTime) {
  EXPECT_TRUE(PayloadSurvey({{"other", 1}, {"EngineOnTime", 2}}).hasEngineOnTime());
  EXPECT_FALSE(PayloadSurvey({{"EngineOffTime", 2}}).hasEngineOnTime());
  EXPECT_FALSE(PayloadSurvey({{"EngineOnTim", 2}}).hasEngineOnTime());
  EXPECT_FALSE(PayloadSurvey({{"name", "EngineOnTime"}}).hasEngineOnTime());
}

TEST(PayloadSurvey, FindsTheEndBehindAValueOfAnyKind) {
  for (const Value& value :
       {Value(true), Value(-1), Value(1'000'000), Value(0.5), Value(Date{7.0}),
        Value(std::string(100'000, 'x')), Value(ArrayBuilder().append(Value(1)).build()),
        Value(Dictionary{{"inner", Dictionary{{"deep", 1}}}}), Value(Array()),
        Value(Dictionary())}) {
    EXPECT_TRUE(agreesOnBytes(Dictionary{{"first", 1}, {"last", value}}));
  }
}

TEST(PayloadSurvey, PassesKeysThatAreNumbers) {
  DictionaryBuilder builder;
  builder.set(ValueView(Value(32)), ValueView(Value(32)));
  builder.set("EngineOnTime", 1);
  const Dictionary payload = builder.build();
  EXPECT_FALSE(PayloadSurvey(payload).hasBlankInKey());
  EXPECT_TRUE(PayloadSurvey(payload).hasEngineOnTime());
  EXPECT_TRUE(agreesOnBytes(payload));
}

}  // namespace
}  // namespace ostrel
