#include "ostrelctl/ChannelsCommand.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <nlohmann/json.hpp>
#include <sstream>

#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using testing_support::TemporaryDirectory;
using Action = ChannelsCommand::Action;

TEST(ChannelAssignment, IsANameAndANumber) {
  EXPECT_EQ(channelAssignment("a=1"), (ChannelAssignment{"a", 1}));
  EXPECT_EQ(channelAssignment("a=-9223372036854775808"),
            (ChannelAssignment{"a", INT64_MIN}));
  EXPECT_EQ(channelAssignment("a=9223372036854775807"),
            (ChannelAssignment{"a", INT64_MAX}));
  EXPECT_EQ(channelAssignment("a b=c=2"), (ChannelAssignment{"a b=c", 2}));
  for (const auto* text : {"", "a", "=1", "a=", "a=x", "a=1x", "a=1.5", "a= 1",
                           "a=9223372036854775808", "a=--1"}) {
    EXPECT_EQ(channelAssignment(text), std::nullopt) << text;
  }
}

class ChannelsCommandRun : public testing::Test {
 protected:
  int publish(const std::string& group, const std::string& subgroup,
              std::vector<std::string> assignments) {
    return run(
        {Action::kPublish, /*asJSON=*/false, group, subgroup, std::move(assignments)});
  }
  int list(const std::string& group = "", bool asJSON = false) {
    return run({Action::kList, asJSON, group, /*subgroup=*/"", {}});
  }
  int run(const ChannelsCommand& command) {
    out_.str("");
    err_.str("");
    return runChannels(command, directory_ / "channels", out_, err_);
  }

  const TemporaryDirectory directory_;
  std::ostringstream out_;
  std::ostringstream err_;
};

TEST_F(ChannelsCommandRun, ListsWhatWasPublished) {
  EXPECT_EQ(publish("Speaker", "Stats", {"frames=5", "underruns=-1"}), 0);
  EXPECT_EQ(publish("", "QDL", {"x=1"}), 0);
  EXPECT_EQ(list(), 0);
  EXPECT_EQ(out_.str(), "- QDL\n  x 1\nSpeaker Stats\n  frames 5\n  underruns -1\n");
  EXPECT_EQ(list("Speaker"), 0);
  EXPECT_EQ(out_.str(), "Speaker Stats\n  frames 5\n  underruns -1\n");
}

TEST_F(ChannelsCommandRun, SetsNamedCountersAndKeepsOthers) {
  publish("Speaker", "Stats", {"frames=5", "underruns=1"});
  publish("Speaker", "Stats", {"frames=3"});
  list();
  EXPECT_EQ(out_.str(), "Speaker Stats\n  frames 3\n  underruns 1\n");
}

TEST_F(ChannelsCommandRun, ListsAsJSON) {
  publish("Speaker", "", {"frames=9223372036854775807"});
  EXPECT_EQ(list("", /*asJSON=*/true), 0);
  EXPECT_EQ(nlohmann::json::parse(out_.str()),
            nlohmann::json::parse(R"([{"group": "Speaker", "subgroup": "",
                "counters": {"frames": 9223372036854775807}}])"));
}

TEST_F(ChannelsCommandRun, ListsNothingWhereNothingIsPublished) {
  EXPECT_EQ(list(), 0);
  EXPECT_EQ(out_.str(), "");
  EXPECT_EQ(list("", /*asJSON=*/true), 0);
  EXPECT_EQ(out_.str(), "[]\n");
}

TEST_F(ChannelsCommandRun, ListsTheRestWhenAFileIsDamaged) {
  publish("Speaker", "Stats", {"frames=5"});
  directory_.write("channels/Speaker.Bad", "junk");
  EXPECT_EQ(list(), 1);
  EXPECT_EQ(out_.str(), "Speaker Stats\n  frames 5\n");
  EXPECT_NE(err_.str().find("Speaker.Bad"), std::string::npos);
}

TEST_F(ChannelsCommandRun, PublishesNothingOfAWrongLine) {
  EXPECT_EQ(publish("Speaker", "Stats", {"frames=5", "nonsense"}), 2);
  EXPECT_NE(err_.str().find("nonsense"), std::string::npos);
  EXPECT_EQ(publish("Speaker", "Stats", {}), 2);
  EXPECT_EQ(publish(std::string(40, 'x'), "Stats", {"a=1"}), 2);
  EXPECT_FALSE(std::filesystem::exists(directory_ / "channels/Speaker.Stats"));
}

TEST_F(ChannelsCommandRun, FailsWhereItCannotWrite) {
  directory_.write("channels", "");
  EXPECT_EQ(publish("Speaker", "Stats", {"frames=5"}), 1);
  EXPECT_NE(err_.str(), "");
}

}  // namespace
}  // namespace ostrel
