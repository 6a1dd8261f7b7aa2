#include "platform/linux/MisuseLog.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <initializer_list>
#include <string_view>

#include "platform/linux/Limits.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using namespace std::chrono_literals;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::SizeIs;
using testing_support::CapturedLog;
using Kind = MisuseLog::Kind;

const MisuseLog::Clock::time_point kNow{std::chrono::hours(1)};

struct Misuse {
  std::uint32_t user;
  Kind kind;
  std::string_view reason;
};

void noteAll(MisuseLog& log, std::initializer_list<Misuse> all) {
  for (const Misuse& one : all) log.note(one.user, one.kind, one.reason, kNow);
}

TEST(MisuseLog, SaysWhoWhatAndWhy) {
  const CapturedLog log;
  MisuseLog misuse;
  noteAll(misuse, {{1000, Kind::kCutOff, "a frame is empty"},
                   {1001, Kind::kConnectionRefused, "there are too many"},
                   {1002, Kind::kSessionRefused, "there are too many"}});
  EXPECT_THAT(
      log.lines(LogLevel::kError),
      ElementsAre(
          HasSubstr("a client of user 1000 is cut off: a frame is empty"),
          HasSubstr("a client of user 1001 is not let in: there are too many"),
          HasSubstr("a client of user 1002 gets no session: there are too many")));
}

TEST(MisuseLog, LogsAKindOfAUserAgainAfterTheInterval) {
  const CapturedLog log;
  MisuseLog misuse;
  const auto noteAt = [&](std::chrono::nanoseconds time) {
    misuse.note(1000, Kind::kCutOff, "a frame is empty", kNow + time);
  };
  noteAt(0ns);
  noteAt(limits::kMisuseLogInterval - 1ns);
  EXPECT_THAT(log.lines(LogLevel::kError), SizeIs(1));
  noteAt(limits::kMisuseLogInterval);
  EXPECT_THAT(log.lines(LogLevel::kError), SizeIs(2));
  noteAt(limits::kMisuseLogInterval + 1ns);
  EXPECT_THAT(log.lines(LogLevel::kError), SizeIs(2));
}

TEST(MisuseLog, KeepsUsersAndKindsApart) {
  const CapturedLog log;
  MisuseLog misuse;
  noteAll(misuse, {{1000, Kind::kCutOff, "x"},
                   {1001, Kind::kCutOff, "x"},
                   {1000, Kind::kSessionRefused, "x"},
                   {1000, Kind::kCutOff, "y"}});
  EXPECT_THAT(log.lines(LogLevel::kError), SizeIs(3));
}

TEST(MisuseLog, CountsAllAndTellsOfEach) {
  const CapturedLog log;
  int told = 0;
  MisuseLog misuse([&told] { ++told; });
  for (int i = 0; i < 5; ++i) noteAll(misuse, {{1000, Kind::kSessionRefused, "x"}});
  noteAll(misuse, {{1000, Kind::kConnectionRefused, "x"}});
  EXPECT_EQ(misuse.counts(), (MisuseLog::Counts{0, 1, 5}));
  EXPECT_EQ(told, 6);
}

TEST(MisuseLog, TellsOfUsesOfOthersSessionsOnceAnIntervalAndCountsThem) {
  const CapturedLog log;
  int told = 0;
  MisuseLog misuse([&told] { ++told; });
  const auto noteAt = [&](std::chrono::nanoseconds time, std::uint64_t count) {
    misuse.noteUses(1000, count, {"stops", ReporterID{-7}, 1001}, kNow + time);
  };
  noteAt(0ns, 3);
  noteAt(limits::kMisuseLogInterval - 1ns, 40);
  EXPECT_THAT(log.lines(LogLevel::kDefault),
              ElementsAre(HasSubstr("a client of user 1000 uses a session of another "
                                    "user: it stops -7, which a client of user 1001 "
                                    "made")));
  noteAt(limits::kMisuseLogInterval, 1);
  EXPECT_THAT(log.lines(LogLevel::kDefault), SizeIs(2));
  EXPECT_EQ(misuse.counts(), (MisuseLog::Counts{0, 0, 0, 0, 44}));
  EXPECT_EQ(told, 3);
}

TEST(MisuseLog, ForgetsUsersWhoseTimeIsOver) {
  constexpr std::uint32_t kUsers = 1000;
  const CapturedLog log;
  MisuseLog misuse;
  for (std::uint32_t user = 0; user < kUsers; ++user) {
    noteAll(misuse, {{user, Kind::kCutOff, "x"}, {user, Kind::kCutOff, "x"}});
  }
  EXPECT_EQ(misuse.heldBack(), kUsers);
  EXPECT_THAT(log.lines(LogLevel::kError), SizeIs(kUsers)) << "a line for each";
  // All of them again, and as many others: it looks through them on the way.
  for (std::uint32_t user = 0; user < 2 * kUsers; ++user) {
    misuse.note(user, Kind::kCutOff, "x", kNow + limits::kMisuseLogInterval);
  }
  EXPECT_THAT(log.lines(LogLevel::kError), SizeIs(3 * kUsers));
  for (std::uint32_t user = 0; user < 3 * kUsers; ++user) {
    misuse.note(user % 2, Kind::kSessionRefused, "x",
                kNow + 2 * limits::kMisuseLogInterval);
    misuse.note(3 * kUsers + user, Kind::kCutOff, "x",
                kNow + 2 * limits::kMisuseLogInterval);
  }
  EXPECT_EQ(misuse.heldBack(), 3 * kUsers + 2);
}

}  // namespace
}  // namespace ostrel
