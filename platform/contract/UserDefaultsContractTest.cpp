#include <limits>

#include "platform/ValueJSON.h"
#include "platform/fake/FakeUserDefaults.h"
#include "platform/linux/JSONUserDefaults.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

constexpr std::string_view kSuite = "com.orbisk.ostrel";

struct SuiteInMemory {
  void write(const Dictionary& values) { defaults.setSuite(kSuite, values); }
  void remove() { defaults.removeSuite(kSuite); }
  FakeUserDefaults defaults{std::make_shared<EventLog>()};
};

struct SuiteInAFile {
  void write(const Dictionary& values) {
    std::string text;
    ASSERT_FALSE(appendJSON(text, values.value(), JSONLayout::kPretty,
                            JSONStrictness::kError, /*indent=*/0));
    directory.write(name, text);
  }
  void remove() { std::filesystem::remove(directory / name); }

  const std::string name = std::string(kSuite) + ".json";
  testing_support::TemporaryDirectory directory;
  JSONUserDefaults defaults{directory.path()};
};

template <typename Subject>
class UserDefaultsContract : public testing::Test {
 protected:
  std::unique_ptr<UserDefaultsSuite> open(const Dictionary& values) {
    subject_.write(values);
    return subject_.defaults.openSuite(kSuite);
  }

  Subject subject_;
};
using Subjects = testing::Types<SuiteInMemory, SuiteInAFile>;
TYPED_TEST_SUITE(UserDefaultsContract, Subjects);

TYPED_TEST(UserDefaultsContract, ReadsAMissingSuiteAsOneWithoutValues) {
  const auto suite = this->subject_.defaults.openSuite(kSuite);
  ASSERT_NE(suite, nullptr);
  EXPECT_FALSE(suite->objectForKey("disable_reporting"));
  EXPECT_FALSE(suite->stringForKey("device_name"));
  EXPECT_FALSE(suite->boolForKey("disable_reporting"));
}

TYPED_TEST(UserDefaultsContract, HandsOutEachKindOfValue) {
  const Array list = ArrayBuilder().append(Value("a")).append(Value(1)).build();
  const Dictionary inner{{"key", Value("value")}};
  const auto suite = this->open({{"text", Value("name")},
                                 {"truth", Value(true)},
                                 {"integer", Value(-5)},
                                 {"double", Value(2.5)},
                                 {"list", Value(list)},
                                 {"dictionary", Value(inner)}});
  EXPECT_EQ(suite->objectForKey("text"), Value("name"));
  EXPECT_EQ(suite->objectForKey("truth"), Value(true));
  EXPECT_EQ(suite->objectForKey("integer"), Value(-5));
  EXPECT_EQ(suite->objectForKey("double"), Value(2.5));
  EXPECT_EQ(suite->objectForKey("list"), Value(list));
  EXPECT_EQ(suite->objectForKey("dictionary"), Value(inner));
  EXPECT_FALSE(suite->objectForKey("other"));
}

TYPED_TEST(UserDefaultsContract, KeepsIntegersExact) {
  const auto suite =
      this->open({{"least", Value(std::numeric_limits<std::int64_t>::min())},
                  {"greatest", Value(std::numeric_limits<std::uint64_t>::max())}});
  EXPECT_EQ(suite->objectForKey("least"),
            Value(std::numeric_limits<std::int64_t>::min()));
  EXPECT_EQ(suite->objectForKey("greatest"),
            Value(std::numeric_limits<std::uint64_t>::max()));
}

TYPED_TEST(UserDefaultsContract, GivesTextsAndNumbersAsText) {
  const auto suite = this->open({{"text", Value("a name")},
                                 {"empty", Value("")},
                                 {"integer", Value(-5)},
                                 {"double", Value(2.5)}});
  EXPECT_EQ(suite->stringForKey("text"), "a name");
  EXPECT_EQ(suite->stringForKey("empty"), "");
  EXPECT_EQ(suite->stringForKey("integer"), "-5");
  EXPECT_EQ(suite->stringForKey("double"), "2.5");
}

TYPED_TEST(UserDefaultsContract, GivesNothingElseAsText) {
  const auto suite = this->open({{"truth", Value(true)},
                                 {"list", Value(Array())},
                                 {"dictionary", Value(Dictionary())}});
  EXPECT_FALSE(suite->stringForKey("truth"));
  EXPECT_FALSE(suite->stringForKey("list"));
  EXPECT_FALSE(suite->stringForKey("dictionary"));
  EXPECT_FALSE(suite->stringForKey("missing"));
}

TYPED_TEST(UserDefaultsContract, TakesNumbersOtherThanZeroForTrue) {
  const auto suite = this->open({{"true", Value(true)},
                                 {"one", Value(1)},
                                 {"negative", Value(-1)},
                                 {"half", Value(0.5)},
                                 {"false", Value(false)},
                                 {"zero", Value(0)},
                                 {"no part", Value(0.0)}});
  for (const auto key : {"true", "one", "negative", "half"}) {
    EXPECT_TRUE(suite->boolForKey(key)) << key;
  }
  for (const auto key : {"false", "zero", "no part"}) {
    EXPECT_FALSE(suite->boolForKey(key)) << key;
  }
}

TYPED_TEST(UserDefaultsContract, TakesTextsThatSayYesForTrue) {
  for (const auto text : {"yes", "YES", "Yes", "true", "TRUE", "1", "-1", "12", "0.5"}) {
    EXPECT_TRUE(this->open({{"key", Value(text)}})->boolForKey("key")) << text;
  }
  for (const auto text : {"", "no", "false", "0", "0.0", "00", "on", "yes!", "1x"}) {
    EXPECT_FALSE(this->open({{"key", Value(text)}})->boolForKey("key")) << text;
  }
}

TYPED_TEST(UserDefaultsContract, TakesListsAndDictionariesForFalse) {
  const auto suite =
      this->open({{"list", Value(ArrayBuilder().append(Value(true)).build())},
                  {"dictionary", Value(Dictionary{{"a", Value(true)}})}});
  EXPECT_FALSE(suite->boolForKey("list"));
  EXPECT_FALSE(suite->boolForKey("dictionary"));
}

TYPED_TEST(UserDefaultsContract, KeepsTheValuesOfTheMomentItWasOpened) {
  const auto before = this->open({{"key", Value("old")}});
  const auto after = this->open({{"key", Value("new")}});
  this->subject_.remove();
  const auto last = this->subject_.defaults.openSuite(kSuite);
  EXPECT_EQ(before->stringForKey("key"), "old");
  EXPECT_EQ(after->stringForKey("key"), "new");
  EXPECT_FALSE(last->stringForKey("key"));
}

TYPED_TEST(UserDefaultsContract, KeepsSuitesApart) {
  this->subject_.write({{"key", Value("ours")}});
  EXPECT_FALSE(
      this->subject_.defaults.openSuite("com.orbisk.other")->objectForKey("key"));
}

}  // namespace
}  // namespace ostrel
