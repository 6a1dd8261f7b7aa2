// How many replies a client may leave unread while the others of its user do so too.
#include <gtest/gtest.h>

#include <optional>
#include <string>

#include "platform/linux/PeerChannelTestSupport.h"

namespace ostrel {
namespace {

class UnreadReplies : public testing_support::ChannelsOfAUser {
 protected:
  static constexpr std::size_t kMost = 100'000;
  static constexpr std::size_t kMostOfUser = 2000;

  UnreadReplies() : ChannelsOfAUser(kMost, limitsOfUser()) {}

  static UserAccount::Limits limitsOfUser() {
    UserAccount::Limits limits = kLimitsOfUser;
    limits.unreadBytes = kMostOfUser;
    return limits;
  }
  static void leaveUnread(PeerChannel& channel, std::size_t bytes) {
    channel.reply(1, ErrorObject{"", 0, std::string(bytes, 'x')});
  }
  /// Replies until as many bytes are unread, to the byte.
  static void fill(PeerChannel& channel, std::size_t bytes) {
    constexpr std::size_t kAround = 300;
    leaveUnread(channel, bytes - channel.unreadBytes() - kAround);
    const std::size_t bare = [] {
      std::string frame;
      wire::appendReply(frame, 1, ErrorObject{"", 0, std::string(kAround / 2, 'x')});
      return frame.size() - kAround / 2;
    }();
    const std::size_t left = bytes - channel.unreadBytes();
    leaveUnread(channel, left / 2 - bare);
    leaveUnread(channel, bytes - channel.unreadBytes() - bare);
  }

  PeerChannel channel_ = makeChannel(1);
};

TEST_F(UnreadReplies, OfOthersLeaveAClientItsRoomUpToTheLimitOfTheirUser) {
  for (const std::size_t unread : {kMostOfUser - 1, kMostOfUser, kMostOfUser + 1}) {
    std::optional<PeerChannel> other(std::in_place, 2, waker_, user_, limits_);
    fill(*other, unread);
    ASSERT_EQ(other->unreadBytes(), unread);
    EXPECT_EQ(channel_.mostUnreadBytes(),
              unread > kMostOfUser ? limits::kUnreadReplyBytesInNeed : kMost);
    other.reset();
    EXPECT_EQ(channel_.mostUnreadBytes(), kMost);
  }
}

TEST_F(UnreadReplies, BeyondItAreFewForEachClient) {
  PeerChannel other = makeChannel(2);
  leaveUnread(other, 3000);
  for (const std::size_t more :
       {limits::kUnreadReplyBytesInNeed - 1, limits::kUnreadReplyBytesInNeed,
        limits::kUnreadReplyBytesInNeed + 1}) {
    PeerChannel channel = makeChannel(3);
    fill(channel, limits::kUnreadReplyBytesInNeed - 1000);
    ASSERT_FALSE(channel.hasTooManyUnread());
    leaveUnread(channel, 500);
    fill(channel, more);
    EXPECT_EQ(channel.hasTooManyUnread(), more > limits::kUnreadReplyBytesInNeed);
  }
}

TEST_F(UnreadReplies, ThatAreDroppedCountNoMore) {
  leaveUnread(channel_, 3000);
  EXPECT_EQ(channel_.mostUnreadBytes(), limits::kUnreadReplyBytesInNeed);
  channel_.close();
  EXPECT_EQ(channel_.mostUnreadBytes(), kMost);
}

}  // namespace
}  // namespace ostrel
