#include "platform/linux/PeerChannel.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <memory>
#include <span>
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

/// The user's others have all that they may, and 40 bytes are reserved.
class PeerChannelReserve : public testing_support::ChannelsOfAUser {
 protected:
  static UserAccount::Limits limitsOfUser() {
    UserAccount::Limits limits = kLimitsOfUser;
    limits.reservedQueuedBytes = 40;
    return limits;
  }
  PeerChannelReserve() : ChannelsOfAUser(kMostUnread, limitsOfUser()) {
    user_->queued().take(101);
  }

  std::shared_ptr<ProcessAccount> makeProcess() const {
    return std::make_shared<ProcessAccount>(user_);
  }
  std::unique_ptr<PeerChannel> connect(const std::shared_ptr<ProcessAccount>& process) {
    return std::make_unique<PeerChannel>(
        1, waker_, user_,
        PeerChannel::Limits{/*queuedBytes=*/60, kMostUnread, /*reservedQueuedBytes=*/5,
                            /*mostReservedBytes=*/20},
        process);
  }
  /// What a connection may have under way beside `count` that have something.
  template <typename MakeProcess>
  std::size_t mostBeside(std::size_t count, MakeProcess processOfOther) {
    std::vector<std::unique_ptr<PeerChannel>> others;
    for (std::size_t i = 0; i < count; ++i) {
      others.push_back(connect(processOfOther()));
      others.back()->charge(1);
    }
    const auto channel = connect(makeProcess());
    std::size_t bytes = 0;
    for (; !channel->isOverBudget(); ++bytes) channel->charge(1);
    return bytes - 1;
  }
};

TEST_F(PeerChannelReserve, IsMoreWhereProcessesAreFew) {
  const auto each = [this] { return makeProcess(); };
  EXPECT_EQ(mostBeside(0, each), 20u) << "that is the most";
  EXPECT_EQ(mostBeside(1, each), 20u);
  EXPECT_EQ(mostBeside(3, each), 10u);
  EXPECT_EQ(mostBeside(99, each), 5u) << "that is the least";
}

TEST_F(PeerChannelReserve, IsNoMoreForAProcessWithManyConnections) {
  const auto process = makeProcess();
  EXPECT_EQ(mostBeside(99, [&] { return process; }), 20u);
}

TEST_F(PeerChannelReserve, IsSharedByTheConnectionsOfAProcess) {
  const auto process = makeProcess();
  const auto one = connect(process);
  one->charge(20);
  EXPECT_FALSE(one->isOverBudget());
  const auto two = connect(process);
  two->charge(10);
  const auto three = connect(process);
  EXPECT_FALSE(one->isOverBudget()) << "this one has nothing under way";
  three->charge(1);
  EXPECT_TRUE(one->isOverBudget()) << "13 for each";
  EXPECT_FALSE(two->isOverBudget());
  three->relieve(1);
  EXPECT_FALSE(one->isOverBudget());
}

// As half a frame is read.
TEST_F(PeerChannelReserve, IsNotTakenFromAProcessWhoseReadsChargeNothing) {
  const auto process = makeProcess();
  const std::shared_ptr<PeerChannel> half = connect(process);
  const std::uint8_t byte = 0;
  for (int i = 0; i < 3; ++i) {
    ValueBuffer::copyOfInput(std::span(&byte, 1).first(0), half);
  }
  EXPECT_EQ(mostBeside(0, [&] { return process; }), 20u);
}

TEST_F(PeerChannelReserve, LetsOneLargeRequestAfterTheOther) {
  const auto small = connect(makeProcess());
  const auto one = connect(makeProcess());
  const auto two = connect(makeProcess());
  const auto take = [](PeerChannel& channel, std::size_t cost) {
    channel.charge(cost);
    if (cost > 20) channel.noteLarge();
  };
  take(*one, 21);
  EXPECT_FALSE(two->mustWaitForLarge(/*cost=*/20));
  EXPECT_FALSE(two->isOverBudget());
  EXPECT_TRUE(two->mustWaitForLarge(/*cost=*/21));
  EXPECT_TRUE(two->isOverBudget()) << "it has nothing under way, but asks for much";
  EXPECT_TRUE(two->awaitBudget());
  take(*small, 1);
  EXPECT_FALSE(small->isOverBudget());

  LoopWaker::Work work;
  waker_->take(work);
  one->relieve(21);
  waker_->take(work);
  EXPECT_TRUE(work.hasBudgetEased);
  EXPECT_FALSE(two->isOverBudget());
  EXPECT_FALSE(two->mustWaitForLarge(/*cost=*/21));
}

TEST_F(PeerChannelReserve, TellsLargeRequestsByTheMostThatIsReserved) {
  const auto other = connect(makeProcess());
  other->charge(1);
  other->noteLarge();
  const auto channel = connect(makeProcess());
  for (const std::size_t cost : {19u, 20u, 21u}) {
    EXPECT_EQ(channel->mustWaitForLarge(cost), cost > 20) << cost;
  }
}

TEST_F(PeerChannelReserve, HoldsNobodyBackForLargeRequestsWhereThereIsRoom) {
  user_->queued().give(101);
  const auto one = connect(makeProcess());
  const auto two = connect(makeProcess());
  for (const auto& channel : {one.get(), two.get()}) {
    channel->charge(21);
    channel->noteLarge();
  }
  EXPECT_FALSE(one->isOverBudget());
  EXPECT_FALSE(two->isOverBudget());
  EXPECT_FALSE(two->mustWaitForLarge(/*cost=*/21));
}

TEST_F(PeerChannelReserve, EndsALargeRequestWithItsConnection) {
  {
    const auto channel = connect(makeProcess());
    channel->charge(21);
    channel->noteLarge();
    EXPECT_TRUE(user_->hasLargeRequest());
  }
  EXPECT_FALSE(user_->hasLargeRequest());
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
