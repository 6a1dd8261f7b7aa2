#include "platform/linux/EtcDeviceInfo.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdlib>
#include <map>

#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using testing_support::CapturedLog;
using testing_support::TemporaryDirectory;
using Variables = std::map<std::string, std::string, std::less<>>;

TEST(ParseEnvironmentFile, ReadsAssignments) {
  EXPECT_EQ(parseEnvironmentFile("A=1\nB_2=two\n_C=\nD=x"),
            (Variables{{"A", "1"}, {"B_2", "two"}, {"_C", ""}, {"D", "x"}}));
}

TEST(ParseEnvironmentFile, PassesOverCommentsAndWhatIsNoAssignment) {
  EXPECT_EQ(parseEnvironmentFile("# A=1\n; B=2\n  # C=3\n\nD\n1E=5\nF G=6\n=7\nH=8\n"),
            (Variables{{"H", "8"}}));
}

TEST(ParseEnvironmentFile, TakesTheLaterOfTwoLines) {
  EXPECT_EQ(parseEnvironmentFile("A=1\nA=2\n"), (Variables{{"A", "2"}}));
}

TEST(ParseEnvironmentFile, CutsBlanksAroundAValue) {
  EXPECT_EQ(parseEnvironmentFile("  A =  one two \t\r\nB=\" x \"  \n"),
            (Variables{{"A", "one two"}, {"B", " x "}}));
}

TEST(ParseEnvironmentFile, ReadsQuotes) {
  EXPECT_EQ(parseEnvironmentFile(R"(A="a \"b\" \$ \` \\ \n 'c'"
B='a "b" \n $'
C=a\ b\"c
D="one"' two'three
)"),
            (Variables{{"A", R"(a "b" $ ` \ \n 'c')"},
                       {"B", R"(a "b" \n $)"},
                       {"C", "a b\"c"},
                       {"D", "one twothree"}}));
}

TEST(ParseEnvironmentFile, KeepsAQuotedEndOfLine) {
  EXPECT_EQ(parseEnvironmentFile("A=\"one\ntwo\"\nB=a\\\nb\n"),
            (Variables{{"A", "one\ntwo"}, {"B", "ab"}}));
}

TEST(ParseEnvironmentFile, EndsAnOpenQuoteWithTheFile) {
  EXPECT_EQ(parseEnvironmentFile("A=\"one\nB=2"), (Variables{{"A", "one\nB=2"}}));
  EXPECT_EQ(parseEnvironmentFile("A=one\\"), (Variables{{"A", "one\\"}}));
}

class EtcDeviceInfoFiles : public testing::Test {
 protected:
  std::string missing() const { return directory_ / "missing"; }

  std::optional<Value> internalBuild(const std::string& machineInfo,
                                     const std::string& osRelease) const {
    return EtcDeviceInfo({directory_.write("machine-info", machineInfo),
                          {directory_.write("os-release", osRelease)}})
        .answer("InternalBuild");
  }

  std::int32_t classOfChassis(const std::string& chassis) const {
    const std::string file =
        directory_.write("machine-info", "CHASSIS=" + chassis + "\n");
    return EtcDeviceInfo({file, {missing()}}).deviceClass();
  }

  const TemporaryDirectory directory_;
};

TEST_F(EtcDeviceInfoFiles, TellAnInternalBuildByDeployment) {
  EXPECT_EQ(internalBuild("DEPLOYMENT=development\n", ""), Value(true));
  EXPECT_EQ(internalBuild("DEPLOYMENT=\"development\"\n", ""), Value(true));
  EXPECT_EQ(internalBuild("DEPLOYMENT=production\n", ""), Value(false));
  EXPECT_EQ(internalBuild("DEPLOYMENT=Development\n", ""), Value(false));
}

TEST_F(EtcDeviceInfoFiles, TellAnInternalBuildByVariant) {
  EXPECT_EQ(internalBuild("", "VARIANT_ID=internal\n"), Value(true));
  EXPECT_EQ(internalBuild("DEPLOYMENT=production\n", "VARIANT_ID='internal'\n"),
            Value(true));
  EXPECT_EQ(internalBuild("", "VARIANT_ID=server\n"), Value(false));
  EXPECT_EQ(internalBuild("VARIANT_ID=internal\n", "DEPLOYMENT=development\n"),
            Value(false));
}

TEST_F(EtcDeviceInfoFiles, GiveNoAnswerWhenThereAreNone) {
  const EtcDeviceInfo info({missing(), {missing(), missing()}});
  EXPECT_EQ(info.answer("InternalBuild"), std::nullopt);
  EXPECT_EQ(info.deviceClass(), 0);
}

TEST_F(EtcDeviceInfoFiles, GiveNoAnswerToOtherQuestions) {
  const EtcDeviceInfo info(
      {directory_.write("machine-info", "DEPLOYMENT=development\n"), {missing()}});
  EXPECT_EQ(info.answer("DEPLOYMENT"), std::nullopt);
  EXPECT_EQ(info.answer(""), std::nullopt);
}

TEST_F(EtcDeviceInfoFiles, NameTheDeviceClass) {
  EXPECT_EQ(classOfChassis("handset"), 1);
  EXPECT_EQ(classOfChassis("tablet"), 2);
  EXPECT_EQ(classOfChassis("laptop"), 3);
  EXPECT_EQ(classOfChassis("desktop"), 4);
  EXPECT_EQ(classOfChassis("convertible"), 5);
  EXPECT_EQ(classOfChassis("watch"), 6);
  EXPECT_EQ(classOfChassis("embedded"), 7);
  EXPECT_EQ(classOfChassis("server"), 0);
  EXPECT_EQ(classOfChassis(""), 0);
}

TEST_F(EtcDeviceInfoFiles, FallBackToTheSecondOsRelease) {
  const EtcDeviceInfo info(
      {missing(), {missing(), directory_.write("os-release", "VARIANT_ID=internal\n")}});
  EXPECT_EQ(info.answer("InternalBuild"), Value(true));
}

TEST_F(EtcDeviceInfoFiles, AreReadOnceAndThroughLinks) {
  const std::string file = directory_.write("os-release", "VARIANT_ID=internal\n");
  std::filesystem::create_symlink(file, directory_ / "link");
  const EtcDeviceInfo info({missing(), {directory_ / "link"}});
  EXPECT_EQ(info.answer("InternalBuild"), Value(true));
  std::filesystem::remove(file);
  EXPECT_EQ(info.answer("InternalBuild"), Value(true));
}

TEST_F(EtcDeviceInfoFiles, ThatCannotBeReadCountAsMissingWithAnErrorLogged) {
  const std::string pipe = directory_ / "pipe";
  ASSERT_EQ(::mkfifo(pipe.c_str(), 0600), 0);
  const std::string large =
      directory_.write("large", std::string(EtcDeviceInfo::kMostFileBytes + 1, '#'));
  for (const std::string& path : {pipe, directory_.path(), large}) {
    const CapturedLog log;
    const EtcDeviceInfo info({path, {missing()}});
    EXPECT_EQ(info.answer("InternalBuild"), std::nullopt);
    EXPECT_EQ(log.lines(LogLevel::kError).size(), 1u) << path;
  }
}

TEST_F(EtcDeviceInfoFiles, OfTheLargestSizeAreRead) {
  std::string text = "DEPLOYMENT=development\n#";
  text.resize(EtcDeviceInfo::kMostFileBytes, 'x');
  EXPECT_EQ(internalBuild(text, ""), Value(true));
}

TEST_F(EtcDeviceInfoFiles, AreNamedByTheEnvironment) {
  ::setenv("SYSTEMD_ETC_MACHINE_INFO", "/m", /*replace=*/1);
  ::setenv("SYSTEMD_OS_RELEASE", "/o", /*replace=*/1);
  EXPECT_EQ(EtcDeviceInfo::systemFiles().machineInfo, "/m");
  EXPECT_EQ(EtcDeviceInfo::systemFiles().osRelease, std::vector<std::string>{"/o"});
  ::unsetenv("SYSTEMD_ETC_MACHINE_INFO");
  ::unsetenv("SYSTEMD_OS_RELEASE");
  EXPECT_EQ(EtcDeviceInfo::systemFiles().machineInfo, "/etc/machine-info");
  EXPECT_EQ(EtcDeviceInfo::systemFiles().osRelease,
            (std::vector<std::string>{"/etc/os-release", "/usr/lib/os-release"}));
}

}  // namespace
}  // namespace ostrel
