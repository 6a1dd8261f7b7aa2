#include "platform/Logging.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <limits>
#include <map>
#include <thread>

namespace ostrel {
namespace {

using testing::ElementsAre;

// Keeps the lines written to it.
class KeptLog final : public ScopedLog {
 public:
  struct Line {
    LogLevel level;
    std::string scopeCode;
    std::string text;
  };

  int verbosity(std::string_view key) const override {
    const auto found = verbosities.find(std::string(key));
    return found == verbosities.end() ? 0 : found->second;
  }
  LogLevel lowestLevel() const override { return lowest; }
  void write(const LogLine& line) override {
    lines.push_back({line.level, std::string(line.scopeCode), std::string(line.text)});
  }

  LogLevel lowest = LogLevel::kDefault;
  std::map<std::string, int> verbosities;
  std::vector<Line> lines;
};

LogScope testScope("test", "reporting_test_verbose");

class Logging : public testing::Test {
 protected:
  void SetUp() override {
    registerLogScope(testScope);
    use();
  }
  void TearDown() override { setSystemLog(nullptr); }

  // Takes the log's settings over.
  void use() { setSystemLog(log_); }

  std::string lastText() const {
    return log_->lines.empty() ? "" : log_->lines.back().text;
  }

  const std::shared_ptr<KeptLog> log_ = std::make_shared<KeptLog>();
};

void writeOneOfEachLevel() {
  OSTREL_LOG_ERROR(testScope, "error");
  OSTREL_LOG_DEFAULT(testScope, "default");
  OSTREL_LOG_INFO(testScope, "info");
  OSTREL_LOG_DEBUG(testScope, "debug");
}

std::vector<LogLevel> levelsOf(const KeptLog& log) {
  std::vector<LogLevel> levels;
  for (const auto& line : log.lines) levels.push_back(line.level);
  return levels;
}

TEST_F(Logging, WritesDefaultAndErrorLinesUntilAskedForMore) {
  writeOneOfEachLevel();
  EXPECT_THAT(levelsOf(*log_), ElementsAre(LogLevel::kError, LogLevel::kDefault));
}

TEST_F(Logging, WritesErrorsAloneWhenErrorIsTheLowestLevel) {
  log_->lowest = LogLevel::kError;
  use();
  writeOneOfEachLevel();
  EXPECT_THAT(levelsOf(*log_), ElementsAre(LogLevel::kError));
}

TEST_F(Logging, WritesInfoLinesWhenInfoIsTheLowestLevel) {
  log_->lowest = LogLevel::kInfo;
  use();
  writeOneOfEachLevel();
  EXPECT_THAT(levelsOf(*log_),
              ElementsAre(LogLevel::kError, LogLevel::kDefault, LogLevel::kInfo));
}

TEST_F(Logging, WritesDebugLinesFromVerbosity5On) {
  log_->verbosities["reporting_test_verbose"] = 4;
  use();
  EXPECT_FALSE(testScope.isOn(LogLevel::kDebug));
  log_->verbosities["reporting_test_verbose"] = 5;
  use();
  EXPECT_TRUE(testScope.isOn(LogLevel::kDebug));
}

TEST_F(Logging, WritesDebugLinesOfAVerboseScopeWhateverTheLowestLevel) {
  log_->lowest = LogLevel::kError;
  log_->verbosities["reporting_test_verbose"] = 5;
  use();
  writeOneOfEachLevel();
  EXPECT_THAT(levelsOf(*log_), ElementsAre(LogLevel::kError, LogLevel::kDebug));
}

TEST_F(Logging, LeavesOtherScopesAloneWhenOneIsVerbose) {
  static LogScope other("othr", "reporting_other_verbose");
  registerLogScope(other);
  log_->verbosities["reporting_test_verbose"] = 5;
  use();
  EXPECT_FALSE(other.isOn(LogLevel::kDebug));
}

TEST_F(Logging, WritesErrorAndDefaultLinesOfAScopeThatIsNotRegisteredYet) {
  const LogScope unregistered("none", "reporting_none_verbose");
  EXPECT_TRUE(unregistered.isOn(LogLevel::kError));
  EXPECT_TRUE(unregistered.isOn(LogLevel::kDefault));
  EXPECT_FALSE(unregistered.isOn(LogLevel::kInfo));
  EXPECT_FALSE(unregistered.isOn(LogLevel::kDebug));
}

TEST_F(Logging, NamesTheScopeOfALine) {
  OSTREL_LOG_ERROR(testScope, "x");
  ASSERT_EQ(log_->lines.size(), 1u);
  EXPECT_EQ(log_->lines[0].scopeCode, "test");
}

int built = 0;
int build() { return ++built; }

TEST_F(Logging, BuildsNoArgumentOfALineThatIsOff) {
  built = 0;
  OSTREL_LOG_INFO(testScope, "%i", build());
  OSTREL_LOG_DEBUG(testScope, "%i", build());
  EXPECT_EQ(built, 0);
  OSTREL_LOG_ERROR(testScope, "%i", build());
  EXPECT_EQ(built, 1);
}

struct Writer {
  static int write() {
    OSTREL_LOG_ERROR(testScope, "text");
    return __LINE__ - 1;
  }
};

TEST_F(Logging, BeginsEachLineWithFileLineAndQualifiedFunction) {
  const int line = Writer::write();
  // An unnamed namespace is written by one compiler as a part of the name.
  EXPECT_THAT(lastText(),
              testing::MatchesRegex("LoggingTest.cpp:" + std::to_string(line) +
                                    ":ostrel::.*Writer::write: text"));
}

TEST(QualifiedName, IsThatOfAFunctionWithoutItsTypes) {
  EXPECT_EQ(qualifiedName("void ostrel::Session::start(bool)"), "ostrel::Session::start");
  EXPECT_EQ(qualifiedName("static std::map<int, long int> ostrel::make(const A&, B)"),
            "ostrel::make");
  EXPECT_EQ(qualifiedName("const char* ostrel::name() const"), "ostrel::name");
  EXPECT_EQ(qualifiedName("std::string &ostrel::text(int)"), "ostrel::text");
  EXPECT_EQ(qualifiedName("ostrel::Session::Session(ostrel::ReporterID)"),
            "ostrel::Session::Session");
  EXPECT_EQ(qualifiedName("virtual ostrel::Session::~Session()"),
            "ostrel::Session::~Session");
  EXPECT_EQ(qualifiedName("int main(int, char**)"), "main");
  EXPECT_EQ(qualifiedName("no signature"), "no signature");
}

TEST_F(Logging, FormatsEachKindOfArgument) {
  EXPECT_EQ(format("%i", 7), "7");
  EXPECT_EQ(format("%lli", std::numeric_limits<std::int64_t>::min()),
            "-9223372036854775808");
  EXPECT_EQ(format("%lu", std::numeric_limits<std::uint64_t>::max()),
            "18446744073709551615");
  EXPECT_EQ(format("%u", std::uint16_t{65535}), "65535");
  EXPECT_EQ(format("%i", true), "1");
  EXPECT_EQ(format("%i", false), "0");
  EXPECT_EQ(format("%f", 5.0), "5.000000");
  EXPECT_EQ(format("%@", "text"), "text");
  EXPECT_EQ(format("%@", std::string("text")), "text");
  EXPECT_EQ(format("%@", std::string_view("text")), "text");
}

enum class Code : std::uint32_t {};

TEST_F(Logging, FormatsACodeAsItsNumber) {
  EXPECT_EQ(format("%i", Code{268435458}), "268435458");
}

TEST_F(Logging, FormatsValuesByTheirDescription) {
  EXPECT_EQ(format("%@", Dictionary{{"a", Value(1)}}), "{a: 1}");
  EXPECT_EQ(format("%@", Value(2.5)), "2.5");
  EXPECT_EQ(format("%@", ArrayBuilder().append(Value("x")).append(Value(1)).build()),
            "[x, 1]");
}

TEST_F(Logging, FormatsAnErrorByItsDescription) {
  EXPECT_EQ(format("%@", ErrorObject{"domain", 3, "it broke"}), "it broke");
}

TEST_F(Logging, FormatsAMissingObjectAsNull) {
  EXPECT_EQ(format("%@", std::optional<std::string>()), "(null)");
  EXPECT_EQ(format("%@", std::optional<ErrorObject>()), "(null)");
  EXPECT_EQ(format("%@", std::optional<Dictionary>()), "(null)");
  EXPECT_EQ(format("%@", std::shared_ptr<std::string>()), "(null)");
}

TEST_F(Logging, FormatsAnObjectThatIsThereAsItself) {
  EXPECT_EQ(format("%@", std::optional<std::string>("x")), "x");
  EXPECT_EQ(format("%@", std::optional<ErrorObject>({"d", 1, "broke"})), "broke");
}

TEST_F(Logging, FormatsAListInParentheses) {
  EXPECT_EQ(format("%@", std::vector<int>{1, 2, 3}), "(1, 2, 3)");
  EXPECT_EQ(format("%@", std::vector<std::string>{}), "()");
}

TEST_F(Logging, TakesSeveralArgumentsInTheirOrder) {
  EXPECT_EQ(format("message %@ : category %i : type %i", "m", 9u, std::uint16_t{1}),
            "message m : category 9 : type 1");
}

TEST_F(Logging, WritesAPercentSignForTwo) {
  EXPECT_EQ(format("100%% of %i", 2), "100% of 2");
}

TEST_F(Logging, ReadsNoFormatOutOfAnArgument) {
  EXPECT_EQ(format("%@ %i", "%i%@%n", 1), "%i%@%n 1");
}

TEST_F(Logging, EscapesWhatWouldEndOrForgeALine) {
  EXPECT_EQ(format("%@", "a\nb"), "a\\nb");
  EXPECT_EQ(format("%@", std::string("\0\x01\x1f\x7f\r\t", 6)),
            "\\x00\\x01\\x1f\\x7f\\x0d\\x09");
}

TEST_F(Logging, KeepsWellFormedUTF8) {
  const std::string text =
      "\xC3\xA4 \xE2\x82\xAC \xF0\x9F\x8E\xB5 \xED\x9F\xBF \xF4\x8F\xBF\xBF";
  EXPECT_EQ(format("%@", text), text);
}

TEST_F(Logging, EscapesBytesThatAreNoUTF8) {
  EXPECT_EQ(format("%@", "\x80"), "\\x80");           // A lone continuation.
  EXPECT_EQ(format("%@", "\xC3"), "\\xc3");           // Cut short.
  EXPECT_EQ(format("%@", "\xC0\xAF"), "\\xc0\\xaf");  // Longer than needed.
  EXPECT_EQ(format("%@", "\xE0\x80\xAF"), "\\xe0\\x80\\xaf");
  EXPECT_EQ(format("%@", "\xED\xA0\x80"), "\\xed\\xa0\\x80");           // Half of a pair.
  EXPECT_EQ(format("%@", "\xF4\x90\x80\x80"), "\\xf4\\x90\\x80\\x80");  // Too high.
  EXPECT_EQ(format("%@", "\xFF"), "\\xff");
  EXPECT_EQ(format("%@", "\xE2\x82x"), "\\xe2\\x82x");
}

TEST_F(Logging, EscapesTheControlCharactersAbove7F) {
  // A terminal may take U+009B for the start of a command.
  EXPECT_EQ(format("%@",
                   "\xC2\x9B"
                   "31m"),
            "\\xc2\\x9b"
            "31m");
  EXPECT_EQ(format("%@", "\xC2\x80\xC2\x9F"), "\\xc2\\x80\\xc2\\x9f");
  EXPECT_EQ(format("%@", "\xC2\xA0"), "\xC2\xA0");
}

TEST_F(Logging, EscapesTheLineSeparatorsOfUnicode) {
  EXPECT_EQ(format("%@", "\xE2\x80\xA8\xE2\x80\xA9"), "\\xe2\\x80\\xa8\\xe2\\x80\\xa9");
}

TEST_F(Logging, CutsAnArgumentAt2KiB) {
  const std::string below = format("%@", std::string(2040, 'x'));
  EXPECT_EQ(below, std::string(2040, 'x'));
  EXPECT_EQ(format("%@", std::string(2048, 'x')), std::string(2048, 'x'));
  const std::string above = format("%@", std::string(2049, 'x'));
  EXPECT_LE(above.size(), 2048u);
  EXPECT_TRUE(above.ends_with("..."));
  EXPECT_LE(format("%@", std::string(1 << 20, '\n')).size(), 2048u);
}

TEST_F(Logging, CutsBetweenCharacters) {
  std::string text;
  while (text.size() < 4096) text += "\xF0\x9F\x8E\xB5";
  for (int shift = 0; shift < 4; ++shift) {
    const std::string cut = format("%@", std::string(shift, 'x') + text);
    const std::string kept = cut.substr(0, cut.size() - 3);
    EXPECT_EQ((kept.size() - static_cast<std::size_t>(shift)) % 4, 0u);
    EXPECT_TRUE(kept.ends_with("\x9F\x8E\xB5"));
  }
}

TEST_F(Logging, CutsEachArgumentByItself) {
  const std::string text = format("%@|%@", std::string(4096, 'a'), "whole");
  EXPECT_TRUE(text.ends_with("...|whole"));
}

TEST_F(Logging, WritesToTheLogThatIsInForce) {
  const auto other = std::make_shared<KeptLog>();
  setSystemLog(other);
  OSTREL_LOG_ERROR(testScope, "x");
  EXPECT_TRUE(log_->lines.empty());
  EXPECT_EQ(other->lines.size(), 1u);
}

TEST_F(Logging, GoesBackToStandardErrorWithoutALog) {
  setSystemLog(nullptr);
  testing::internal::CaptureStderr();
  OSTREL_LOG_ERROR(testScope, "to whom it may concern");
  EXPECT_THAT(
      testing::internal::GetCapturedStderr(),
      testing::MatchesRegex("<3>LoggingTest.cpp:[0-9]+:.*: to whom it may concern\n"));
}

}  // namespace
}  // namespace ostrel
