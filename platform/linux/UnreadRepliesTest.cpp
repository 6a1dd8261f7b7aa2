// How many replies a client may leave unread while the others of its user do so too.
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <atomic>
#include <chrono>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/linux/PeerChannelTestSupport.h"
#include "platform/linux/UnixSocketIPCListenerTestSupport.h"

namespace ostrel {
namespace {

using testing_support::RawClient;

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

/// Clients of one user that read nothing, before a service that answers when the test
/// says so: while the listener's thread is stopped, so that nothing is written meanwhile.
class ListenerUnreadReplies : public testing_support::UnixSocketListener {
 protected:
  ListenerUnreadReplies() {
    // However long a test takes, nobody has waited for a client.
    now = [] { return PeerConnection::Clock::time_point(std::chrono::hours(1)); };
    serve();
  }
  ~ListenerUnreadReplies() override { stop(); }

  bool listenerShouldAcceptNewConnection(
      IPCListener&, const std::shared_ptr<IPCConnection>& connection) override {
    connection->setExportedObject(answering);
    connection->resume();
    return true;
  }

  /// The number of a new client with two requests under way.
  std::size_t connect() {
    clients.push_back(std::make_unique<RawClient>(path));
    const std::size_t number = clients.size() - 1;
    wire::Request message = testing_support::messageRequest(1, "x");
    message.category = MessageCategory{static_cast<std::uint32_t>(number)};
    for (int i = 0; i < 2; ++i) clients.back()->send(message);
    EXPECT_TRUE(
        testing_support::eventually([&] { return answering->waiting(number) == 2; }));
    return number;
  }
  void stopListener() {
    stopper.emplace(path);
    stopper->send(testing_support::createRequest(1, 7));
    answering->place.waitUntilStopped();
  }
  void letListenerGo() { answering->place.letGo(); }

  /// One reply, or two with so many bytes together.
  void answerOnce(std::size_t client, std::size_t bytes) {
    answering->reply(client, bytes);
  }
  void answer(std::size_t client, std::size_t bytes) {
    answerOnce(client, bytes / 2);
    answerOnce(client, bytes - bytes / 2);
  }
  /// Whether it gets replies with so many bytes. Otherwise it is cut off before or told
  /// that it is.
  bool gets(std::size_t client, std::size_t bytes) {
    while (bytes != 0) {
      const auto item = clients[client]->receive();
      if (!item || item->size() + wire::kFrameHeaderSize > bytes) return false;
      bytes -= item->size() + wire::kFrameHeaderSize;
    }
    return true;
  }
  std::size_t cutOff() const {
    return misuse->counts()[static_cast<std::size_t>(MisuseLog::Kind::kCutOff)];
  }

  class Service final : public testing_support::RecordingService {
   public:
    void createReportingSession(ReporterID, BoolReply reply) override {
      place.stopHere();
      reply(true);
    }
    void sendMessage(Dictionary, MessageCategory category, MessageType,
                     std::optional<ReporterIDs>, ErrorReply reply) override {
      const std::lock_guard lock(mutex_);
      replies_[static_cast<std::size_t>(category)].push_back(std::move(reply));
    }

    std::size_t waiting(std::size_t client) {
      const std::lock_guard lock(mutex_);
      return replies_[client].size();
    }
    void reply(std::size_t client, std::size_t frameBytes) {
      ErrorReply reply;
      {
        const std::lock_guard lock(mutex_);
        reply = std::move(replies_[client].front());
        replies_[client].pop_front();
      }
      reply(ErrorObject{"", 0, textForFrameOf(frameBytes)});
    }

    testing_support::StoppingPlace place;

   private:
    // A longer text has a longer head.
    static std::string textForFrameOf(std::size_t bytes) {
      for (std::size_t head = 0; head < 32; ++head) {
        std::string text(bytes - head, 'x');
        std::string frame;
        wire::appendReply(frame, 1, ErrorObject{"", 0, text});
        if (frame.size() == bytes) return text;
      }
      ADD_FAILURE() << "no frame has " << bytes << " bytes";
      return "";
    }

    std::mutex mutex_;
    std::map<std::size_t, std::deque<ErrorReply>> replies_;
  };

  const std::shared_ptr<Service> answering = std::make_shared<Service>();
  std::vector<std::unique_ptr<RawClient>> clients;
  std::optional<RawClient> stopper;
};

TEST_F(ListenerUnreadReplies, OfAClientAreTakenUpToItsLimit) {
  const std::size_t below = connect();
  const std::size_t at = connect();
  const std::size_t beyond = connect();

  stopListener();
  answer(below, limits::kUnreadReplyBytes - 1);
  answer(at, limits::kUnreadReplyBytes);
  answer(beyond, limits::kUnreadReplyBytes + 1);
  letListenerGo();

  EXPECT_TRUE(gets(below, limits::kUnreadReplyBytes - 1));
  EXPECT_TRUE(gets(at, limits::kUnreadReplyBytes));
  EXPECT_FALSE(gets(beyond, limits::kUnreadReplyBytes + 1));
  EXPECT_EQ(cutOff(), 1u);
}

/// By how much they are more than the limit.
class ListenerUnreadRepliesAround : public ListenerUnreadReplies,
                                    public testing::WithParamInterface<int> {
 protected:
  static std::size_t around(std::size_t limit) {
    return limit + static_cast<std::size_t>(GetParam());
  }
  /// Clients with so many bytes unread between them, each within its limit.
  void connectThoseWithMany() {
    for (std::size_t i = 0; i < kThoseWithMany; ++i) connect();
  }
  void answerThoseWithMany(std::size_t bytes) {
    for (std::size_t i = 0; i < kThoseWithMany; ++i) answer(i, bytes / kThoseWithMany);
    ASSERT_EQ(bytes % kThoseWithMany, 0u);
  }

  static constexpr std::size_t kThoseWithMany = 4;
};

TEST_P(ListenerUnreadRepliesAround, ThatOfTheUserLeaveAClientLittleBeyondIt) {
  constexpr std::size_t kFirst = 2 * limits::kUnreadReplyBytesInNeed;
  constexpr std::size_t kOthers = limits::kUnreadReplyBytesOfUser - kFirst;
  connectThoseWithMany();
  const std::size_t client = connect();

  stopListener();
  answerThoseWithMany(kOthers);
  // Alone it may be large; the next one finds what there is.
  answerOnce(client, around(kFirst));
  answerOnce(client, 100);
  letListenerGo();

  EXPECT_EQ(gets(client, around(kFirst) + 100), GetParam() <= 0);
  EXPECT_EQ(cutOff(), GetParam() <= 0 ? 0u : 1u);
}

TEST_P(ListenerUnreadRepliesAround, WhatAClientHasInNeedAreTakenUpToThat) {
  connectThoseWithMany();
  const std::size_t oneMore = connect();
  const std::size_t client = connect();

  stopListener();
  answerThoseWithMany(limits::kUnreadReplyBytesOfUser);
  answerOnce(oneMore, 100);
  answer(client, around(limits::kUnreadReplyBytesInNeed));
  letListenerGo();

  EXPECT_EQ(gets(client, around(limits::kUnreadReplyBytesInNeed)), GetParam() <= 0);
  EXPECT_EQ(cutOff(), GetParam() <= 0 ? 0u : 1u);
}

INSTANTIATE_TEST_SUITE_P(Each, ListenerUnreadRepliesAround, testing::Values(-1, 0, 1));

/// Clients that ask for all sessions, which is more than a socket holds, and do not read.
class UntakenReplies : public testing_support::UnixSocketListener {
 protected:
  static constexpr std::size_t kSessions = 1'000'000;
  static constexpr std::size_t kReply = 9 * kSessions;

  UntakenReplies() {
    service->setReporters(ReporterIDs(kSessions, ReporterID{INT64_MAX}));
    now = [this] { return PeerConnection::Clock::time_point(time_.load()); };
  }
  ~UntakenReplies() override { stop(); }

  void serveWithShareOf(std::size_t bytes) {
    ListenerLimits limits;
    limits.ofUser.unreadBytes = bytes;
    limits.unreadReplyBytes = limits.unreadReplyBytesToPause = 2 * kReply;
    // It is not to be crowded, nor are all users together.
    limits.ofUser.memory = 100 * kReply;
    limits.ofAll.fill(100 * kReply);
    serve(limits);
  }
  std::unique_ptr<RawClient> ask() {
    auto client = std::make_unique<RawClient>(path);
    client->send(testing_support::reportersRequest(1));
    // It has the beginning.
    char byte;
    EXPECT_EQ(::recv(client->socket(), &byte, 1, MSG_PEEK), 1);
    letLookAgain();
    return client;
  }
  /// At the time, and at what is unread.
  void letLookAgain() {
    for (int i = 0; i < 2; ++i) {
      RawClient other(path);
      other.send(testing_support::createRequest(1, 7));
      EXPECT_TRUE(other.receive());
    }
  }
  void letTimePass(std::chrono::nanoseconds time) {
    time_ = time_.load() + time;
    letLookAgain();
  }
  std::size_t cutOff() const {
    return misuse->counts()[static_cast<std::size_t>(MisuseLog::Kind::kCutOff)];
  }

 private:
  std::atomic<std::chrono::nanoseconds> time_{std::chrono::hours(1)};
};

TEST_F(UntakenReplies, AreCutOffBeyondTwiceTheUsersShareTheOldestFirst) {
  serveWithShareOf(5 * kReply / 4);
  const auto first = ask();
  letTimePass(std::chrono::milliseconds(1));
  const auto second = ask();
  EXPECT_EQ(cutOff(), 0u);
  letTimePass(std::chrono::milliseconds(1));
  const auto third = ask();

  EXPECT_EQ(cutOff(), 1u);
  EXPECT_FALSE(first->receive());
  EXPECT_TRUE(second->receive());
  EXPECT_TRUE(third->receive());
}

TEST_F(UntakenReplies, EndAClientThatReadsNothingWhileItsUserHasTooMuch) {
  serveWithShareOf(kReply / 2);
  const auto client = ask();
  letTimePass(limits::kUnreadPatience - std::chrono::nanoseconds(1));
  EXPECT_EQ(cutOff(), 0u);
  letTimePass(std::chrono::nanoseconds(1));
  EXPECT_EQ(cutOff(), 1u);
  EXPECT_FALSE(client->receive());
}

TEST_F(UntakenReplies, MayWaitWhereTheirUserHasNoMoreThanItsShare) {
  serveWithShareOf(2 * kReply);
  const auto client = ask();
  letTimePass(limits::kUnreadPatience + std::chrono::nanoseconds(1));
  EXPECT_EQ(cutOff(), 0u);
  EXPECT_TRUE(client->receive());
}

}  // namespace
}  // namespace ostrel
