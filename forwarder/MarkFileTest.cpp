#include "forwarder/MarkFile.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>

#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using testing_support::CapturedLog;
using testing_support::TemporaryDirectory;

const ForwardMark kMark{"abc", 1, 2, 3, 4, 5};

class MarkFileTest : public ::testing::Test {
 protected:
  MarkFile file() const { return MarkFile(directory_ / "own", "forwarder.json"); }
  ForwardMark loaded() const { return file().load().value.value_or(ForwardMark{"none"}); }
  void write(const std::string& text) const {
    std::filesystem::create_directories(directory_ / "own");
    directory_.write("own/forwarder.json", text);
  }

  const CapturedLog log_;
  const TemporaryDirectory directory_;
};

TEST_F(MarkFileTest, IsThatOfANewStartWhereThereIsNone) {
  EXPECT_EQ(loaded(), ForwardMark());
  EXPECT_TRUE(log_.lines(LogLevel::kError).empty());
}

TEST_F(MarkFileTest, KeepsAMark) {
  ASSERT_TRUE(file().save(kMark).succeeded);
  EXPECT_EQ(loaded(), kMark);
}

TEST_F(MarkFileTest, ReplacesAMarkAndLeavesNothingBeside) {
  MarkFile marks = file();
  ASSERT_TRUE(marks.save(ForwardMark()).succeeded);
  ASSERT_TRUE(marks.save(kMark).succeeded);
  EXPECT_EQ(loaded(), kMark);
  const std::filesystem::directory_iterator all(directory_ / "own");
  EXPECT_EQ(std::distance(begin(all), end(all)), 1);
}

TEST_F(MarkFileTest, CountsAsNoneWhenItHoldsSomethingElse) {
  for (
      const char* text :
      {"", "{", "[]", "{}", R"({"store":"abc"})", R"({"store":5,"through":1})",
       R"({"store":"a","through":-1,"forwarded":0,"parked":0,"rejected":0,"dropped":0})",
       R"({"store":"a","through":"1","forwarded":0,"parked":0,"rejected":0,"dropped":0})"}) {
    write(text);
    EXPECT_EQ(loaded(), ForwardMark()) << text;
  }
  write(std::string(100'000, ' '));
  EXPECT_EQ(loaded(), ForwardMark());
  EXPECT_EQ(log_.lines(LogLevel::kError).size(), 9u);
}

TEST_F(MarkFileTest, IsAnErrorWhenItCannotBeRead) {
  std::filesystem::create_directories(directory_ / "own/forwarder.json");
  EXPECT_TRUE(file().load().error);
}

TEST_F(MarkFileTest, SaysWhenItCannotBeWritten) {
  directory_.write("own", "");
  EXPECT_FALSE(file().save(kMark).succeeded);
}

}  // namespace
}  // namespace ostrel
