#include "platform/Value.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pthread.h>

#include <cmath>
#include <limits>
#include <random>

#include "platform/fake/CountingAccount.h"

namespace ostrel {
namespace {

using testing::ElementsAre;

constexpr std::int64_t kLeast = std::numeric_limits<std::int64_t>::min();
constexpr std::int64_t kGreatest = std::numeric_limits<std::int64_t>::max();
constexpr std::uint64_t kGreatestUnsigned = std::numeric_limits<std::uint64_t>::max();

std::vector<std::uint8_t> bytesOf(ValueView value) {
  const auto bytes = value.bytes();
  return {bytes.begin(), bytes.end()};
}

std::string numbered(std::string name, int number) {
  return name.append(std::to_string(number));
}

// A value of encoded bytes that are known to be right.
Value valueOf(std::initializer_list<std::uint8_t> bytes) {
  return Value(ValueView(bytes.begin()));
}

TEST(Value, HoldsBooleans) {
  for (const bool truth : {false, true}) {
    const Value value(truth);
    EXPECT_EQ(value->kind(), ValueKind::kBoolean);
    EXPECT_EQ(value->boolean(), truth);
    EXPECT_EQ(value->number(), truth ? 1.0 : 0.0);
    EXPECT_EQ(value->signedInteger(), std::nullopt);
    EXPECT_EQ(value->floatingPoint(), std::nullopt);
  }
}

TEST(Value, HoldsSignedIntegersExactly) {
  for (const std::int64_t integer :
       {kLeast, kLeast + 1, std::int64_t{-4294967297}, std::int64_t{-257},
        std::int64_t{-256}, std::int64_t{-25}, std::int64_t{-24}, std::int64_t{-1},
        std::int64_t{0}, std::int64_t{23}, std::int64_t{24}, std::int64_t{255},
        std::int64_t{256}, std::int64_t{65535}, std::int64_t{65536},
        std::int64_t{4294967295}, std::int64_t{4294967296}, kGreatest}) {
    const Value value(integer);
    EXPECT_EQ(value->kind(), ValueKind::kInteger);
    EXPECT_EQ(value->signedInteger(), integer);
    EXPECT_EQ(value->unsignedInteger().has_value(), integer >= 0);
    EXPECT_EQ(value->boolean(), std::nullopt);
  }
}

TEST(Value, HoldsUnsignedIntegersExactly) {
  const Value greatest(kGreatestUnsigned);
  EXPECT_EQ(greatest->unsignedInteger(), kGreatestUnsigned);
  EXPECT_EQ(greatest->signedInteger(), std::nullopt);
  const Value above(static_cast<std::uint64_t>(kGreatest) + 1);
  EXPECT_EQ(above->unsignedInteger(), std::uint64_t{1} << 63);
  EXPECT_EQ(above->signedInteger(), std::nullopt);
}

TEST(Value, TakesIntegersOfEveryWidth) {
  EXPECT_EQ(Value(std::int8_t{-128})->signedInteger(), -128);
  EXPECT_EQ(Value(std::uint8_t{255})->unsignedInteger(), 255u);
  EXPECT_EQ(Value(std::uint16_t{65535})->unsignedInteger(), 65535u);
  EXPECT_EQ(Value(std::int32_t{-1})->signedInteger(), -1);
  EXPECT_EQ(Value(std::uint32_t{0xFFFFFFFF})->unsignedInteger(), 0xFFFFFFFFu);
}

TEST(Value, HoldsDoubles) {
  for (const double number : {0.0, -0.0, 1.0, -2.5, 1e300, 5e-324, HUGE_VAL, -HUGE_VAL}) {
    const Value value(number);
    EXPECT_EQ(value->kind(), ValueKind::kDouble);
    EXPECT_EQ(value->floatingPoint(), number);
    EXPECT_EQ(std::signbit(*value->floatingPoint()), std::signbit(number));
    EXPECT_EQ(value->signedInteger(), std::nullopt);
  }
  EXPECT_TRUE(std::isnan(*Value(std::nan(""))->floatingPoint()));
}

TEST(Value, ReadsShorterDoublesOfOtherEncoders) {
  EXPECT_EQ(valueOf({0xF9, 0x3E, 0x00})->floatingPoint(), 1.5);
  EXPECT_EQ(valueOf({0xF9, 0x00, 0x01})->floatingPoint(), std::ldexp(1.0, -24));
  EXPECT_EQ(valueOf({0xF9, 0x7C, 0x00})->floatingPoint(), HUGE_VAL);
  EXPECT_EQ(valueOf({0xF9, 0xFC, 0x00})->floatingPoint(), -HUGE_VAL);
  EXPECT_TRUE(std::isnan(*valueOf({0xF9, 0x7E, 0x00})->floatingPoint()));
  EXPECT_EQ(valueOf({0xFA, 0x3F, 0xC0, 0x00, 0x00})->floatingPoint(), 1.5);
}

TEST(Value, HoldsDates) {
  const Value value(Date{1769860800.25});
  EXPECT_EQ(value->kind(), ValueKind::kDate);
  EXPECT_EQ(value->date(), Date{1769860800.25});
  EXPECT_EQ(value->number(), std::nullopt);
  EXPECT_EQ(value->floatingPoint(), std::nullopt);
}

TEST(Value, ReadsDatesInWholeSecondsOfOtherEncoders) {
  EXPECT_EQ(valueOf({0xC1, 0x1A, 0x00, 0x01, 0x00, 0x00})->date(), Date{65536});
  EXPECT_EQ(valueOf({0xC1, 0x20})->date(), Date{-1});
}

TEST(Value, HoldsText) {
  const std::string longText(70000, 'x');
  for (const std::string& text :
       {std::string(), std::string("text"), std::string("a\0b", 3), longText}) {
    const Value value(text);
    EXPECT_EQ(value->kind(), ValueKind::kString);
    EXPECT_EQ(value->string(), text);
    EXPECT_EQ(value->boolean(), std::nullopt);
  }
}

TEST(Value, HoldsArraysInOrder) {
  const Array array = ArrayBuilder().append(Value(1)).append(Value("two")).build();
  EXPECT_EQ(array.size(), 2u);
  std::vector<std::string> seen;
  for (const ValueView element : array) seen.push_back(description(element));
  EXPECT_THAT(seen, ElementsAre("1", "two"));
  EXPECT_TRUE(Array().empty());
  EXPECT_EQ(Array().begin(), Array().end());
}

TEST(Value, HoldsDictionariesInTheOrderOfTheirMaking) {
  const Dictionary dictionary{{"b", Value(1)}, {"a", Value(2)}};
  std::vector<std::string> keys;
  for (const auto& [key, value] : dictionary) keys.emplace_back(*key.string());
  EXPECT_THAT(keys, ElementsAre("b", "a"));
  EXPECT_EQ(dictionary.find("a")->signedInteger(), 2);
  EXPECT_FALSE(dictionary.find("c"));
  EXPECT_TRUE(Dictionary().empty());
}

TEST(Value, IsNoneOfAnotherKind) {
  EXPECT_FALSE(Array::from(Value(1)));
  EXPECT_FALSE(Dictionary::from(Value("x")));
  EXPECT_FALSE(Array::from(Value(Dictionary())));
  EXPECT_FALSE(Value("x")->array());
  EXPECT_FALSE(Value(1)->string());
  EXPECT_FALSE(Value(1)->date());
}

TEST(Value, OutlivesTheDictionaryItWasTakenFrom) {
  std::optional<Value> kept;
  {
    const Dictionary inner{{"deep", Value("text")}};
    const Dictionary outer{{"inner", Value(inner)}};
    kept = outer.get("inner");
  }
  EXPECT_EQ(Dictionary::from(*kept)->find("deep")->string(), "text");
}

TEST(Value, SharesItsBytesWithItsCopies) {
  const Dictionary dictionary{{"key", Value("value")}};
  const Dictionary copy = dictionary;
  const Value value(copy);
  EXPECT_EQ(copy.value().bytes().data(), dictionary.value().bytes().data());
  EXPECT_EQ(value->bytes().data(), dictionary.value().bytes().data());
}

TEST(Value, EncodesAsTheStandardSays) {
  // The examples of RFC 8949, appendix A.
  EXPECT_EQ(bytesOf(Value(10)), (std::vector<std::uint8_t>{0x0A}));
  EXPECT_EQ(bytesOf(Value(1000)), (std::vector<std::uint8_t>{0x19, 0x03, 0xE8}));
  EXPECT_EQ(bytesOf(Value(-1000)), (std::vector<std::uint8_t>{0x39, 0x03, 0xE7}));
  EXPECT_EQ(bytesOf(Value(1.1)), (std::vector<std::uint8_t>{0xFB, 0x3F, 0xF1, 0x99, 0x99,
                                                            0x99, 0x99, 0x99, 0x9A}));
  EXPECT_EQ(bytesOf(Value(true)), (std::vector<std::uint8_t>{0xF5}));
  EXPECT_EQ(bytesOf(Value("IETF")),
            (std::vector<std::uint8_t>{0x64, 0x49, 0x45, 0x54, 0x46}));
  EXPECT_EQ(bytesOf(Value(Date{1363896240.5})),
            (std::vector<std::uint8_t>{0xC1, 0xFB, 0x41, 0xD4, 0x52, 0xD9, 0xEC, 0x20,
                                       0x00, 0x00}));
  const Dictionary dictionary{
      {"a", Value(1)},
      {"b", Value(ArrayBuilder().append(Value(2)).append(Value(3)).build())}};
  EXPECT_EQ(
      bytesOf(dictionary.value()),
      (std::vector<std::uint8_t>{0xA2, 0x61, 0x61, 0x01, 0x61, 0x62, 0x82, 0x02, 0x03}));
}

TEST(ValueEquality, ComparesIntegersByTheirValue) {
  EXPECT_EQ(Value(5), Value(std::uint64_t{5}));
  EXPECT_NE(Value(5), Value(6));
  EXPECT_NE(Value(-1), Value(kGreatestUnsigned));
  EXPECT_NE(Value(kLeast), Value(static_cast<std::uint64_t>(kGreatest) + 1));
  EXPECT_EQ(valueOf({0x18, 0x05}), Value(5));  // Longer than needed.
}

TEST(ValueEquality, TellsKindsApart) {
  EXPECT_NE(Value(1), Value(1.0));
  EXPECT_NE(Value(1), Value(true));
  EXPECT_NE(Value("1"), Value(1));
  EXPECT_NE(Value(Date{1}), Value(1.0));
  EXPECT_NE(Value(Array()), Value(Dictionary()));
}

TEST(ValueEquality, ComparesDoublesAsNumbers) {
  EXPECT_EQ(Value(0.0), Value(-0.0));
  EXPECT_NE(Value(std::nan("")), Value(std::nan("")));
  EXPECT_EQ(valueOf({0xF9, 0x3E, 0x00}), Value(1.5));
}

TEST(ValueEquality, KeepsToTheOrderOfArrays) {
  const Array ab = ArrayBuilder().append(Value("a")).append(Value("b")).build();
  const Array ba = ArrayBuilder().append(Value("b")).append(Value("a")).build();
  const Array a = ArrayBuilder().append(Value("a")).build();
  EXPECT_EQ(ab, ab);
  EXPECT_FALSE(ab == ba);
  EXPECT_FALSE(ab == a);
}

TEST(ValueEquality, PassesOverTheOrderOfDictionaries) {
  const Dictionary ab{{"a", Value(1)}, {"b", Value(2)}};
  const Dictionary ba{{"b", Value(2)}, {"a", Value(1)}};
  EXPECT_EQ(ab, ba);
  EXPECT_FALSE(ab == (Dictionary{{"a", Value(1)}, {"b", Value(3)}}));
  EXPECT_FALSE(ab == (Dictionary{{"a", Value(1)}, {"c", Value(2)}}));
  EXPECT_FALSE(ab == (Dictionary{{"a", Value(1)}}));
  EXPECT_EQ((Dictionary{{"outer", Value(ab)}}), (Dictionary{{"outer", Value(ba)}}));
}

TEST(ValueEquality, TellsTextKeysFromIntegerKeys) {
  DictionaryBuilder text;
  text.set("1", Value("x"));
  DictionaryBuilder integer;
  integer.set(Value(1).view(), Value("x").view());
  EXPECT_FALSE(text.build() == integer.build());
}

TEST(DictionaryBuilder, ReplacesInThePlaceOfTheEarlierEntry) {
  DictionaryBuilder builder;
  builder.set("a", Value(1)).set("b", Value(2)).set("a", Value("new"));
  EXPECT_EQ(builder.size(), 2u);
  EXPECT_EQ(description(builder.build()), "{a: new, b: 2}");
}

TEST(DictionaryBuilder, MergesAllEntriesOfAnother) {
  DictionaryBuilder builder(Dictionary{{"a", Value(1)}, {"b", Value(2)}});
  builder.merge({{"b", Value("two")}, {"c", Value(3)}});
  EXPECT_EQ(description(builder.build()), "{a: 1, b: two, c: 3}");
}

TEST(DictionaryBuilder, MayGoOnAfterItBuilt) {
  DictionaryBuilder builder;
  builder.set("a", Value(1));
  const Dictionary before = builder.build();
  builder.set("a", Value(2)).set("b", Value(3));
  EXPECT_EQ(description(before), "{a: 1}");
  EXPECT_EQ(description(builder.build()), "{a: 2, b: 3}");
}

TEST(DictionaryBuilder, TakesAnEmptyKey) {
  DictionaryBuilder builder;
  builder.set("", Value(1));
  EXPECT_TRUE(builder.contains(""));
  EXPECT_EQ(builder.build().find("")->signedInteger(), 1);
}

TEST(DictionaryBuilder, TakesIntegerKeysUnchanged) {
  DictionaryBuilder builder;
  builder.set(Value(-3).view(), Value("negative").view());
  builder.set(Value(kGreatestUnsigned).view(), Value("great").view());
  builder.set(Value(-3).view(), Value("replaced").view());
  const Dictionary dictionary = builder.build();
  EXPECT_EQ(description(dictionary), "{-3: replaced, 18446744073709551615: great}");
  EXPECT_EQ(dictionary.view().find(Value(-3).view())->string(), "replaced");
  EXPECT_FALSE(dictionary.find("-3"));
}

TEST(DictionaryBuilder, KnowsAKeyThatItsSenderWroteAtLength) {
  DictionaryBuilder builder;
  builder.set("a", Value(1));
  const Value longA = valueOf({0x78, 0x01, 'a'});
  builder.set(longA.view(), Value(2).view());
  const Value long5 = valueOf({0x18, 0x05});
  builder.set(Value(5).view(), Value("short").view());
  builder.set(long5.view(), Value("long").view());
  EXPECT_EQ(description(builder.build()), "{a: 2, 5: long}");
}

// What a dictionary must be, made of plain parts.
class Model {
 public:
  void set(const std::string& key, int value) {
    for (auto& entry : entries_) {
      if (entry.first == key) {
        entry.second = value;
        return;
      }
    }
    entries_.emplace_back(key, value);
  }
  std::string text() const {
    std::string text = "{";
    for (const auto& [key, value] : entries_) {
      if (text.size() > 1) text += ", ";
      text += key + ": " + std::to_string(value);
    }
    return text + "}";
  }
  std::size_t size() const { return entries_.size(); }

 private:
  std::vector<std::pair<std::string, int>> entries_;
};

TEST(DictionaryBuilder, IsADictionaryForAnyNumberOfKeys) {
  std::mt19937 random(7);
  for (const int keys : {1, 15, 16, 17, 18, 40, 300}) {
    DictionaryBuilder builder;
    Model model;
    for (int i = 0; i < 3 * keys; ++i) {
      const std::string key = numbered("key", static_cast<int>(random() % keys));
      builder.set(key, Value(i));
      model.set(key, i);
      ASSERT_TRUE(builder.contains(key));
    }
    EXPECT_FALSE(builder.contains(numbered("key", keys)));
    EXPECT_EQ(builder.size(), model.size());
    EXPECT_EQ(description(builder.build()), model.text());
  }
}

TEST(DictionaryBuilder, ReplacesEachOf17KeysAndMore) {
  DictionaryBuilder builder;
  for (int i = 0; i < 20; ++i) builder.set(numbered("k", i), Value(i));
  for (int i = 0; i < 20; ++i) builder.set(numbered("k", i), Value(-i));
  const Dictionary dictionary = builder.build();
  ASSERT_EQ(dictionary.size(), 20u);
  for (int i = 0; i < 20; ++i) {
    EXPECT_EQ(dictionary.find(numbered("k", i))->signedInteger(), -i);
  }
}

TEST(DictionaryBuilder, MergesItsOwnDictionaryWithoutChange) {
  DictionaryBuilder builder;
  for (int i = 0; i < 20; ++i) builder.set(numbered("k", i), Value(i));
  const Dictionary once = builder.build();
  builder.merge(once);
  EXPECT_EQ(builder.build(), once);
}

TEST(DictionaryBuilder, TakesThousandsOfKeysInLittleTime) {
  DictionaryBuilder builder;
  for (int i = 0; i < 30000; ++i) builder.set(std::to_string(i), Value(i));
  for (int i = 0; i < 30000; ++i) builder.set(std::to_string(i), Value(i));
  EXPECT_EQ(builder.build().size(), 30000u);
}

TEST(PayloadAccount, IsChargedForABufferUntilItsLastReferenceGoes) {
  const auto account = std::make_shared<CountingAccount>();
  {
    const Value value("text");
    ValueBuffer buffer = ValueBuffer::copyOf(value->bytes(), account);
    EXPECT_GE(account->charged(), buffer.size());
    const ValueBuffer copy = buffer;
    buffer = ValueBuffer();
    EXPECT_EQ(account->relieved(), 0u);
  }
  EXPECT_EQ(account->relieved(), account->charged());
}

TEST(PayloadAccount, IsChargedForInputOnlyWhatItsReaderSays) {
  const auto account = std::make_shared<CountingAccount>();
  {
    const Value value("text");
    ValueBuffer input = ValueBuffer::copyOfInput(value->bytes(), account);
    EXPECT_EQ(account->charged(), 0u);
    input.charge(3);
    input.charge(4);
    EXPECT_EQ(account->charged(), 7u);
  }
  EXPECT_EQ(account->relieved(), 7u);
}

TEST(Dictionary, CompactsToItsOwnBytesAndKeepsTheAccount) {
  const auto account = std::make_shared<CountingAccount>();
  const Dictionary plain{{"a", Value("text")}};
  std::string bytes(1000, '\0');
  const auto own = plain.value().bytes();
  std::copy(own.begin(), own.end(), bytes.begin() + 500);
  ValueBuffer large = ValueBuffer::copyOf(
      {reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size()}, account);
  const Dictionary part(large, std::as_const(large).data() + 500);

  const Dictionary compact = part.compact();

  EXPECT_EQ(compact, plain);
  EXPECT_EQ(compact.owner().size(), own.size());
  EXPECT_EQ(compact.owner().account(), account);
  EXPECT_EQ(compact.compact().value().data(), compact.value().data());
  EXPECT_EQ(Dictionary().compact(), Dictionary());
}

Dictionary chargedDictionary(std::shared_ptr<PayloadAccount> account) {
  return chargedTo(std::move(account), {{"a", Value("text")}, {"b", Value(2)}});
}

TEST(PayloadAccount, IsChargedOnceForCopiesAndParts) {
  const auto account = std::make_shared<CountingAccount>();
  {
    std::optional<Value> part;
    {
      const Dictionary dictionary = chargedDictionary(account);
      const std::size_t once = account->charged();
      const Dictionary copy = dictionary;
      part = copy.get("a");
      EXPECT_EQ(account->charged(), once);
    }
    EXPECT_EQ(account->relieved(), 0u);  // The part keeps the whole.
  }
  EXPECT_EQ(account->relieved(), account->charged());
}

TEST(PayloadAccount, BearsWhatABuilderMakesOfItsPayload) {
  const auto account = std::make_shared<CountingAccount>();
  {
    const Dictionary dictionary = chargedDictionary(account);
    const std::size_t before = account->charged();
    const Dictionary changed = DictionaryBuilder(dictionary).set("c", Value(3)).build();
    EXPECT_GT(account->charged(), before);
    EXPECT_EQ(changed.owner().account(), account);
  }
  EXPECT_EQ(account->relieved(), account->charged());
}

TEST(PayloadAccount, BearsWhatABuilderOfItsOwnMakes) {
  const auto account = std::make_shared<CountingAccount>();
  {
    DictionaryBuilder builder(account);
    builder.set("a", Value(1));
    EXPECT_EQ(account->charged(), 0u);
    const Dictionary dictionary = builder.build();
    EXPECT_GE(account->charged(), dictionary.value().bytes().size());
  }
  EXPECT_EQ(account->relieved(), account->charged());
}

TEST(PayloadAccount, IsLetGoWithTheLastOfItsBuffers) {
  auto account = std::make_shared<CountingAccount>();
  const std::weak_ptr<CountingAccount> watch = account;
  std::optional<Dictionary> dictionary = chargedDictionary(account);
  account.reset();
  EXPECT_FALSE(watch.expired());
  dictionary.reset();
  EXPECT_TRUE(watch.expired());
}

TEST(ValueDescription, IsTheTextOfEachKind) {
  EXPECT_EQ(description(Value(true)), "true");
  EXPECT_EQ(description(Value(false)), "false");
  EXPECT_EQ(description(Value(kLeast)), "-9223372036854775808");
  EXPECT_EQ(description(Value(kGreatestUnsigned)), "18446744073709551615");
  EXPECT_EQ(description(Value(0.1)), "0.1");
  EXPECT_EQ(description(Value("text")), "text");
  EXPECT_EQ(description(Value(Date{0.25})), "1970-01-01T00:00:00.250Z");
  EXPECT_EQ(description(Value(Array())), "[]");
  EXPECT_EQ(description(Value(Dictionary())), "{}");
}

TEST(ValueDescription, SaysWhatIsNoOrdinaryNumberOrDate) {
  EXPECT_EQ(description(Value(std::nan(""))), "nan");
  EXPECT_EQ(description(Value(HUGE_VAL)), "inf");
  EXPECT_EQ(description(Value(-HUGE_VAL)), "-inf");
  EXPECT_EQ(description(Value(Date{1e300})), "1e+300");
}

TEST(ValueDescription, ShowsWhatLiesWithin) {
  const Dictionary dictionary{
      {"list", Value(ArrayBuilder()
                         .append(Value(1))
                         .append(Value(Dictionary{{"x", Value("y")}}))
                         .append(Value(Array()))
                         .append(Value("end"))
                         .build())},
      {"empty", Value(Dictionary())},
      {"last", Value(2.5)}};
  EXPECT_EQ(description(dictionary),
            "{list: [1, {x: y}, [], end], empty: {}, last: 2.5}");
}

// Runs `action` on a thread with a stack of 256 KiB.
void onSmallStack(const std::function<void()>& action) {
  pthread_attr_t attributes;
  pthread_attr_init(&attributes);
  ASSERT_EQ(pthread_attr_setstacksize(&attributes, std::size_t{256} * 1024), 0);
  pthread_t thread;
  ASSERT_EQ(pthread_create(
                &thread, &attributes,
                [](void* at) -> void* {
                  (*static_cast<const std::function<void()>*>(at))();
                  return nullptr;
                },
                const_cast<std::function<void()>*>(&action)),
            0);
  pthread_join(thread, nullptr);
  pthread_attr_destroy(&attributes);
}

// Arrays and dictionaries in turn, one within the other.
Value nested(int depth) {
  Value value("core");
  for (int i = 0; i < depth; ++i) {
    value = i % 2 == 0 ? Value(ArrayBuilder().append(value).append(Value(i)).build())
                       : Value(Dictionary{{"in", value}, {"i", Value(i)}});
  }
  return value;
}

void useOnSmallStack(int depth) {
  onSmallStack([depth] {
    Value value = nested(depth);
    const Value copy = value;
    EXPECT_EQ(copy, value);
    const Value rebuilt(value.view());
    EXPECT_EQ(rebuilt, value);
    EXPECT_EQ(value->bytes().size(), rebuilt->bytes().size());
    const std::string text = description(value);
    EXPECT_NE(text.find("core"), std::string::npos);
    EXPECT_EQ(text, description(rebuilt));
    const Dictionary holder = DictionaryBuilder().set("deep", value).build();
    EXPECT_EQ(*holder.get("deep"), value);
    value = Value(1);
  });
}

TEST(ValueNesting, IsSafeAtTheDepthThatTheWireAdmits) {
  useOnSmallStack(31);
  useOnSmallStack(32);
  useOnSmallStack(33);
}

TEST(ValueNesting, IsSafeAtThousands) { useOnSmallStack(2000); }

TEST(ValueNesting, IsSafeAtAHundredThousandLevelsOfForeignBytes) {
  onSmallStack([] {
    constexpr std::size_t kDepth = 100000;
    std::vector<std::uint8_t> bytes(kDepth, 0x81);  // Arrays of one.
    bytes.push_back(0x00);
    const Value value{ValueView(bytes.data())};
    EXPECT_EQ(value->bytes().size(), kDepth + 1);
    EXPECT_EQ(value, Value(ValueView(bytes.data())));
    EXPECT_EQ(description(value).size(), 2 * kDepth + 1);
  });
}

}  // namespace
}  // namespace ostrel
