// How the listener shares itself and its memory out among clients.
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <array>
#include <atomic>
#include <chrono>

#include "platform/linux/FairLine.h"
#include "platform/linux/QueuedSteps.h"
#include "platform/linux/RequestDispatch.h"
#include "platform/linux/ThreadPoolWorkQueues.h"
#include "platform/linux/TimerThread.h"
#include "platform/linux/UnixSocketIPCListenerTestSupport.h"

namespace ostrel {
namespace {

using testing_support::RawClient;
using testing_support::RecordingService;

class FairLineTest : public testing::Test {
 protected:
  static constexpr std::size_t kClients = 40;

  void enter(std::size_t client) { line.enter(client, places[client]); }
  std::optional<std::size_t> serveNext(std::uint64_t work) {
    const auto next = line.take();
    if (!next) return std::nullopt;
    line.leave(places[*next]);
    line.use(places[*next], work);
    return next;
  }
  void makeBusy(std::size_t client) { line.introduce(places[client], group); }
  /// Clients 1 and 2.
  void lineUpBusyOnes() {
    for (const std::size_t client : {1u, 2u}) {
      makeBusy(client);
      enter(client);
    }
  }

  FairLine line;
  const std::shared_ptr<FairLine::Group> group = std::make_shared<FairLine::Group>();
  std::array<FairLine::Place, kClients> places;
};

using FairLineOrder = FairLineTest;

TEST_F(FairLineOrder, LetsWhoAsksForLittleGoFirst) {
  lineUpBusyOnes();
  enter(3);
  EXPECT_EQ(serveNext(1000), 3u);
  EXPECT_EQ(serveNext(1000), 1u);
}

TEST_F(FairLineOrder, TellsLittleFromMuchByWhatWasSaved) {
  for (const std::uint64_t work :
       {FairLine::kSavedWork - 1, FairLine::kSavedWork, FairLine::kSavedWork + 1}) {
    FairLine fresh;
    FairLine::Place asking;
    FairLine::Place busy;
    fresh.use(asking, work - 100);
    fresh.use(asking, 100);
    fresh.introduce(busy, group);
    fresh.enter(1, busy);
    fresh.enter(2, asking);
    EXPECT_EQ(fresh.take(), work <= FairLine::kSavedWork ? 2u : 1u) << work;
  }
}

TEST_F(FairLineOrder, ForgetsWhatWasAskedForInTime) {
  line.use(places[1], FairLine::kSavedWork);
  line.use(places[1], 100);
  makeBusy(2);
  line.setTime(100 * FairLine::kTimeForWork);
  enter(2);
  enter(1);
  EXPECT_EQ(serveNext(0), 1u);
}

TEST_F(FairLineOrder, LetsWhoHadLeastGoFirstOfThoseThatAskForMuch) {
  lineUpBusyOnes();
  EXPECT_EQ(serveNext(1000), 1u);
  EXPECT_EQ(serveNext(300), 2u);
  std::string order;
  for (int i = 0; i < 5; ++i) {
    enter(1);
    enter(2);
    order += std::to_string(*serveNext(300));
  }
  EXPECT_EQ(order, "22212") << "until both had as much";
}

TEST_F(FairLineOrder, LeavesNobodyWithoutATurn) {
  constexpr std::uint64_t kPart = FairLine::kLightWorkInARow / 8;
  for (const std::uint64_t work :
       {kPart - FairLine::kLeastWork - 1, kPart - FairLine::kLeastWork,
        kPart - FairLine::kLeastWork + 1}) {
    line = FairLine();
    places = {};
    makeBusy(0);
    enter(0);
    std::size_t turns = 0;
    do {
      ++turns;
      ASSERT_LT(turns, kClients);
      enter(turns);
      EXPECT_EQ(line.isNextLight(),
                turns <= (work < kPart - FairLine::kLeastWork ? 9u : 8u));
    } while (serveNext(work) != 0u);
    EXPECT_EQ(turns, work < kPart - FairLine::kLeastWork ? 10u : 9u) << work;
  }
}

TEST_F(FairLineOrder, TellsWhoAsksForLittleByItsLastTurnToo) {
  for (const std::uint64_t work : {FairLine::kLittleAtOnce - 1, FairLine::kLittleAtOnce,
                                   FairLine::kLittleAtOnce + 1}) {
    FairLine fresh;
    FairLine::Place asking;
    fresh.use(asking, work);
    fresh.setTime(FairLine::kTimeForWork * FairLine::kSavedWork);
    fresh.enter(1, asking);
    EXPECT_EQ(fresh.isNextLight(), work <= FairLine::kLittleAtOnce) << work;
    EXPECT_EQ(fresh.take(), 1u);
  }
}

/// Those that ask for little: one client of one group, all others of another.
class FairLineGroups : public FairLineTest {
 protected:
  static constexpr std::size_t kAlone = 0;

  FairLineGroups() {
    for (std::size_t client = 0; client < kClients; ++client) {
      line.introduce(places[client], client == kAlone ? ofOne : group);
    }
    // Until nobody is new any more.
    line.setTime(FairLine::kTimeForWork * (FairLine::kSavedWork + FairLine::kDebtOfNew));
  }
  void enterAll(std::size_t begin, std::size_t end) {
    for (std::size_t client = begin; client < end; ++client) enter(client);
  }

  const std::shared_ptr<FairLine::Group> ofOne = std::make_shared<FairLine::Group>();
};

TEST_F(FairLineGroups, LetNobodyWaitForMoreThanOneOfAnother) {
  enterAll(1, kClients);
  enter(kAlone);
  EXPECT_EQ(serveNext(5000), 1u);
  EXPECT_EQ(serveNext(5000), kAlone);
  EXPECT_EQ(serveNext(5000), 2u);
  enter(kAlone);
  EXPECT_EQ(serveNext(5000), kAlone) << "as much as all of the others together";
}

TEST_F(FairLineGroups, ServeTheirOwnInTheOrderInWhichTheyCame) {
  enterAll(kAlone, kClients);
  EXPECT_EQ(serveNext(0), kAlone);
  for (std::size_t client = 1; client < kClients; ++client) {
    EXPECT_EQ(serveNext(0), client);
  }
  EXPECT_TRUE(line.empty());
}

TEST_F(FairLineGroups, GoOnWhenOneOfThemHasGone) {
  enterAll(1, 4);
  EXPECT_EQ(line.take(), 1u);  // And says nothing more.
  EXPECT_EQ(serveNext(1000), 2u);
  EXPECT_EQ(line.take(), 3u);
  EXPECT_TRUE(line.empty());
  EXPECT_FALSE(line.take());
}

TEST_F(FairLineGroups, TakeTurnsByWhatTheyAskFor) {
  enterAll(1, kClients);
  enter(kAlone);
  std::size_t turnsOfOthers = 0;
  for (int i = 0; i < 10; ++i) {
    while (serveNext(3000) != kAlone) ++turnsOfOthers;
    enter(kAlone);
  }
  EXPECT_GE(turnsOfOthers, 9u);
  EXPECT_LE(turnsOfOthers, 11u);
}

TEST_F(FairLineOrder, HasNobodyNextWhereNobodyIs) { EXPECT_FALSE(line.isNextLight()); }

TEST_F(FairLineOrder, HasEachInItOnce) {
  enter(1);
  enter(1);
  EXPECT_EQ(serveNext(0), 1u);
  EXPECT_TRUE(line.empty());
}

/// A client's connection without a loop.
class PeerConnectionTurn : public testing::Test {
 protected:
  PeerConnectionTurn() {
    int sockets[2];
    EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM, 0, sockets), 0);
    client = FileDescriptor(sockets[0]);
    ours = FileDescriptor(sockets[1]);
  }

  std::unique_ptr<PeerConnection> connect(const ListenerLimits& limits) {
    auto connection = std::make_unique<PeerConnection>(1, std::move(ours), PeerIdentity(),
                                                       channel, limits, misuse, owners);
    connection->setExportedObject(service);
    return connection;
  }
  void send(std::size_t creations) const {
    std::string bytes;
    wire::Request request;
    request.operation = wire::Operation::kCreateReportingSession;
    for (std::size_t i = 0; i < creations; ++i) {
      request.reporterID = ReporterID{static_cast<std::int64_t>(i % 20 + 1)};
      wire::appendRequest(bytes, request);
    }
    ASSERT_EQ(::send(client.get(), bytes.data(), bytes.size(), 0),
              static_cast<ssize_t>(bytes.size()));
  }

  FileDescriptor client;
  FileDescriptor ours;
  const std::shared_ptr<UserAccount> user = std::make_shared<UserAccount>(
      ListenerLimits().ofUser,
      std::shared_ptr<ServiceAccount>(new ServiceAccount{Share(1000), Share(1000)}));
  const std::shared_ptr<PeerChannel> channel = std::make_shared<PeerChannel>(
      1, std::make_shared<LoopWaker>(), user,
      PeerChannel::Limits{limits::kQueuedBytes, limits::kUnreadReplyBytes});
  MisuseLog misuse;
  SessionOwners owners;
  const std::shared_ptr<RecordingService> service = std::make_shared<RecordingService>();
  std::vector<std::uint8_t> buffer = std::vector<std::uint8_t>(64 * 1024);
};

TEST_F(PeerConnectionTurn, EndsWhenItsWorkIsDone) {
  ListenerLimits limits;
  limits.turnWork = 20'000;  // Of requests that take two to three thousand each.
  const auto connection = connect(limits);
  send(/*creations=*/50);
  std::size_t turns = 0;
  std::size_t before = 0;
  do {
    const std::uint64_t work = connection->takeTurn(buffer);
    EXPECT_LT(work, limits.turnWork + 5'000);
    const std::size_t calls = service->calls().size();
    EXPECT_GT(calls, before);
    EXPECT_LE(calls, before + 10);
    before = calls;
    ++turns;
  } while (connection->isUnfinished());
  EXPECT_EQ(before, 50u);
  EXPECT_GT(turns, 4u);
}

TEST_F(PeerConnectionTurn, EndsJustAtTheWorkOfItsLimit) {
  // What so many requests take.
  ListenerLimits limits;
  const auto connection = connect(limits);
  send(/*creations=*/10);
  const std::uint64_t work = connection->takeTurn(buffer);
  for (const std::uint64_t most : {work - 1, work, work + 1}) {
    int sockets[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM, 0, sockets), 0);
    client = FileDescriptor(sockets[0]);
    ours = FileDescriptor(sockets[1]);
    ListenerLimits same;
    same.turnWork = most;
    const auto again = connect(same);
    send(/*creations=*/11);
    again->takeTurn(buffer);
    EXPECT_EQ(again->isUnfinished(), most <= work) << most;
  }
}

TEST_F(PeerConnectionTurn, TellsOfAConfigurationThatWasCut) {
  ListenerLimits limits;
  const auto connection = connect(limits);
  EXPECT_FALSE(channel->mayMerge({limits::kUserInfoEntries + 1, 1, 1}));
  connection->takeTurn(buffer);
  connection->takeTurn(buffer);
  EXPECT_EQ(misuse.counts()[static_cast<std::size_t>(MisuseLog::Kind::kUserInfoRefused)],
            1u);
}

/// What configurations of one client make of a session's user info.
class UserInfo : public PeerConnectionTurn {
 protected:
  Dictionary configuration(std::string_view key, const Value& value) const {
    return DictionaryBuilder(channel).set(key, value).build();
  }
  static Dictionary merged(const Dictionary& info, const Dictionary& configuration) {
    return DictionaryBuilder(info).merge(configuration).build();
  }
};

TEST_F(UserInfo, TakesEntriesUpToTheLimit) {
  Dictionary info;
  for (std::size_t i = 0; i < limits::kUserInfoEntries; ++i) {
    info = merged(info, configuration("k" + std::to_string(i), 1));
    EXPECT_EQ(info.size(), i + 1);
  }
  EXPECT_FALSE(channel->takeRefusedMerge());
  info = merged(info, configuration("more", 1));
  EXPECT_EQ(info.size(), limits::kUserInfoEntries);
  EXPECT_TRUE(channel->takeRefusedMerge());
  info = merged(info, configuration("k7", 2));
  EXPECT_EQ(info.find("k7")->signedInteger(), 2) << "what is there may change";
}

TEST_F(UserInfo, TakesBytesUpToTheLimit) {
  constexpr std::size_t kKeyAndHead = 5;
  for (const std::size_t bytes :
       {limits::kUserInfoBytes - 1, limits::kUserInfoBytes, limits::kUserInfoBytes + 1}) {
    const std::string text(bytes - kKeyAndHead, 'x');
    const Dictionary info = merged(Dictionary(), configuration("k", text));
    EXPECT_EQ(info.size(), bytes <= limits::kUserInfoBytes ? 1u : 0u) << bytes;
  }
}

TEST_F(UserInfo, OfAllSessionsOfAUserTakesBytesUpToTheLimit) {
  UserInfos infos(/*mostBytes=*/1000);
  infos.charge(900);
  EXPECT_TRUE(infos.hasRoomFor(99));
  EXPECT_TRUE(infos.hasRoomFor(100));
  EXPECT_FALSE(infos.hasRoomFor(101));
}

TEST_F(UserInfo, IsChargedToItsUserUntilItEnds) {
  const std::size_t before = user->memory();
  {
    const Dictionary info =
        merged(Dictionary(), configuration("k", std::string(1000, 'x')));
    EXPECT_GE(user->memory(), before + 1000);
    EXPECT_EQ(user->queued().used(), 0u) << "a client need not wait for its end";
    // A telemetry session's copy.
    const Dictionary copy = DictionaryBuilder().set("a", 1).merge(info).build();
    EXPECT_GE(user->memory(), before + 2000);
  }
  EXPECT_EQ(user->memory(), before);
}

/// A service whose sessions have a queue.
class QueueingService final : public RecordingService {
 public:
  void startReportingSessionForID(ReporterID id, BoolReply reply) override {
    RecordingService::startReportingSessionForID(id, std::move(reply));
    queue();
  }
  void stopReportingSessionForID(ReporterID id, BoolReply reply) override {
    RecordingService::stopReportingSessionForID(id, std::move(reply));
    queue();
  }

  // A step that queues another.
  StepList steps;

 private:
  void queue() {
    steps.append(QueuedStep::make([this] { steps.append(QueuedStep::make([] {})); }));
  }
};

class RequestBurden : public PeerConnectionTurn {
 protected:
  void dispatch(wire::Operation operation) {
    wire::Request request;
    request.operation = operation;
    request.reporterID = ReporterID{7};
    dispatchRequest(queueing, channel, request);
  }
  void expectBurden(wire::Operation operation, std::size_t bytes) {
    dispatch(operation);
    // The request itself is charged until its callback goes, or a later one is called.
    const std::size_t before = user->queued().used();
    EXPECT_GE(before, bytes);
    queueing.steps.runFirst();
    EXPECT_EQ(user->queued().used(), before) << "a step that came of it waits";
    queueing.steps.runFirst();
    EXPECT_EQ(user->queued().used(), before - bytes);
    EXPECT_EQ(Burden::current(), nullptr);
  }

  QueueingService queueing;
};

TEST_F(RequestBurden, OfAStartLastsUntilItsLastStepHasRun) {
  expectBurden(wire::Operation::kStartReportingSessionForID, limits::kStartBytes);
}

TEST_F(RequestBurden, OfAStopLastsUntilItsLastStepHasRun) {
  expectBurden(wire::Operation::kStopReportingSessionForID, limits::kSessionStepBytes);
}

TEST_F(RequestBurden, EndsWithStepsThatAreDropped) {
  dispatch(wire::Operation::kStartReportingSessionForID);
  const std::size_t before = user->queued().used();
  queueing.steps.dropFirst();
  EXPECT_EQ(user->queued().used(), before - limits::kStartBytes);
}

/// A service with a queue, before a listener whose time the test moves on. What it is
/// asked is told apart by reporter IDs.
class ListenerTurns : public testing_support::UnixSocketListener {
 protected:
  using Events = std::vector<std::string>;

  ListenerTurns() {
    now = [this] { return PeerConnection::Clock::time_point(time_.load()); };
  }
  ~ListenerTurns() override { stop(); }

  bool listenerShouldAcceptNewConnection(
      IPCListener&, const std::shared_ptr<IPCConnection>& connection) override {
    connection->setExportedObject(service_);
    connection->resume();
    return true;
  }

  /// A client that asked for much.
  std::unique_ptr<RawClient> connectHeavy() {
    constexpr std::size_t kDeliveries = 500;
    auto client = std::make_unique<RawClient>(path);
    wire::Request message = testing_support::messageRequest(1, "x");
    message.reporterIDs = ReporterIDs(kDeliveries, ReporterID{1});
    client->send(message);
    EXPECT_TRUE(client->receive());
    return client;
  }
  /// One that has been there for long and asked for little.
  std::unique_ptr<RawClient> connectLight() {
    auto client = std::make_unique<RawClient>(path);
    ask(*client, 0);
    EXPECT_TRUE(client->receive());
    pass(std::chrono::seconds(1));
    return client;
  }
  static void ask(RawClient& client, std::int64_t id) {
    client.send(testing_support::createRequest(1, id));
  }
  void pass(std::chrono::nanoseconds time) { time_ = time_.load() + time; }
  /// What happens when that is read, on the listener's thread. While that is stopped.
  void at(std::int64_t request, std::function<void()> event) {
    eventful_ = request;
    event_ = std::move(event);
  }

  /// What becomes of `requests` requests that are sent while the listener is busy with
  /// another, so that its next look finds all of them.
  Events eventsOf(std::size_t requests, const std::function<void()>& send) {
    RawClient another(path);
    ask(another, kStopping);
    stopping_.waitUntilStopped();
    {
      const std::lock_guard lock(mutex);
      events.clear();
    }
    send();
    stopping_.letGo();
    Events all = eventsAfter(2 * (requests + 1));
    EXPECT_EQ(Events(all.begin(), all.begin() + 2), (Events{"read 99", "served 99"}));
    return Events(all.begin() + 2, all.end());
  }

 private:
  static constexpr std::int64_t kStopping = 99;

  class Service final : public RecordingService {
   public:
    explicit Service(ListenerTurns& test) : test_(test) {}

    void createReportingSession(ReporterID id, BoolReply reply) override {
      const auto number = static_cast<std::int64_t>(id);
      if (number == kStopping) test_.stopping_.stopHere();
      test_.note("read " + std::to_string(number));
      if (number == test_.eventful_) test_.event_();
      test_.queue_->async([this, number, reply = std::move(reply)] {
        test_.note("served " + std::to_string(number));
        reply(true);
      });
    }

   private:
    ListenerTurns& test_;
  };

  std::atomic<std::chrono::nanoseconds> time_{std::chrono::hours(1)};
  testing_support::StoppingPlace stopping_;
  std::int64_t eventful_ = -1;
  std::function<void()> event_;
  ThreadPoolWorkQueues queues_{std::make_shared<TimerThread>()};
  const std::shared_ptr<WorkQueue> queue_ = queues_.makeSerialQueue(
      "turns", QualityOfService::kUserInteractive, /*relativePriority=*/0);
  const std::shared_ptr<Service> service_ = std::make_shared<Service>(*this);
};

TEST_F(ListenerTurns, OfWhoAsksForLittleComeFirstAndAreServedApart) {
  serve();
  const auto heavy = connectHeavy();
  const auto light = connectLight();
  const auto other = connectLight();

  EXPECT_EQ(eventsOf(/*requests=*/3,
                     [&] {
                       ask(*heavy, 1);
                       ask(*light, 2);
                       ask(*other, 3);
                     }),
            (Events{"read 2", "read 3", "served 2", "served 3", "read 1", "served 1"}));
}

/// By how many nanoseconds the turns take longer than they may.
class ListenerTurnsBetweenLooks : public ListenerTurns,
                                  public testing::WithParamInterface<int> {};

TEST_P(ListenerTurnsBetweenLooks, EndAfterAWhileWithSomeStillInLine) {
  constexpr std::chrono::microseconds kForThreeEvents{3};
  serve();
  const auto first = connectHeavy();
  const auto second = connectHeavy();
  const auto third = connectHeavy();
  const auto light = connectLight();

  const Events order = eventsOf(/*requests=*/4, [&] {
    at(2, [&] {
      ask(*light, 4);
      pass(limits::kTurnsBetweenLooks + kForThreeEvents +
           std::chrono::nanoseconds(GetParam()));
    });
    ask(*first, 1);
    ask(*second, 2);
    ask(*third, 3);
  });

  if (GetParam() < 0) {
    EXPECT_EQ(order, (Events{"read 1", "read 2", "read 3", "served 1", "served 2",
                             "served 3", "read 4", "served 4"}));
  } else {
    EXPECT_EQ(order, (Events{"read 1", "read 2", "served 1", "served 2", "read 4",
                             "served 4", "read 3", "served 3"}));
  }
}

INSTANTIATE_TEST_SUITE_P(Each, ListenerTurnsBetweenLooks, testing::Values(-1, 0, 1));

}  // namespace
}  // namespace ostrel
