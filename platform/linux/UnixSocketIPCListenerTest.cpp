#include "platform/linux/UnixSocketIPCListener.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>

#include <chrono>
#include <cstring>
#include <filesystem>
#include <string>
#include <string_view>
#include <thread>

#include "platform/linux/OwnProcess.h"
#include "platform/linux/UnixSocketIPCListenerTestSupport.h"

namespace ostrel {
namespace {

using namespace std::chrono_literals;
using namespace testing_support;
using testing::ElementsAre;
using testing::HasSubstr;

TEST_F(UnixSocketListener, TellsAClientThatItIsRefusedAndInterruptsNobody) {
  isRefusing = true;
  serve();
  RawClient client(path);
  EXPECT_EQ(client.receiveClosing(), "the service refused");
  EXPECT_TRUE(client.isEnded());
  EXPECT_THAT(eventsAfter(1), ElementsAre("invalidated"));
  EXPECT_EQ(misuse->counts(), MisuseLog::Counts()) << "it did nothing wrong";
}

TEST_F(UnixSocketListener, CarriesOutRequestsInTheirOrder) {
  serve();
  RawClient client(path);

  client.send(createRequest(1, -5));
  client.send(messageRequest(2, "hello"));
  client.send(reportersRequest(3));

  ASSERT_TRUE(service->waitForCalls(3));
  EXPECT_THAT(service->calls(),
              ElementsAre("create -5", "send {text: hello} 0 0 (1)", "getAllReporters"));
}

TEST_F(UnixSocketListener, RepliesUnderTheRequestsNumber) {
  serve();
  service->setReporters({ReporterID{1}, ReporterID{-2}});
  RawClient client(path);

  client.send(createRequest(1, 7));
  client.send(messageRequest(500, "x"));
  client.send(reportersRequest(70000));

  EXPECT_EQ(hex(*client.receive()), "8201f5");
  EXPECT_EQ(hex(*client.receive()), "821901f4f6");
  EXPECT_EQ(hex(*client.receive()), "821a00011170820121");
}

TEST_F(UnixSocketListener, SendsEveryReplyOfARequest) {
  serve();
  RawClient client(path);
  wire::Request request;
  request.operation = wire::Operation::kGetServiceNameForReporterID;
  request.number = 9;

  client.send(request);

  EXPECT_EQ(hex(*client.receive()), "820902");
  EXPECT_EQ(hex(*client.receive()), "820903");
}

TEST_F(UnixSocketListener, SendsNoReplyToNumberZero) {
  serve();
  RawClient client(path);

  client.send(createRequest(0, 7));
  client.send(createRequest(1, 8));

  EXPECT_EQ(hex(*client.receive()), "8201f5");
}

TEST_F(UnixSocketListener, TakesAFrameInSingleBytes) {
  serve();
  RawClient client(path);
  std::string frames;
  wire::appendRequest(frames, messageRequest(1, std::string(300, 'x')));
  wire::appendRequest(frames, createRequest(2, 7));

  for (const char byte : frames) client.send(std::string_view(&byte, 1));

  EXPECT_EQ(hex(*client.receive()), "8201f6");
  EXPECT_EQ(hex(*client.receive()), "8202f5");
}

TEST_F(UnixSocketListener, TakesThousandsOfFramesAtOnce) {
  serve();
  RawClient client(path);
  std::string frames;
  for (int i = 1; i <= 20'000; ++i) wire::appendRequest(frames, messageRequest(0, "x"));
  wire::appendRequest(frames, createRequest(1, 7));

  std::thread sender([&] { client.send(frames); });
  const auto reply = client.receive(20s);
  sender.join();

  ASSERT_TRUE(reply);
  EXPECT_EQ(service->calls().size(), 20'001);
}

TEST_F(UnixSocketListener, SaysThreeMessagesAheadWhomTheyAreFor) {
  serve();
  RawClient client(path);
  const auto messageTo = [](std::int64_t id) {
    wire::Request request = messageRequest(0, "x");
    request.reporterIDs = ReporterIDs{ReporterID{id}};
    return request;
  };
  std::string frames;
  for (const std::int64_t id : {100, 200, 200}) {
    wire::appendRequest(frames, messageTo(id));
  }
  wire::appendRequest(frames, reportersRequest(0));
  for (const std::int64_t id : {300, 400}) wire::appendRequest(frames, messageTo(id));
  client.send(frames);
  ASSERT_TRUE(service->waitForCalls(6));

  using Expected = std::pair<ReporterID, std::size_t>;
  const std::vector<Expected> expected = {{ReporterID{100}, 0}, {ReporterID{200}, 0},
                                          {kNoReporter, 0},     {kNoReporter, 0},
                                          {ReporterID{300}, 1}, {ReporterID{400}, 2}};
  EXPECT_EQ(service->expected(), expected);
}

TEST_F(UnixSocketListener, JoinsTheBeginningOfAFrameWithItsRestAtEveryLength) {
  serve();
  RawClient client(path);
  std::string frame;
  wire::appendRequest(frame, messageRequest(1, std::string(4200, 'x')));
  std::string second;
  wire::appendRequest(second, createRequest(2, 7));

  for (const std::size_t split : {1, 3, 4, 5, 2047, 2048, 2049, 4096, 4200}) {
    client.send(frame.substr(0, split));
    EXPECT_FALSE(client.receive(20ms)) << split;
    client.send(frame.substr(split) + second);
    EXPECT_EQ(hex(client.receive().value_or("")), "8201f6") << split;
    EXPECT_EQ(hex(client.receive().value_or("")), "8202f5") << split;
  }
}

TEST_F(UnixSocketListener, EndsAClientWhoseFrameIsEmptyOrClaimsTheMost) {
  serve();
  RawClient empty(path);
  RawClient largest(path);

  empty.send(std::string(4, '\0'));
  largest.send(std::string(4, '\xFF'));

  EXPECT_EQ(empty.receiveClosing(), "a frame is empty");
  EXPECT_EQ(largest.receiveClosing(), "a frame is too large");
}

TEST_F(UnixSocketListener, TellsAClientThatBreaksTheRulesWhyAndCallsItInterrupted) {
  serve();
  RawClient client(path);

  client.send(std::string("\x01\0\0\0\x00", 5));

  EXPECT_EQ(client.receiveClosing(), "the frame is not a request");
  EXPECT_TRUE(client.isEnded());
  EXPECT_THAT(eventsAfter(3), ElementsAre(accepted(), "interrupted", "invalidated"));
}

TEST_F(UnixSocketListener, DoesNotCallAFarewellAnInterruption) {
  serve();
  RawClient client(path);
  std::string farewell;
  wire::appendFarewell(farewell);

  client.send(farewell);

  EXPECT_TRUE(client.isEnded());
  EXPECT_THAT(eventsAfter(2), ElementsAre(accepted(), "invalidated"));
}

TEST_F(UnixSocketListener, CallsAClientThatVanishesInterruptedOnce) {
  serve();
  RawClient client(path);
  eventsAfter(1);

  client.hangUp();

  EXPECT_THAT(eventsAfter(3), ElementsAre(accepted(), "interrupted", "invalidated"));
}

TEST_F(UnixSocketListener, CarriesOutWhatAClientSentBeforeItVanished) {
  serve();
  {
    RawClient client(path);
    for (int i = 0; i < 100; ++i) client.send(messageRequest(1, "x"));
  }

  EXPECT_TRUE(service->waitForCalls(100));
  EXPECT_THAT(eventsAfter(3), ElementsAre(accepted(), "interrupted", "invalidated"));
  EXPECT_EQ(service->calls().size(), 100);
}

TEST_F(UnixSocketListener, ForgetsAFrameThatNeverBecomesWhole) {
  serve();
  {
    RawClient client(path);
    std::string frame;
    wire::appendRequest(frame, createRequest(1, 7));
    client.send(frame.substr(0, frame.size() - 1));
  }

  EXPECT_THAT(eventsAfter(3), ElementsAre(accepted(), "interrupted", "invalidated"));
  EXPECT_THAT(service->calls(), ElementsAre());
}

TEST_F(UnixSocketListener, TakesNoDescriptorsFromAClient) {
  serve();
  RawClient client(path);
  client.send(createRequest(1, 7));
  ASSERT_TRUE(client.receive());
  const std::size_t before = openDescriptors();
  char byte = 0;
  iovec place{&byte, 1};
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))]{};
  msghdr message{};
  message.msg_iov = &place;
  message.msg_iovlen = 1;
  message.msg_control = control;
  message.msg_controllen = sizeof control;
  cmsghdr* header = CMSG_FIRSTHDR(&message);
  header->cmsg_level = SOL_SOCKET;
  header->cmsg_type = SCM_RIGHTS;
  header->cmsg_len = CMSG_LEN(sizeof(int));
  const int passed = client.socket();
  std::memcpy(CMSG_DATA(header), &passed, sizeof passed);

  ASSERT_EQ(::sendmsg(client.socket(), &message, MSG_NOSIGNAL), 1);

  EXPECT_EQ(client.receiveClosing(), "descriptors are not taken");
  eventsAfter(3);
  EXPECT_LT(openDescriptors(), before);
}

TEST_F(UnixSocketListener, GivesBackEveryDescriptorOfManyConnections) {
  serve();
  const std::size_t before = openDescriptors();

  for (int i = 0; i < 500; ++i) {
    RawClient client(path);
    client.send(createRequest(1, 7));
    EXPECT_TRUE(client.receive());
  }

  EXPECT_EQ(eventsAfter(1500).size(), 1500);
  EXPECT_LE(openDescriptors(), before + 1);
}

TEST_F(UnixSocketListener, KnowsWhichProcessConnected) {
  serve();
  RawClient client(path);

  EXPECT_THAT(eventsAfter(1), ElementsAre(accepted()));
}

TEST_F(UnixSocketListener, TellsEveryClientOfItsEndAndInvalidatesThem) {
  serve();
  RawClient client(path);
  client.send(createRequest(1, 7));
  ASSERT_TRUE(client.receive());

  stop();

  EXPECT_EQ(client.receiveClosing(), "the service ends");
  EXPECT_THAT(eventsAfter(2), ElementsAre(accepted(), "invalidated"));
}

TEST_F(UnixSocketListener, RefusesToShareItsSocketAndTheFirstGoesOn) {
  serve();

  const auto second = UnixSocketIPCListener::open(path, peers);

  ASSERT_FALSE(second.value);
  EXPECT_THAT(second.error->description, HasSubstr("already listening"));
  RawClient client(path);
  client.send(createRequest(1, 7));
  EXPECT_TRUE(client.receive());
}

TEST_F(UnixSocketListener, ReplacesWhatADeadServiceLeft) {
  std::filesystem::create_directories(directory / "run");
  directory.write("run/reporting.sock", "stale");

  serve();

  RawClient client(path);
  client.send(createRequest(1, 7));
  EXPECT_TRUE(client.receive());
}

TEST_F(UnixSocketListener, LetsOwnerAndGroupConnectAndNobodyElse) {
  serve();
  struct stat status {};
  ASSERT_EQ(::stat(path.c_str(), &status), 0);

  EXPECT_EQ(status.st_mode & 0777, 0660u);
}

TEST_F(UnixSocketListener, LeavesNoSocketBehind) {
  serve();

  stop();

  EXPECT_FALSE(std::filesystem::exists(path));
}

TEST_F(UnixSocketListener, SaysToTheServiceManagerThatItIsReady) {
  const std::string notify = directory / "notify";
  const FileDescriptor manager = boundSocket(SOCK_DGRAM, notify);
  ASSERT_TRUE(manager);
  ::setenv("NOTIFY_SOCKET", notify.c_str(), /*replace=*/1);

  serve();

  pollfd waited{manager.get(), POLLIN, 0};
  EXPECT_EQ(::poll(&waited, 1, 5000), 1);
  char text[64]{};
  EXPECT_GT(::recv(manager.get(), text, sizeof text - 1, 0), 0);
  EXPECT_STREQ(text, "READY=1");
  stop();
  ::unsetenv("NOTIFY_SOCKET");
}

}  // namespace
}  // namespace ostrel
