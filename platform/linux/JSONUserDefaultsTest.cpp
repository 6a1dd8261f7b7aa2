#include "platform/linux/JSONUserDefaults.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <limits>

#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using testing_support::CapturedLog;
using testing_support::TemporaryDirectory;

constexpr std::string_view kSuite = "com.example.suite";
constexpr std::string_view kFile = "com.example.suite.json";

class JSONUserDefaultsSuite : public testing::Test {
 protected:
  std::unique_ptr<UserDefaultsSuite> open() {
    return JSONUserDefaults(directory_.path()).openSuite(kSuite);
  }
  std::unique_ptr<UserDefaultsSuite> open(std::string_view text) {
    directory_.write(kFile, text);
    return open();
  }
  std::size_t errors() const { return log_.lines(LogLevel::kError).size(); }

  const TemporaryDirectory directory_;
  const CapturedLog log_;
};

TEST_F(JSONUserDefaultsSuite, GivesItsValues) {
  const auto suite = open(R"({"text": "a b", "yes": true, "number": -7,
      "large": 18446744073709551615, "double": 0.5, "array": [1, {"a": false}]})");
  EXPECT_EQ(suite->objectForKey("text"), Value("a b"));
  EXPECT_EQ(suite->objectForKey("yes"), Value(true));
  EXPECT_EQ(suite->objectForKey("number"), Value(-7));
  EXPECT_EQ(suite->objectForKey("large"),
            Value(std::numeric_limits<std::uint64_t>::max()));
  EXPECT_EQ(suite->objectForKey("double"), Value(0.5));
  const Dictionary inner{{"a", Value(false)}};
  EXPECT_EQ(suite->objectForKey("array"),
            Value(ArrayBuilder().append(Value(1)).append(inner.value()).build()));
  EXPECT_EQ(suite->objectForKey("missing"), std::nullopt);
  EXPECT_EQ(errors(), 0u);
}

TEST_F(JSONUserDefaultsSuite, ReadsTextAndNumbersAsText) {
  const auto suite = open(R"({"text": "a", "empty": "", "number": -7, "double": 0.5,
      "yes": true, "array": []})");
  EXPECT_EQ(suite->stringForKey("text"), "a");
  EXPECT_EQ(suite->stringForKey("empty"), "");
  EXPECT_EQ(suite->stringForKey("number"), "-7");
  EXPECT_EQ(suite->stringForKey("double"), "0.5");
  EXPECT_EQ(suite->stringForKey("yes"), std::nullopt);
  EXPECT_EQ(suite->stringForKey("array"), std::nullopt);
  EXPECT_EQ(suite->stringForKey("missing"), std::nullopt);
}

TEST_F(JSONUserDefaultsSuite, ReadsBooleans) {
  const auto reads = [&](std::string_view json) {
    return open("{\"key\": " + std::string(json) + "}")->boolForKey("key");
  };
  for (const auto* yes : {"true", "1", "-1", "0.5", "\"yes\"", "\"YES\"", "\"true\"",
                          "\"True\"", "\"1\"", "\"-2.5\""}) {
    EXPECT_TRUE(reads(yes)) << yes;
  }
  for (const auto* no : {"false", "0", "0.0", "\"no\"", "\"\"", "\"0\"", "\"0.0\"",
                         "\"y\"", "\"1 \"", "\"yes please\"", "[1]", "{}", "null"}) {
    EXPECT_FALSE(reads(no)) << no;
  }
  EXPECT_FALSE(open()->boolForKey("missing"));
}

TEST_F(JSONUserDefaultsSuite, ThatIsMissingHasNoValuesAndIsNoError) {
  EXPECT_EQ(open()->objectForKey("key"), std::nullopt);
  EXPECT_EQ(
      JSONUserDefaults(directory_ / "missing").openSuite(kSuite)->objectForKey("key"),
      std::nullopt);
  EXPECT_EQ(errors(), 0u);
}

TEST_F(JSONUserDefaultsSuite, KeepsTheValuesOfItsOpening) {
  const auto suite = open(R"({"key": 1})");
  EXPECT_EQ(open(R"({"key": 2})")->objectForKey("key"), Value(2));
  EXPECT_EQ(suite->objectForKey("key"), Value(1));
}

TEST_F(JSONUserDefaultsSuite, WithoutAValueForAKeyTakesNull) {
  const auto suite = open(R"({"none": null, "key": 1})");
  EXPECT_EQ(suite->objectForKey("none"), std::nullopt);
  EXPECT_EQ(suite->objectForKey("key"), Value(1));
  EXPECT_EQ(errors(), 0u);
}

TEST_F(JSONUserDefaultsSuite, ThatIsCorruptHasNoValuesAndIsLogged) {
  std::size_t seen = 0;
  for (const std::string& text :
       {std::string(), std::string("{"), std::string(R"({"key": 1)"), std::string("[1]"),
        std::string("5"), std::string(R"({"key": 1} x)"),
        std::string(R"({"key": "\xff"})"), std::string("{\"key\": \"\xff\"}"),
        std::string(100, '\0'), "{\"key\": " + std::string(30000, '[')}) {
    EXPECT_EQ(open(text)->objectForKey("key"), std::nullopt) << text;
    EXPECT_EQ(errors(), ++seen) << text;
  }
}

TEST_F(JSONUserDefaultsSuite, LeavesOutWhatIsNoValue) {
  const auto suite = open(R"({"large": 1e400, "null": [null], "key": 1})");
  EXPECT_EQ(suite->objectForKey("null"), std::nullopt);
  EXPECT_EQ(suite->objectForKey("large"), std::nullopt);
  EXPECT_GE(errors(), 1u);
}

TEST_F(JSONUserDefaultsSuite, MayNestAsPayloadsMay) {
  const auto nested = [](std::size_t depth) {
    return "{\"key\": " + std::string(depth, '[') + std::string(depth, ']') + "}";
  };
  EXPECT_TRUE(open(nested(31))->objectForKey("key").has_value());
  EXPECT_EQ(errors(), 0u);
  EXPECT_FALSE(open(nested(33))->objectForKey("key").has_value());
  EXPECT_EQ(errors(), 1u);
}

TEST_F(JSONUserDefaultsSuite, MayHoldTextsUpToTheLongest) {
  const auto holds = [&](std::size_t size) {
    return open("{\"key\": \"" + std::string(size, 'x') + "\"}")
        ->objectForKey("key")
        .has_value();
  };
  EXPECT_TRUE(holds(JSONUserDefaults::kMostTextBytes - 1));
  EXPECT_TRUE(holds(JSONUserDefaults::kMostTextBytes));
  EXPECT_EQ(errors(), 0u);
  EXPECT_FALSE(holds(JSONUserDefaults::kMostTextBytes + 1));
  EXPECT_EQ(errors(), 1u);
}

TEST_F(JSONUserDefaultsSuite, IsReadUpToTheLargestFile) {
  const auto reads = [&](std::size_t size) {
    std::string text = R"({"key": 1})";
    text.resize(size, ' ');
    return open(text)->objectForKey("key").has_value();
  };
  EXPECT_TRUE(reads(JSONUserDefaults::kMostFileBytes - 1));
  EXPECT_TRUE(reads(JSONUserDefaults::kMostFileBytes));
  EXPECT_EQ(errors(), 0u);
  EXPECT_FALSE(reads(JSONUserDefaults::kMostFileBytes + 1));
  EXPECT_EQ(errors(), 1u);
}

TEST_F(JSONUserDefaultsSuite, IsNeverAPipeALinkOrADirectory) {
  const std::string path = directory_ / kFile;
  ASSERT_EQ(::mkfifo(path.c_str(), 0600), 0);
  EXPECT_EQ(open()->objectForKey("key"), std::nullopt);
  EXPECT_EQ(errors(), 1u);
  std::filesystem::remove(path);

  std::filesystem::create_symlink(directory_.write("other", R"({"key": 1})"), path);
  EXPECT_EQ(open()->objectForKey("key"), std::nullopt);
  EXPECT_EQ(errors(), 2u);
  std::filesystem::remove(path);

  std::filesystem::create_directory(path);
  EXPECT_EQ(open()->objectForKey("key"), std::nullopt);
  EXPECT_EQ(errors(), 3u);
}

TEST_F(JSONUserDefaultsSuite, LiesWithinItsDirectory) {
  directory_.write("outside.json", R"({"key": 1})");
  std::filesystem::create_directory(directory_ / "inner");
  JSONUserDefaults defaults(directory_ / "inner");
  EXPECT_EQ(defaults.openSuite("../outside")->objectForKey("key"), std::nullopt);
  EXPECT_EQ(defaults.openSuite("")->objectForKey("key"), std::nullopt);
  EXPECT_EQ(errors(), 2u);
}

}  // namespace
}  // namespace ostrel
