#include "platform/linux/PeerChannel.h"

#include <gtest/gtest.h>

#include <string>

#include "platform/linux/PeerChannelTestSupport.h"

namespace ostrel {
namespace {

constexpr std::size_t kMostUnread = 1000;

class PeerChannelTest : public testing_support::ChannelsOfAUser {
 protected:
  PeerChannelTest() : ChannelsOfAUser(kMostUnread) {}

  /// A reply whose frame has `size` bytes.
  static std::string textForFrameOf(std::size_t size) {
    std::string frame;
    wire::appendReply(frame, 1, ErrorObject{"", 0, ""});
    const std::size_t bare = frame.size();
    // From 256 bytes on, the text's length takes two bytes more.
    std::string text(size - bare - 2, 'x');
    frame.clear();
    wire::appendReply(frame, 1, ErrorObject{"", 0, text});
    EXPECT_EQ(frame.size(), size);
    return text;
  }

  void replyWithFrameOf(std::size_t size) {
    channel_.reply(1, ErrorObject{"", 0, textForFrameOf(size)});
  }

  PeerChannel channel_ = makeChannel(1);
};

using PeerChannelReplies = PeerChannelTest;
using PeerChannelBudget = PeerChannelTest;

TEST_F(PeerChannelReplies, StayUnreadUpToTheLimit) {
  for (const std::size_t second : {499, 500}) {
    PeerChannel channel = makeChannel(1);
    channel.reply(1, ErrorObject{"", 0, textForFrameOf(500)});
    channel.reply(1, ErrorObject{"", 0, textForFrameOf(second)});
    EXPECT_FALSE(channel.hasTooManyUnread()) << second;
    EXPECT_EQ(channel.unreadBytes(), 500 + second);
  }
  replyWithFrameOf(500);
  replyWithFrameOf(501);
  EXPECT_TRUE(channel_.hasTooManyUnread());
  EXPECT_EQ(channel_.unreadBytes(), 500u);
}

TEST_F(PeerChannelReplies, MayBeLargerAloneThanTheLimit) {
  replyWithFrameOf(kMostUnread + 500);
  EXPECT_FALSE(channel_.hasTooManyUnread());
}

TEST_F(PeerChannelBudget, IsTheConnectionsOwn) {
  channel_.charge(60);
  EXPECT_FALSE(channel_.isOverBudget());
  channel_.charge(1);
  EXPECT_TRUE(channel_.isOverBudget());
  channel_.relieve(1);
  EXPECT_FALSE(channel_.isOverBudget());
}

TEST_F(PeerChannelBudget, IsThatOfAllConnectionsOfTheUserToo) {
  PeerChannel other = makeChannel(2);
  channel_.charge(50);
  other.charge(50);
  EXPECT_FALSE(other.isOverBudget());
  other.charge(1);
  EXPECT_TRUE(other.isOverBudget());
  EXPECT_TRUE(channel_.isOverBudget()) << "the user's is used up for all";
  channel_.relieve(50);
  EXPECT_FALSE(other.isOverBudget());
}

TEST_F(PeerChannelBudget, ReservesMoreWhereConnectionsAreFew) {
  UserAccount::Limits limits{/*queuedBytes=*/100, /*sessions=*/10, /*keptBytes=*/500};
  limits.reservedQueuedBytes = 40;
  const auto user = std::make_shared<UserAccount>(limits, service_);
  user->queued().take(101);
  const auto mayHave = [&](std::size_t connections, std::size_t bytes) {
    user->setConnections(connections);
    PeerChannel channel(1, std::make_shared<LoopWaker>(), user,
                        PeerChannel::Limits{/*queuedBytes=*/60, kMostUnread,
                                            /*reservedQueuedBytes=*/5,
                                            /*mostReservedBytes=*/20});
    channel.charge(bytes);
    return !channel.isOverBudget();
  };
  EXPECT_TRUE(mayHave(/*connections=*/4, /*bytes=*/10));
  EXPECT_FALSE(mayHave(/*connections=*/4, /*bytes=*/11));
  EXPECT_TRUE(mayHave(/*connections=*/1, /*bytes=*/20)) << "that is the most";
  EXPECT_FALSE(mayHave(/*connections=*/1, /*bytes=*/21));
  EXPECT_TRUE(mayHave(/*connections=*/100, /*bytes=*/5)) << "that is the least";
  EXPECT_FALSE(mayHave(/*connections=*/100, /*bytes=*/6));
}

TEST_F(PeerChannelBudget, IsGivenBackWithTheConnectionsRequests) {
  {
    PeerChannel other = makeChannel(2);
    other.chargeRequest(40);
  }
  EXPECT_EQ(user_->queued().used(), 0u);
}

TEST_F(PeerChannelBudget, KeepsEntriesInTheUsersName) {
  EXPECT_TRUE(channel_.keep(500));
  EXPECT_FALSE(channel_.keep(1));
  channel_.discard(500);
  EXPECT_EQ(user_->keptBytes(), 0u);
}

}  // namespace
}  // namespace ostrel
