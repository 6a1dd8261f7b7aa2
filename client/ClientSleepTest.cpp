#include "client/ClientSleep.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <array>
#include <chrono>
#include <string>

namespace ostrel::reporting {
namespace {

using Clock = ClientSleep::Clock;
using std::chrono::hours;
using std::chrono::milliseconds;

constexpr int kNoSocket = -1;

class ClientSleepTest : public testing::Test {
 protected:
  void SetUp() override {
    int ends[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK, 0, ends), 0);
    ours_ = OwnedDescriptor(ends[0]);
    theirs_ = OwnedDescriptor(ends[1]);
    ASSERT_TRUE(sleep_.watch(ours_.get()));
  }

  /// Whether a wait that need not end within the hour does.
  bool ends(bool wantsToWrite = false) {
    const auto limit = Clock::now() + hours(1);
    sleep_.wait(limit, ours_.get(), wantsToWrite);
    return Clock::now() < limit;
  }
  /// Whether a wait ends with its time, and not before.
  bool endsWithItsTime(bool wantsToWrite = false) {
    const auto time = Clock::now() + milliseconds(1);
    sleep_.wait(time, ours_.get(), wantsToWrite);
    return Clock::now() >= time;
  }
  void fillSocket() {
    const std::string bytes(4096, 'x');
    while (::send(ours_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL) > 0) {
    }
  }
  void emptySocket(int socket) {
    std::array<char, 4096> bytes;
    while (::recv(socket, bytes.data(), bytes.size(), MSG_DONTWAIT) > 0) {
    }
  }

  OwnedDescriptor ours_;
  OwnedDescriptor theirs_;
  ClientSleep sleep_ = std::move(*ClientSleep::make().value);
};

TEST_F(ClientSleepTest, EndsAtOnceWhenItWasWokenBefore) {
  sleep_.wake();
  EXPECT_TRUE(ends());
}

TEST_F(ClientSleepTest, EndsOnceForManyWakes) {
  for (int i = 0; i < 1000; ++i) sleep_.wake();
  EXPECT_TRUE(ends());
  EXPECT_TRUE(endsWithItsTime());
  sleep_.wake();
  EXPECT_TRUE(ends());
}

TEST_F(ClientSleepTest, DoesNotWaitForATimeThatIsOver) {
  sleep_.wait(Clock::time_point::min(), ours_.get(), /*wantsToWrite=*/false);
  sleep_.wait(Clock::time_point(), ours_.get(), /*wantsToWrite=*/false);
  sleep_.wait(Clock::now(), ours_.get(), /*wantsToWrite=*/false);
}

TEST_F(ClientSleepTest, EndsWithItsTimeWithoutASocket) {
  const auto time = Clock::now() + milliseconds(1);
  sleep_.wait(time, kNoSocket, /*wantsToWrite=*/false);
  EXPECT_GE(Clock::now(), time);
}

TEST_F(ClientSleepTest, EndsAsLongAsThereAreBytes) {
  ASSERT_EQ(::send(theirs_.get(), "xy", 2, MSG_NOSIGNAL), 2);
  EXPECT_TRUE(ends());
  char byte;
  ASSERT_EQ(::recv(ours_.get(), &byte, 1, MSG_DONTWAIT), 1);
  EXPECT_TRUE(ends());
  emptySocket(ours_.get());
  EXPECT_TRUE(endsWithItsTime());
}

TEST_F(ClientSleepTest, EndsForAHangUpBehindBytesThatWereRead) {
  ASSERT_EQ(::send(theirs_.get(), "x", 1, MSG_NOSIGNAL), 1);
  theirs_.reset();
  EXPECT_TRUE(ends());
  char byte;
  ASSERT_EQ(::recv(ours_.get(), &byte, 1, MSG_DONTWAIT), 1);
  EXPECT_TRUE(ends());
}

TEST_F(ClientSleepTest, EndsForRoomOnlyWhileItIsWanted) {
  EXPECT_TRUE(endsWithItsTime());
  EXPECT_TRUE(ends(/*wantsToWrite=*/true));
  fillSocket();
  EXPECT_TRUE(endsWithItsTime(/*wantsToWrite=*/true));
  emptySocket(theirs_.get());
  EXPECT_TRUE(ends(/*wantsToWrite=*/true));
  EXPECT_TRUE(endsWithItsTime());
}

TEST_F(ClientSleepTest, ForgetsASocket) {
  ASSERT_EQ(::send(theirs_.get(), "x", 1, MSG_NOSIGNAL), 1);
  sleep_.forget(ours_.get());
  EXPECT_TRUE(endsWithItsTime());
  ASSERT_TRUE(sleep_.watch(ours_.get()));
  EXPECT_TRUE(ends());
}

// A wait for room is the socket's, and not that of the next one.
TEST_F(ClientSleepTest, WatchesAnotherSocketAnew) {
  EXPECT_TRUE(ends(/*wantsToWrite=*/true));
  sleep_.forget(ours_.get());
  SetUp();
  EXPECT_TRUE(endsWithItsTime());
  EXPECT_TRUE(ends(/*wantsToWrite=*/true));
}

TEST_F(ClientSleepTest, LeavesALaterTimeToTheTimerThatIsSet) {
  const auto first = Clock::now() + hours(1);
  sleep_.wake();
  sleep_.wait(first, ours_.get(), /*wantsToWrite=*/false);
  EXPECT_EQ(sleep_.endOfWait(first + hours(1)), first);
  EXPECT_EQ(sleep_.endOfWait(Clock::time_point::max()), first);
  EXPECT_EQ(sleep_.endOfWait(first - milliseconds(1)), first - milliseconds(1));
  EXPECT_TRUE(endsWithItsTime()) << "an earlier one is set";
  EXPECT_EQ(sleep_.endOfWait(Clock::time_point::max()), Clock::time_point::max())
      << "it has gone off";
}

}  // namespace
}  // namespace ostrel::reporting
