// What the listener does with clients that ask for too much.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/sockios.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <memory>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/Logging.h"
#include "platform/linux/UnixSocketIPCListenerTestSupport.h"

namespace ostrel {
namespace {

using namespace std::chrono_literals;
using namespace testing_support;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::UnorderedElementsAre;

TEST_F(UnixSocketListener, ChargesAllThatAMessageKeepsInMemory) {
  ListenerLimits limits;
  limits.queuedBytes = 64 * 1024;
  serveHolding(limits);
  RawClient client(path);
  // One held message among others that are done with at once: a few kilobytes of
  // input stay alive for it.
  std::string burst;
  wire::appendRequest(burst, messageRequest(0, "held"));
  for (int i = 0; i < 200; ++i) {
    wire::Request request;
    request.operation = wire::Operation::kReporterIDValid;
    wire::appendRequest(burst, request);
  }
  constexpr std::size_t kBursts = 400;

  std::thread sender([&] {
    for (std::size_t i = 0; i < kBursts; ++i) client.send(burst);
  });
  const std::size_t whileHeld = callsWhileHeld(201);
  service->releaseReplies();

  EXPECT_TRUE(service->waitForCalls(kBursts * 201));
  sender.join();
  const std::size_t inputBytes = whileHeld / 201 * burst.size();
  EXPECT_LE(inputBytes, 2 * limits.queuedBytes + 64 * 1024);
}

TEST_F(UnixSocketListener, TakesAFrameOfTheLargestSizeAndNoneLarger) {
  ListenerLimits limits;
  limits.frameBytes = 1000;
  serve(limits);
  std::string empty;
  wire::appendRequest(empty, messageRequest(1, std::string(300, 'x')));
  const std::size_t rest = empty.size() - wire::kFrameHeaderSize - 300;
  for (const std::size_t size : {std::size_t{999}, std::size_t{1000}}) {
    RawClient client(path);
    client.send(messageRequest(1, std::string(size - rest, 'x')));
    EXPECT_EQ(hex(*client.receive()), "8201f6") << size;
  }

  RawClient client(path);
  client.send(messageRequest(1, std::string(1001 - rest, 'x')));

  EXPECT_EQ(client.receiveClosing(), "a frame is too large");
  EXPECT_TRUE(client.isEnded());
}

TEST_F(UnixSocketListener, HoldsBackAClientWithTooMuchUnderWayAndLosesNothing) {
  ListenerLimits limits;
  limits.queuedBytes = 64 * 1024;
  serveHolding(limits);
  constexpr std::size_t kMessages = 2000;
  RawClient greedy(path);
  RawClient other(path);

  std::thread sender([&] {
    for (std::size_t i = 0; i < kMessages; ++i) {
      greedy.send(messageRequest(0, std::string(1000, 'x')));
    }
    greedy.send(reportersRequest(5));
  });
  const std::size_t whileHeld = callsWhileHeld(40);
  other.send([] {
    wire::Request request;
    request.operation = wire::Operation::kReporterIDValid;
    request.number = 1;
    return request;
  }());
  EXPECT_TRUE(other.receive()) << "somebody else is served meanwhile";
  service->releaseReplies();

  EXPECT_TRUE(greedy.receive(20s));
  sender.join();
  EXPECT_LT(whileHeld, 80u) << "64 KiB of messages of more than 1,000 bytes";
  EXPECT_EQ(service->calls().size(), kMessages + 2);
}

TEST_F(UnixSocketListener, HoldsBackAClientThatFloodsRequestsWithoutPayload) {
  ListenerLimits limits;
  limits.queuedBytes = 64 * 1024;
  serveHolding(limits);
  constexpr std::size_t kRequests = 5000;
  RawClient client(path);

  std::thread sender([&] {
    for (std::size_t i = 0; i < kRequests; ++i) client.send(createRequest(0, 7));
  });
  const std::size_t whileHeld = callsWhileHeld(100);
  service->releaseReplies();

  EXPECT_TRUE(service->waitForCalls(kRequests));
  sender.join();
  EXPECT_LE(whileHeld, 64u * 1024 / limits::kRequestBytes + 1);
}

TEST_F(UnixSocketListener, CutsNobodyOffWhoIsMerelyHeldBack) {
  ListenerLimits limits;
  limits.ofUser.queuedBytes = 64 * 1024;
  limits.ofUser.halfFrameBytes = 64 * 1024;
  serveHolding(limits);
  constexpr std::size_t kClients = 8;
  constexpr std::size_t kMessages = 300;
  std::string burst;
  for (std::size_t i = 0; i < kMessages; ++i) {
    wire::appendRequest(burst, messageRequest(0, std::string(200, 'x')));
  }
  std::vector<std::unique_ptr<RawClient>> clients;
  std::vector<std::thread> senders;
  for (std::size_t i = 0; i < kClients; ++i) {
    clients.push_back(std::make_unique<RawClient>(path));
    senders.emplace_back([&burst, client = clients.back().get()] {
      // In pieces that end within frames.
      for (std::size_t at = 0; at < burst.size(); at += 5000) {
        client->send(std::string_view(burst).substr(at, 5000));
      }
    });
  }
  callsWhileHeld(10);
  service->releaseReplies();
  for (std::thread& sender : senders) sender.join();

  EXPECT_TRUE(service->waitForCalls(kClients * kMessages));
  EXPECT_EQ(misuse->counts(), MisuseLog::Counts());
}

TEST_F(UnixSocketListener, ChargesEachDeliveryOfAMessage) {
  ListenerLimits limits;
  limits.queuedBytes = 64 * 1024;
  serveHolding(limits);
  constexpr std::size_t kDeliveries = 32;
  constexpr std::size_t kMessages = 50;
  wire::Request message = messageRequest(0, "x");
  message.reporterIDs = ReporterIDs(kDeliveries, ReporterID{1});
  RawClient client(path);

  for (std::size_t i = 0; i < kMessages; ++i) client.send(message);
  const std::size_t whileHeld = callsWhileHeld(1);
  service->releaseReplies();

  EXPECT_TRUE(service->waitForCalls(kMessages));
  EXPECT_LE(whileHeld,
            limits.queuedBytes / ((kDeliveries - 1) * limits::kDeliveryBytes) + 1);
}

TEST_F(UnixSocketListener, AcceptsAgainOnceThereAreDescriptors) {
  const CapturedLog log;
  // A sanitizer needs descriptors to look at a log that it has not met.
  OSTREL_LOG_DEFAULT(processLogScope, "there are descriptors");
  serve();
  rlimit usual{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &usual), 0);
  // One for the client, none for the service.
  FileDescriptor next(::dup(0));
  const rlimit scarce{static_cast<rlim_t>(next.get()) + 1, usual.rlim_max};
  next.reset();
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &scarce), 0);
  RawClient client(path);
  client.send(createRequest(1, 7));
  EXPECT_FALSE(client.receive(20ms));
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &usual), 0);

  EXPECT_EQ(hex(client.receive().value_or("")), "8201f5");
  const auto lines = log.lines(LogLevel::kError);
  ASSERT_FALSE(lines.empty());
  EXPECT_THAT(lines.front(), HasSubstr("no connection can be accepted now"));
  EXPECT_LT(lines.size(), 100u) << "it is tried ten times a second";
}

TEST_F(UnixSocketListener, CutsOffAClientThatNeverReadsItsReplies) {
  ListenerLimits limits;
  limits.unreadReplyBytes = 256 * 1024;
  limits.unreadReplyBytesToPause = 64 * 1024;
  limits.unreadPatience = 200ms;
  serve(limits);
  service->setReporters(ReporterIDs(5000, ReporterID{INT64_MAX}));
  RawClient client(path);

  const timeval patience{/*tv_sec=*/5, /*tv_usec=*/0};
  ::setsockopt(client.socket(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
  while (client.send(reportersRequest(1))) {
  }

  EXPECT_THAT(eventsAfter(3), ElementsAre(accepted(), "interrupted", "invalidated"));
}

TEST_F(UnixSocketListener, CutsOffWhoIsLongestInAFrameWhereAUserHasTooManyHalves) {
  ListenerLimits limits;
  limits.ofUser.halfFrameBytes = 90 * 1024;
  serve(limits);
  const std::string half =
      std::string("\x00\x00\x01\x00", 4) + std::string(30 * 1024 - 4, '\x81');
  std::vector<std::unique_ptr<RawClient>> clients;
  const auto begin = [&] {
    clients.push_back(std::make_unique<RawClient>(path));
    clients.back()->send(half);
    // Whoever is served later began later.
    RawClient other(path);
    other.send(createRequest(1, 7));
    EXPECT_TRUE(other.receive());
  };

  for (int i = 0; i < 3; ++i) begin();
  clients.push_back(std::make_unique<RawClient>(path));
  clients.back()->send(createRequest(1, 7));
  EXPECT_TRUE(clients.back()->receive()) << "at the limit";
  EXPECT_EQ(misuse->counts()[static_cast<std::size_t>(MisuseLog::Kind::kCutOff)], 0u);
  begin();

  EXPECT_EQ(clients.front()->receiveClosing(), "too many frames are not whole");
  EXPECT_EQ(misuse->counts()[static_cast<std::size_t>(MisuseLog::Kind::kCutOff)], 1u);
}

// Another process with connections that each have sent this and say no more.
class OtherProcess {
 public:
  OtherProcess(const std::string& path, int connections, const std::string& bytes) {
    int ends[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM, 0, ends) != 0) std::abort();
    ours_ = FileDescriptor(ends[0]);
    const FileDescriptor theirs(ends[1]);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    pid_ = ::fork();
    if (pid_ == 0) {
      for (int i = 0; i < connections; ++i) {
        const int socket = ::socket(AF_UNIX, SOCK_STREAM, 0);
        ::connect(socket, reinterpret_cast<const sockaddr*>(&address), sizeof address);
        if (::send(socket, bytes.data(), bytes.size(), MSG_NOSIGNAL) < 0) ::_exit(1);
      }
      char byte = 0;
      ::close(ours_.get());
      if (::write(theirs.get(), &byte, 1) == 1) {
        while (::read(theirs.get(), &byte, 1) > 0) {
        }
      }
      ::_exit(0);
    }
    char byte = 0;
    EXPECT_EQ(::read(ours_.get(), &byte, 1), 1);
  }
  ~OtherProcess() {
    ours_.reset();
    ::waitpid(pid_, nullptr, 0);
  }

 private:
  FileDescriptor ours_;
  pid_t pid_ = -1;
};

TEST_F(UnixSocketListener, CutsOffTheProcessWithMostHalfFramesAndNobodyElse) {
  ListenerLimits limits;
  limits.ofUser.halfFrameBytes = 90 * 1024;
  serve(limits);
  const std::string half =
      std::string("\x00\x00\x01\x00", 4) + std::string(30 * 1024 - 4, '\x81');
  RawClient slow(path);
  slow.send(half);
  const auto cutOff = [&] {
    return misuse->counts()[static_cast<std::size_t>(MisuseLog::Kind::kCutOff)];
  };

  const OtherProcess hoarder(path, /*connections=*/6, half);
  EXPECT_TRUE(eventually([&] { return cutOff() == 4; }));

  pollfd atSlow{slow.socket(), POLLIN, 0};
  EXPECT_EQ(::poll(&atSlow, 1, /*timeout=*/0), 0) << "it was told nothing";
}

// A kilobyte under way for all connections of a user, and the reserve for each.
ListenerLimits limitsWithReserve(std::size_t bytes) {
  ListenerLimits limits;
  limits.ofUser.queuedBytes = 1024;
  limits.reservedQueuedBytes = bytes;
  limits.ofUser.reservedQueuedBytes = 0;
  return limits;
}

TEST_F(UnixSocketListener, ServesAClientWithLittleUnderWayHoweverMuchItsUserHas) {
  serveHolding(limitsWithReserve(2 * limits::kRequestBytes));
  RawClient greedy(path);
  greedy.send(messageRequest(1, std::string(4096, 'x')));
  ASSERT_TRUE(service->waitForCalls(1));

  RawClient modest(path);
  for (int i = 0; i < 10; ++i) modest.send(createRequest(0, 7));
  ASSERT_TRUE(service->waitForCalls(3)) << "up to the reserve, and once at it";
  std::this_thread::sleep_for(50ms);
  EXPECT_LE(service->calls().size(), 1 + 3u);
  service->releaseReplies();

  EXPECT_TRUE(service->waitForCalls(11));
}

TEST_F(UnixSocketListener, LeavesWhatItCannotCarryOutInTheSocket) {
  serveHolding(limitsWithReserve(0));
  RawClient first(path);
  first.send(messageRequest(1, std::string(4096, 'x')));
  ASSERT_TRUE(service->waitForCalls(1));

  RawClient second(path);
  second.send(createRequest(0, 7));
  ASSERT_TRUE(service->waitForCalls(2));
  second.send(messageRequest(1, std::string(4096, 'x')));
  std::this_thread::sleep_for(50ms);
  int inSocket = 0;
  ::ioctl(second.socket(), SIOCOUTQ, &inSocket);
  EXPECT_GT(inSocket, 4096);
  service->releaseReplies();

  EXPECT_TRUE(second.receive());
}

TEST_F(UnixSocketListener, SendsALargeReplyToAClientThatReadsSlowly) {
  serve();
  service->setReporters(ReporterIDs(60'000, ReporterID{INT64_MAX}));
  RawClient client(path);

  client.send(reportersRequest(1));
  std::this_thread::sleep_for(50ms);

  const auto reply = client.receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->size(), 1 + 1 + 3 + 60'000 * 9u);
}

TEST_F(UnixSocketListener, ServesAsManyConnectionsAsAllowedAndSaysWhyNoMore) {
  ListenerLimits limits;
  limits.connectionsOfUser = 3;
  serve(limits);
  std::vector<std::unique_ptr<RawClient>> clients;
  for (int i = 0; i < 3; ++i) {
    clients.push_back(std::make_unique<RawClient>(path));
    clients.back()->send(createRequest(1, 7));
    EXPECT_TRUE(clients.back()->receive());
  }

  RawClient tooMany(path);

  EXPECT_EQ(tooMany.receiveClosing(), "there are too many connections");
  EXPECT_TRUE(tooMany.isEnded());
  clients.pop_back();
  eventsAfter(5);
  RawClient next(path);
  next.send(createRequest(1, 7));
  EXPECT_TRUE(next.receive());
}

TEST_F(UnixSocketListener, MakesAsManySessionsAsAllowedAndAnswersYesForOneMore) {
  ListenerLimits limits;
  limits.ofUser.sessions = 3;
  serve(limits);
  RawClient one(path);
  RawClient two(path);
  const auto isAnsweredYes = [](RawClient& client, const std::string& reply) {
    return hex(client.receive().value_or("")) == reply;
  };
  one.send(createRequest(1, 11));
  one.send(createRequest(2, 12));
  EXPECT_TRUE(isAnsweredYes(one, "8201f5"));
  EXPECT_TRUE(isAnsweredYes(one, "8202f5"));
  two.send(createRequest(1, 11));
  EXPECT_TRUE(isAnsweredYes(two, "8201f5"));
  two.send(createRequest(2, 22));
  EXPECT_TRUE(isAnsweredYes(two, "8202f5"));
  one.send(createRequest(3, 12));
  EXPECT_TRUE(isAnsweredYes(one, "8203f5")) << "a session made anew is none more";

  EXPECT_THAT(service->calls(), ElementsAre("create 11", "create 12", "create 11",
                                            "setConfiguration (null) 0", "create 12"));
  EXPECT_EQ(misuse->counts(), (MisuseLog::Counts{0, 0, 1}));
}

TEST_F(UnixSocketListener, MakesASessionAgainOnceOneIsDestroyedOrItsClientGone) {
  ListenerLimits limits;
  limits.sessions = 2;
  serve(limits);
  RawClient stays(path);
  stays.send(createRequest(1, 11));
  stays.send(createRequest(2, 0));
  stays.send(destroyRequest(3, 0));
  stays.send(createRequest(4, 12));
  stays.send(destroyRequest(5, 11));
  stays.send(destroyRequest(6, 11));
  stays.send(createRequest(7, 13));
  for (int i = 0; i < 7; ++i) ASSERT_TRUE(stays.receive());
  EXPECT_THAT(service->calls(), ElementsAre("create 11", "create 0", "destroy 0",
                                            "setConfiguration (null) 0", "destroy 11",
                                            "destroy 11", "create 13"));
  stays.hangUp();
  ASSERT_THAT(eventsAfter(3), ElementsAre(accepted(), "interrupted", "invalidated"));
  RawClient next(path);
  next.send(createRequest(1, 21));
  next.send(createRequest(2, 22));
  ASSERT_TRUE(next.receive());
  ASSERT_TRUE(next.receive());
  EXPECT_EQ(service->calls().back(), "create 22");
}

TEST_F(UnixSocketListener, LogsOneKindOfMisuseOfAUserOnceAMinuteAndCountsAll) {
  ListenerLimits limits;
  limits.ofUser.sessions = 0;
  const CapturedLog log;
  serve(limits);
  for (int i = 0; i < 3; ++i) {
    RawClient client(path);
    client.send(createRequest(1, 7));
    ASSERT_TRUE(client.receive());
    client.send(std::string(4, '\0'));
    EXPECT_EQ(client.receiveClosing(), "a frame is empty");
    EXPECT_TRUE(client.isEnded());
  }
  EXPECT_EQ(misuse->counts(), (MisuseLog::Counts{3, 0, 3}));
  EXPECT_THAT(log.lines(LogLevel::kError),
              UnorderedElementsAre(HasSubstr("gets no session: there are too many"),
                                   HasSubstr("is cut off: a frame is empty")));
}

}  // namespace
}  // namespace ostrel
