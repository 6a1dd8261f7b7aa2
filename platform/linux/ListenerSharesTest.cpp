// What the clients of a user may have, asked for over the socket: below, at and beyond
// each limit.
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/UnixSocketIPCListenerTestSupport.h"

namespace ostrel {
namespace {

using testing_support::createRequest;
using testing_support::messageRequest;
using testing_support::RawClient;
using testing_support::RecordingService;

/// Keeps what sessions keep of their clients' requests.
class KeepingService final : public RecordingService {
 public:
  void setConfiguration(std::optional<Dictionary> configuration, ReporterID id,
                        BoolReply reply) override {
    if (configuration) {
      const std::lock_guard lock(mutex_);
      Dictionary& info = infos_[id];
      info = DictionaryBuilder(info).merge(*configuration).build();
    }
    reply(true);
  }
  void sendMessage(Dictionary message, MessageCategory, MessageType,
                   std::optional<ReporterIDs>, ErrorReply reply) override {
    const bool isKept = message.owner().account()->keep(message.value().bytes().size());
    reply(isKept ? std::nullopt : std::optional(ErrorObject{"", 1, "not kept"}));
  }

  std::size_t entriesOf(ReporterID id) {
    const std::lock_guard lock(mutex_);
    return infos_[id].size();
  }

 private:
  std::mutex mutex_;
  std::map<ReporterID, Dictionary> infos_;
};

class ListenerShares : public testing_support::UnixSocketListener {
 protected:
  ~ListenerShares() override { stop(); }

  bool listenerShouldAcceptNewConnection(
      IPCListener&, const std::shared_ptr<IPCConnection>& connection) override {
    connection->setExportedObject(keeping);
    connection->resume();
    return true;
  }

  /// What the session has of it then.
  std::size_t entriesAfter(RawClient& client, std::int64_t id,
                           const Dictionary& configuration) {
    wire::Request request = createRequest(1, id);
    request.operation = wire::Operation::kSetConfiguration;
    request.dictionary = configuration;
    client.send(request);
    EXPECT_TRUE(client.receive());
    return keeping->entriesOf(ReporterID{id});
  }
  std::size_t refusedInfos() const {
    return misuse->counts()[static_cast<std::size_t>(MisuseLog::Kind::kUserInfoRefused)];
  }
  /// As many idle sessions of a client of the user's, which stays.
  void crowdWith(std::size_t sessions) {
    crowd = std::make_unique<RawClient>(path);
    for (std::size_t i = 0; i < sessions; ++i) {
      crowd->send(createRequest(1, static_cast<std::int64_t>(i + 1000)));
      EXPECT_TRUE(crowd->receive());
    }
  }
  /// Serves with other limits, and a service that keeps nothing yet.
  void serveAnew(const ListenerLimits& limits) {
    stop();
    keeping = std::make_shared<KeepingService>();
    serve(limits);
  }

  static Dictionary textOf(std::size_t bytes) {
    return {{"k", Value(std::string(bytes, 'x'))}};
  }
  /// Of its entries, without the head.
  static std::size_t bytesOf(const Dictionary& info) {
    return info.value().bytes().size() - 1;
  }
  /// What a user info takes of its user's share.
  static std::size_t memoryOf(const Dictionary& info) {
    return ValueBuffer::make(info.value().bytes().size()).memory();
  }

  std::shared_ptr<KeepingService> keeping = std::make_shared<KeepingService>();
  std::unique_ptr<RawClient> crowd;
};

TEST_F(ListenerShares, OfAUserInfoAreItsBytes) {
  serve();
  RawClient client(path);
  const std::size_t overhead =
      bytesOf(textOf(limits::kUserInfoBytes - 100)) - (limits::kUserInfoBytes - 100);
  const std::size_t most = limits::kUserInfoBytes - overhead;
  EXPECT_EQ(entriesAfter(client, 1, textOf(most - 1)), 1u);
  EXPECT_EQ(entriesAfter(client, 2, textOf(most)), 1u);
  EXPECT_EQ(refusedInfos(), 0u);
  EXPECT_EQ(entriesAfter(client, 3, textOf(most + 1)), 0u);
  EXPECT_EQ(entriesAfter(client, 3, textOf(1)), 1u);
  EXPECT_EQ(refusedInfos(), 1u);
}

TEST_F(ListenerShares, OfAUserInfoAreItsEntries) {
  serve();
  RawClient client(path);
  DictionaryBuilder builder;
  for (std::size_t i = 1; i < limits::kUserInfoEntries; ++i) {
    builder.set("k" + std::to_string(i), Value(1));
  }
  EXPECT_EQ(entriesAfter(client, 1, builder.build()), limits::kUserInfoEntries - 1);
  EXPECT_EQ(entriesAfter(client, 1, {{"a", Value(1)}}), limits::kUserInfoEntries);
  EXPECT_EQ(refusedInfos(), 0u);
  EXPECT_EQ(entriesAfter(client, 1, {{"b", Value(1)}}), limits::kUserInfoEntries);
  EXPECT_EQ(refusedInfos(), 1u);
}

TEST_F(ListenerShares, OfAUserAreTheUserInfosOfAllItsSessions) {
  const Dictionary first = textOf(3000);
  const Dictionary second = textOf(1000);
  const std::size_t both = memoryOf(first) + bytesOf(second);
  for (const std::size_t most : {both - 1, both, both + 1}) {
    ListenerLimits limits;
    limits.ofUser.userInfoBytes = most;
    serveAnew(limits);
    RawClient client(path);
    RawClient other(path);
    EXPECT_EQ(entriesAfter(client, 1, first), 1u);
    EXPECT_EQ(entriesAfter(other, 2, second), most >= both ? 1u : 0u) << most;
  }
  EXPECT_EQ(refusedInfos(), 1u);
}

TEST_F(ListenerShares, OfACrowdedUserAreLessForUserInfos) {
  // Idle sessions, and the request itself.
  constexpr std::size_t kSessions = 20;
  constexpr std::size_t kRequest = 4 * limits::kSessionBytes;
  const Dictionary info = textOf(500);
  ListenerLimits limits;
  limits.ofUser.userInfoBytes = 8 * (bytesOf(info) - 1);
  limits.ofUser.memory = kSessions * limits::kSessionBytes + kRequest;
  for (const std::size_t sessions : {kSessions, kSessions + 4}) {
    serveAnew(limits);
    crowdWith(sessions);
    RawClient client(path);
    EXPECT_EQ(entriesAfter(client, 1, info), sessions > kSessions ? 0u : 1u) << sessions;
    EXPECT_EQ(entriesAfter(client, 1, textOf(400)), 1u) << "an eighth it has anyway";
  }
}

TEST_F(ListenerShares, OfACrowdedUserAreLessForHalvesOfFrames) {
  constexpr std::size_t kSessions = 20;
  const std::string half =
      std::string("\x00\x00\x01\x00", 4) + std::string(30 * 1024 - 4, '\x81');
  ListenerLimits limits;
  limits.ofUser.halfFrameBytes = 2 * half.size() - 1;
  limits.ofUser.memory = kSessions * limits::kSessionBytes + half.size();
  for (const std::size_t sessions : {kSessions - 1, kSessions, kSessions + 1}) {
    serveAnew(limits);
    crowdWith(sessions);
    RawClient client(path);
    client.send(half);
    if (sessions > kSessions) {
      EXPECT_EQ(client.receiveClosing(), "too many frames are not whole");
      continue;
    }
    EXPECT_FALSE(client.receive(std::chrono::milliseconds(50))) << sessions;
    EXPECT_FALSE(client.isCutOff());
  }
}

TEST_F(ListenerShares, OfAUserAreTheBytesThatItsSessionsKeep) {
  const wire::Request message = messageRequest(1, std::string(500, 'x'));
  const std::size_t bytes = message.dictionary->value().bytes().size();
  for (const std::size_t most : {3 * bytes - 1, 3 * bytes, 3 * bytes + 1}) {
    ListenerLimits limits;
    limits.ofUser.keptBytes = most;
    serveAnew(limits);
    std::size_t kept = 0;
    for (int i = 0; i < 4; ++i) {
      RawClient client(path);
      client.send(message);
      // The error's place is none where it was kept.
      if (client.receive().value_or("").back() == '\xf6') ++kept;
    }
    EXPECT_EQ(kept, most / bytes) << most;
  }
}

using ListenerSharesUnderWay = testing_support::UnixSocketListener;

TEST_F(ListenerSharesUnderWay, AreThoseOfAllConnectionsOfTheUser) {
  constexpr std::size_t kMost = 10 * limits::kRequestBytes;
  for (const std::size_t most : {kMost - 1, kMost, kMost + 1}) {
    stop();
    ListenerLimits limits;
    limits.ofUser.queuedBytes = most;
    limits.ofUser.reservedQueuedBytes = 0;
    limits.reservedQueuedBytes = 0;
    const std::size_t before = service->calls().size();
    serveHolding(limits);
    RawClient one(path);
    RawClient two(path);
    for (int i = 0; i < 5; ++i) one.send(createRequest(0, 7));
    ASSERT_TRUE(service->waitForCalls(before + 5));
    for (int i = 0; i < 20; ++i) two.send(createRequest(0, 7));
    // The one that goes beyond is still taken.
    const std::size_t taken = most < kMost ? 10 : 11;
    EXPECT_EQ(callsWhileHeld(before + taken), before + taken) << most;
    service->releaseReplies();
    EXPECT_TRUE(service->waitForCalls(before + 25));
  }
}

TEST_F(ListenerSharesUnderWay, AreAQuarterForACrowdedUser) {
  constexpr std::size_t kSessions = 20;
  constexpr std::size_t kRequests = 35;
  for (const std::size_t sessions : {kSessions - 1, kSessions, kSessions + 1}) {
    stop();
    ListenerLimits limits;
    limits.ofUser.queuedBytes = 4 * 10 * limits::kRequestBytes;
    limits.ofUser.memory =
        kSessions * limits::kSessionBytes + kRequests * limits::kRequestBytes;
    limits.ofUser.reservedQueuedBytes = 0;
    limits.reservedQueuedBytes = 0;
    std::size_t taken = service->calls().size() + sessions - 1;
    serve(limits);
    RawClient crowd(path);
    // One more comes with the requests.
    for (std::size_t i = 1; i < sessions; ++i) {
      crowd.send(createRequest(1, static_cast<std::int64_t>(i + 1000)));
      ASSERT_TRUE(crowd.receive());
    }
    service->holdReplies();
    RawClient client(path);
    // Each is taken before the next comes: the share follows from look to look.
    for (std::size_t i = 1; i < kRequests; ++i) {
      client.send(createRequest(0, 1000));
      ASSERT_TRUE(service->waitForCalls(++taken));
    }
    // A session takes as much as two requests.
    client.send(createRequest(0, 1000));
    if (sessions > kSessions) {
      EXPECT_FALSE(service->waitForCalls(taken + 1, std::chrono::milliseconds(100)));
    } else {
      EXPECT_TRUE(service->waitForCalls(taken + 1)) << sessions;
    }
    service->releaseReplies();
  }
}

/// Clients of several users, each of whom may have plenty.
class ListenerOfUsers : public ListenerShares {
 protected:
  static constexpr auto kQueued = static_cast<std::size_t>(MemoryKind::kQueued);
  static constexpr auto kHalfFrames = static_cast<std::size_t>(MemoryKind::kHalfFrames);
  static constexpr auto kUserInfos = static_cast<std::size_t>(MemoryKind::kUserInfos);

  ListenerOfUsers() {
    identityOf = [this](int) { return PeerIdentity{::getpid(), userOfNext}; };
  }
  ~ListenerOfUsers() override { stop(); }

  bool listenerShouldAcceptNewConnection(
      IPCListener& accepting, const std::shared_ptr<IPCConnection>& connection) override {
    return isRecording
               ? UnixSocketListener::listenerShouldAcceptNewConnection(accepting,
                                                                       connection)
               : ListenerShares::listenerShouldAcceptNewConnection(accepting, connection);
  }
  std::unique_ptr<RawClient> clientOf(std::uint32_t user) {
    userOfNext = user;
    auto client = std::make_unique<RawClient>(path);
    ask(*client);
    return client;
  }
  /// A question, and thus a look at all users.
  static void ask(RawClient& client) {
    wire::Request question = createRequest(1, 7);
    question.operation = wire::Operation::kReporterIDValid;
    client.send(question);
    EXPECT_TRUE(client.receive());
  }

  std::atomic<std::uint32_t> userOfNext{0};
  bool isRecording = true;
};

TEST_F(ListenerOfUsers, HoldsBackWhoHasMuchOfWhatIsUnderWay) {
  constexpr std::size_t kEach = 20;
  constexpr std::size_t kMost = 2 * kEach * limits::kRequestBytes;
  for (const std::size_t most : {kMost - 1, kMost, kMost + 1}) {
    stop();
    ListenerLimits limits;
    limits.ofAll[kQueued] = most;
    limits.ofUser.reservedQueuedBytes = 0;
    limits.reservedQueuedBytes = 0;
    serve(limits);
    const auto one = clientOf(1);
    const auto two = clientOf(2);
    const auto three = clientOf(3);
    service->holdReplies();
    std::size_t taken = service->calls().size();
    for (const auto& client : {one.get(), two.get()}) {
      for (std::size_t i = 0; i < kEach; ++i) client->send(createRequest(0, 7));
      ASSERT_TRUE(service->waitForCalls(taken += kEach));
    }

    one->send(createRequest(0, 7));
    if (most < kMost) {
      EXPECT_EQ(callsWhileHeld(taken), taken);
    } else {
      EXPECT_TRUE(service->waitForCalls(++taken)) << most;
    }
    three->send(createRequest(0, 7));
    three->send(createRequest(0, 7));
    EXPECT_TRUE(service->waitForCalls(taken + 2)) << "who has little is served";
    service->releaseReplies();
    const std::size_t all = taken + 2 + (most < kMost ? 1 : 0);
    EXPECT_TRUE(service->waitForCalls(all)) << "nothing is lost";
  }
}

TEST_F(ListenerOfUsers, CutsOffHalvesOfFramesOfWhoHasMany) {
  const std::string half =
      std::string("\x00\x00\x01\x00", 4) + std::string(30 * 1024 - 4, '\x81');
  for (const std::size_t most :
       {2 * half.size() - 1, 2 * half.size(), 2 * half.size() + 1}) {
    stop();
    ListenerLimits limits;
    limits.ofAll[kHalfFrames] = most;
    serve(limits);
    const auto little = clientOf(3);
    const auto one = clientOf(1);
    const auto two = clientOf(2);
    one->send(half);
    two->send(half);
    // Looks after both.
    clientOf(4);
    clientOf(4);
    if (most < 2 * half.size()) {
      EXPECT_EQ(one->receiveClosing(), "too many frames are not whole");
      // One of them was enough.
      two->send(std::string_view(half).substr(0, 1));
      little->send(std::string_view(half).substr(0, 1000));
      clientOf(4);
    }
    EXPECT_FALSE(two->receive(std::chrono::milliseconds(20))) << most;
    EXPECT_FALSE(two->isCutOff()) << most;
    EXPECT_FALSE(little->isCutOff());
  }
}

TEST_F(ListenerOfUsers, TakesNoMoreUserInfosOfWhoHasMany) {
  isRecording = false;
  const Dictionary info = textOf(3000);
  const std::size_t kMost = 2 * memoryOf(info);
  for (const std::size_t most : {kMost - 1, kMost, kMost + 1}) {
    ListenerLimits limits;
    limits.ofAll[kUserInfos] = most;
    serveAnew(limits);
    const auto one = clientOf(1);
    const auto two = clientOf(2);
    const auto three = clientOf(3);
    EXPECT_EQ(entriesAfter(*one, 1, info), 1u);
    EXPECT_EQ(entriesAfter(*two, 2, info), 1u);
    EXPECT_EQ(entriesAfter(*one, 11, textOf(10)), most < kMost ? 0u : 1u) << most;
    EXPECT_EQ(entriesAfter(*three, 3, textOf(100)), 1u) << "who has little may";
  }
}

/// Users that come and go.
class ListenerOfUsersThatLeave : public ListenerOfUsers {
 protected:
  ListenerOfUsersThatLeave() {
    now = [] { return PeerConnection::Clock::time_point(std::chrono::hours(1)); };
  }
  ~ListenerOfUsersThatLeave() override { stop(); }

  /// Whether the listener knows so many soon, `staying` among them.
  bool knowsSoon(std::size_t users) {
    for (int i = 0; i < 500 && listener->users() != users; ++i) {
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
      // What other threads let go is seen at the next look.
      if (staying) ask(*staying);
    }
    return listener->users() == users;
  }

  std::unique_ptr<RawClient> staying;
};

TEST_F(ListenerOfUsersThatLeave, AreForgottenWithTheirLastConnection) {
  constexpr std::uint32_t kUsers = 1000;
  constexpr std::uint32_t kAtATime = 100;  // As descriptors allow.
  serve();
  EXPECT_EQ(listener->users(), 0u);
  {
    const auto one = clientOf(1);
    auto two = clientOf(1);
    two.reset();
    ask(*one);
    EXPECT_EQ(listener->users(), 1u) << "a connection is left";
  }
  EXPECT_TRUE(knowsSoon(0)) << "without a further look";

  staying = clientOf(1);
  for (std::uint32_t user = 2; user < kUsers + 2;) {
    std::vector<std::unique_ptr<RawClient>> clients;
    for (std::uint32_t i = 0; i < kAtATime; ++i, ++user) {
      clients.push_back(clientOf(user));
      clients.back()->send(createRequest(1, user));
      EXPECT_TRUE(clients.back()->receive());
    }
    EXPECT_EQ(listener->users(), kAtATime + 1);
    clients.clear();
    EXPECT_TRUE(knowsSoon(1));
  }
}

TEST_F(ListenerOfUsersThatLeave, AreKnownWhileAnythingOfThemIsUnderWay) {
  ListenerLimits limits;
  limits.ofUser.queuedBytes = 10 * limits::kRequestBytes;
  limits.ofUser.reservedQueuedBytes = 0;
  limits.reservedQueuedBytes = 0;
  serve(limits);
  auto client = clientOf(5);
  service->holdReplies();
  std::size_t taken = service->calls().size();
  for (int i = 0; i < 10; ++i) client->send(createRequest(0, 7));
  ASSERT_TRUE(service->waitForCalls(taken += 10));
  const std::size_t before = eventsAfter(1).size();
  client.reset();
  eventsAfter(before + 2);

  userOfNext = 5;
  auto again = std::make_unique<RawClient>(path);
  // The one that goes beyond is still taken.
  for (int i = 0; i < 2; ++i) again->send(createRequest(0, 7));
  EXPECT_EQ(callsWhileHeld(taken + 1), taken + 1) << "it has what it left behind";
  EXPECT_EQ(listener->users(), 1u);
  service->releaseReplies();
  EXPECT_TRUE(service->waitForCalls(taken + 2));
  again.reset();
  EXPECT_TRUE(knowsSoon(0));
}

TEST_F(ListenerOfUsersThatLeave, AreStillToldOfOnceAMinute) {
  const testing_support::CapturedLog log;
  serve();
  for (int i = 0; i < 3; ++i) {
    const auto client = clientOf(5);
    client->send(std::string(4, '\0'));
    EXPECT_EQ(client->receiveClosing(), "a frame is empty");
    EXPECT_TRUE(knowsSoon(0));
  }
  EXPECT_EQ(misuse->counts()[static_cast<std::size_t>(MisuseLog::Kind::kCutOff)], 3u);
  std::size_t told = 0;
  for (const std::string& line : log.lines(LogLevel::kError)) {
    if (line.find("is cut off") != std::string::npos) ++told;
  }
  EXPECT_EQ(told, 1u);
}

TEST_F(ListenerOfUsersThatLeave, ComeAndGoWhileOtherThreadsAnswerThem) {
  serve();
  staying = clientOf(9);
  std::atomic<bool> isOver{false};
  std::thread answering([&] {
    while (!isOver) {
      service->holdReplies();
      std::this_thread::yield();
      service->releaseReplies();
    }
  });
  for (std::uint32_t i = 0; i < 600; ++i) {
    userOfNext = i % 3;
    RawClient client(path);
    client.send(messageRequest(1, std::string(500, 'x')));
    if (i % 2 == 0) {
      EXPECT_TRUE(client.receive());
    }
  }
  isOver = true;
  answering.join();
  service->releaseReplies();
  EXPECT_TRUE(knowsSoon(1));
}

struct Malformed {
  std::string limit;
  std::string closing;
  std::function<wire::Request(std::size_t)> request;
  std::size_t most;

  friend std::ostream& operator<<(std::ostream& out, const Malformed& each) {
    return out << each.limit;
  }
};

class ListenerRequests : public testing_support::UnixSocketListener,
                         public testing::WithParamInterface<Malformed> {};

TEST_P(ListenerRequests, AreTakenUpToTheirLimit) {
  serve();
  RawClient client(path);
  for (const std::size_t amount : {GetParam().most - 1, GetParam().most}) {
    client.send(GetParam().request(amount));
    EXPECT_EQ(testing_support::hex(client.receive().value_or("")), "8201f6") << amount;
  }

  client.send(GetParam().request(GetParam().most + 1));

  EXPECT_EQ(client.receiveClosing(), GetParam().closing);
}

wire::Request requestWith(const Dictionary& payload) {
  wire::Request request = messageRequest(1, "");
  request.dictionary = payload;
  return request;
}

wire::Request requestNested(std::size_t depth) {
  // The payload is the first.
  Value value(1);
  for (std::size_t i = 1; i < depth; ++i) value = ArrayBuilder().append(value).build();
  return requestWith({{"k", value}});
}

wire::Request requestOfNodes(std::size_t nodes) {
  // The payload, its key and the array are three.
  ArrayBuilder array;
  for (std::size_t i = 3; i < nodes; ++i) array.append(Value(1));
  return requestWith({{"k", Value(array.build())}});
}

wire::Request requestWithKeyOf(std::size_t bytes) {
  return requestWith({{std::string(bytes, 'k'), Value(1)}});
}

wire::Request requestTo(std::size_t ids) {
  wire::Request request = messageRequest(1, "");
  request.reporterIDs = ReporterIDs(ids, ReporterID{1});
  return request;
}

INSTANTIATE_TEST_SUITE_P(
    Each, ListenerRequests,
    testing::Values(Malformed{"Nesting", "the payload is nested too deeply",
                              requestNested, limits::kNesting},
                    Malformed{"Nodes", "the payload has too many values", requestOfNodes,
                              limits::kNodes},
                    Malformed{"KeyBytes", "a key is too long", requestWithKeyOf,
                              limits::kKeyBytes},
                    Malformed{"ReporterIDs", "there are too many reporter IDs", requestTo,
                              limits::kReporterIDs}),
    [](const auto& each) { return each.param.limit; });

}  // namespace
}  // namespace ostrel
