// What is told of clients that use sessions of other users' clients, which they may.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <memory>
#include <optional>
#include <ostream>
#include <string>
#include <vector>

#include "platform/linux/UnixSocketIPCListenerTestSupport.h"

namespace ostrel {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::SizeIs;
using testing_support::CapturedLog;
using testing_support::createRequest;
using testing_support::messageRequest;
using testing_support::RawClient;
using wire::Operation;

constexpr std::uint32_t kMaker = 1000;
constexpr std::uint32_t kActor = 1001;

wire::Request requestFor(Operation operation, std::int64_t id) {
  wire::Request request = createRequest(/*number=*/1, id);
  request.operation = operation;
  if (operation == Operation::kSetConfiguration) request.dictionary = Dictionary();
  return request;
}

wire::Request messageTo(std::optional<ReporterIDs> ids) {
  wire::Request request = messageRequest(/*number=*/1, "x");
  request.reporterIDs = std::move(ids);
  return request;
}

class UsesOfOthers : public testing_support::UnixSocketListener {
 protected:
  UsesOfOthers() {
    identityOf = [this](int) { return PeerIdentity{::getpid(), userOfNext_}; };
    now = [this] { return PeerConnection::Clock::time_point(time_.load()); };
  }
  ~UsesOfOthers() override { stop(); }

  std::unique_ptr<RawClient> clientOf(std::uint32_t user) {
    userOfNext_ = user;
    auto client = std::make_unique<RawClient>(path);
    settle(*client);
    return client;
  }
  /// Until all that it sent before has been carried out, and told.
  static void settle(RawClient& client) {
    client.send(requestFor(Operation::kReporterIDValid, 99));
    client.send(testing_support::reportersRequest(2));
    while (const auto reply = client.receive()) {
      if (reply->size() > 1 && (*reply)[1] == '\x02') return;
    }
    ADD_FAILURE() << "not answered";
  }
  static void ask(RawClient& client, const wire::Request& request) {
    client.send(request);
    settle(client);
  }
  void pass(std::chrono::nanoseconds time) { time_ = time_.load() + time; }

  std::uint64_t uses() const {
    return misuse->counts()[static_cast<std::size_t>(MisuseLog::Kind::kUseOfOthers)];
  }
  std::vector<std::string> told() const {
    std::vector<std::string> lines;
    for (const std::string& line : log_.lines(LogLevel::kDefault)) {
      const auto at = line.find("a client of user");
      if (at != std::string::npos) lines.push_back(line.substr(at));
    }
    return lines;
  }

 private:
  const CapturedLog log_;
  std::atomic<std::uint32_t> userOfNext_{0};
  std::atomic<std::chrono::nanoseconds> time_{std::chrono::hours(1)};
};

struct Deed {
  std::string name;
  wire::Request request;
  std::vector<std::int64_t> used;  // Of the other user's sessions 7 and 8.
  std::string verb;

  friend std::ostream& operator<<(std::ostream& out, const Deed& deed) {
    return out << deed.name;
  }
};

class UsesOfOthersBy : public UsesOfOthers, public testing::WithParamInterface<Deed> {};

TEST_P(UsesOfOthersBy, AreToldAsTheyAre) {
  serve();
  const auto maker = clientOf(kMaker);
  ask(*maker, createRequest(1, 7));
  const auto actor = clientOf(kActor);
  ask(*maker, createRequest(1, 8));
  ask(*actor, createRequest(1, 5));
  EXPECT_EQ(uses(), 0u);

  ask(*actor, GetParam().request);

  const std::vector<std::int64_t>& used = GetParam().used;
  EXPECT_EQ(uses(), used.size());
  if (used.empty()) {
    EXPECT_THAT(told(), IsEmpty());
  } else {
    EXPECT_THAT(told(),
                ElementsAre("a client of user 1001 uses a session of another user: it " +
                            GetParam().verb + " " + std::to_string(used.front()) +
                            ", which a client of user 1000 made"));
  }

  ask(*maker, GetParam().request);
  const bool isOfActor = GetParam().name.find("Own") != std::string::npos;
  EXPECT_EQ(uses(), isOfActor ? 1u : used.size()) << "its own are nobody else's";
}

const Deed kDeeds[] = {
    {"Start", requestFor(Operation::kStartReportingSessionForID, 7), {7}, "starts"},
    {"Stop", requestFor(Operation::kStopReportingSessionForID, 8), {8}, "stops"},
    {"Configure", requestFor(Operation::kSetConfiguration, 7), {7}, "configures"},
    {"Message", messageTo(ReporterIDs{ReporterID{8}}), {8}, "sends to"},
    {"MessageToSeveral",
     messageTo(ReporterIDs{ReporterID{0}, ReporterID{6}, ReporterID{8}, ReporterID{7},
                           ReporterID{8}}),
     {8, 7, 8},
     "sends to"},
    {"MessageToNone", messageTo(ReporterIDs()), {}, ""},
    // It is for all, thus for nobody's; the others reach the client's own sessions alone,
    // or nobody's, or change nothing.
    {"MessageToAll", messageTo(std::nullopt), {}, ""},
    {"Destroy", requestFor(Operation::kDestroyReportingSession, 7), {}, ""},
    {"SetType", requestFor(Operation::kSetServiceType, 7), {}, ""},
    {"Create", createRequest(1, 7), {}, ""},
    {"AskForType", requestFor(Operation::kGetServiceNameForReporterID, 7), {}, ""},
    {"AskWhetherThere", requestFor(Operation::kReporterIDValid, 7), {}, ""},
    {"AskForAll", requestFor(Operation::kGetAllReporters, 7), {}, ""},
    {"StartOfOwn", requestFor(Operation::kStartReportingSessionForID, 5), {}, ""},
    {"StopOfOwn", requestFor(Operation::kStopReportingSessionForID, 5), {}, ""},
    {"ConfigureOwn", requestFor(Operation::kSetConfiguration, 5), {}, ""},
    {"MessageToOwn", messageTo(ReporterIDs{ReporterID{5}}), {}, ""},
    {"StartOfNone", requestFor(Operation::kStartReportingSessionForID, 6), {}, ""},
    {"StopOfNone", requestFor(Operation::kStopReportingSessionForID, 0), {}, ""},
    {"ConfigureNone", requestFor(Operation::kSetConfiguration, 0), {}, ""},
    {"MessageToAbsent", messageTo(ReporterIDs{ReporterID{6}, ReporterID{0}}), {}, ""},
};

INSTANTIATE_TEST_SUITE_P(Of, UsesOfOthersBy, testing::ValuesIn(kDeeds),
                         [](const auto& deed) { return deed.param.name; });

TEST_F(UsesOfOthers, AreToldOnceAMinuteForEachUserAndCountedEachTime) {
  serve();
  const auto maker = clientOf(kMaker);
  ask(*maker, createRequest(1, 7));
  const auto actor = clientOf(kActor);
  const wire::Request stop = requestFor(Operation::kStopReportingSessionForID, 7);
  ask(*actor, stop);
  pass(limits::kMisuseLogInterval - std::chrono::nanoseconds(1));
  ask(*actor, stop);
  EXPECT_THAT(told(), SizeIs(1));
  ask(*clientOf(1002), stop);
  EXPECT_THAT(told(), ElementsAre(HasSubstr("user 1001 uses"), HasSubstr("1002 uses")));
  pass(std::chrono::nanoseconds(1));
  ask(*actor, stop);
  ask(*clientOf(kActor), stop);
  EXPECT_THAT(told(), SizeIs(3));
  EXPECT_EQ(uses(), 5u);
}

TEST_F(UsesOfOthers, AreNoneAmongClientsOfOneUser) {
  serve();
  const auto one = clientOf(kMaker);
  const auto two = clientOf(kMaker);
  const auto three = clientOf(kActor);
  for (const auto& [client, id] : {std::pair(&one, 7), std::pair(&two, 8)}) {
    ask(**client, createRequest(1, id));
  }
  ask(*one, requestFor(Operation::kStartReportingSessionForID, 8));
  ask(*two, requestFor(Operation::kStartReportingSessionForID, 7));
  EXPECT_EQ(uses(), 0u);
}

// The one of the client that connected first is the one that requests find.
TEST_F(UsesOfOthers, AreToldWhereAClientHasASessionUnderTheIDItself) {
  serve();
  const wire::Request start = requestFor(Operation::kStartReportingSessionForID, 7);
  const auto squatter = clientOf(kMaker);
  const auto client = clientOf(kActor);
  ask(*client, createRequest(1, 7));
  ask(*client, start);
  EXPECT_EQ(uses(), 0u);
  ask(*squatter, createRequest(1, 7));
  ask(*client, start);
  EXPECT_EQ(uses(), 1u);
  ask(*squatter, start);
  EXPECT_EQ(uses(), 1u);
  ask(*squatter, testing_support::destroyRequest(1, 7));
  ask(*client, start);
  EXPECT_EQ(uses(), 1u) << "it is its own again";
  ask(*squatter, start);
  EXPECT_EQ(uses(), 2u);
}

TEST_F(UsesOfOthers, EndWithTheSession) {
  serve();
  const wire::Request start = requestFor(Operation::kStartReportingSessionForID, 7);
  auto maker = clientOf(kMaker);
  ask(*maker, createRequest(1, 7));
  ask(*maker, createRequest(1, 8));
  const auto actor = clientOf(kActor);
  ask(*maker, testing_support::destroyRequest(1, 7));
  ask(*actor, start);
  EXPECT_EQ(uses(), 0u);

  ask(*maker, createRequest(1, 7));
  ask(*maker, createRequest(1, 7));
  ask(*actor, start);
  EXPECT_EQ(uses(), 1u) << "it was replaced, and is there";

  const std::size_t before = eventsAfter(2).size();
  maker.reset();
  eventsAfter(before + 2);
  ask(*actor, start);
  ask(*actor, requestFor(Operation::kStartReportingSessionForID, 8));
  EXPECT_EQ(uses(), 1u) << "they went with their client";
}

}  // namespace
}  // namespace ostrel
