// An hour of each fault, and then none, on virtual time: a message comes every ten
// seconds, and in the end all are at the collector but those that were refused by name.
#include <gtest/gtest.h>

#include <chrono>
#include <cmath>
#include <ostream>
#include <set>
#include <string>

#include "forwarder/ForwarderTesting.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using std::chrono::milliseconds;
using std::chrono::minutes;
using std::chrono::nanoseconds;
using std::chrono::seconds;
using testing_support::CapturedLog;
using testing_support::FakeMarkKeeper;
using testing_support::FakeReportSource;
using testing_support::FakeTransport;
using testing_support::FakeWaits;
using testing_support::ReceivedRequest;
using testing_support::SeededRandom;
using testing_support::TakenRecords;

constexpr seconds kHour{3600};
constexpr seconds kBetweenMessages{10};
constexpr int kMessages = 420;  // Some come after the hour.

/// The store, the collector and the time of a scenario.
class World {
 public:
  World() {
    source.beforeRead = [this] { addDue(); };
    waits.nextChange = [this] { return waitForMessage(); };
    waits.mostPauses = 20'000;
  }

  seconds elapsed() const {
    return std::chrono::duration_cast<seconds>(clock.monotonicNow() - start_);
  }
  bool isFaulty() const { return elapsed() < kHour; }

  Reply take(const ReceivedRequest& request) {
    taken.take(request);
    return FakeTransport::status(200);
  }
  /// No reply came, after that time.
  Reply none(milliseconds time, const std::string& failure) {
    clock.advance(time);
    Reply reply;
    reply.failure = failure;
    return reply;
  }
  Reply status(int status, const std::string& retryAfter) {
    Reply reply = FakeTransport::status(status);
    reply.retryAfter = retryAfter;
    return reply;
  }

  /// Runs until nothing more comes, again and again when it is interrupted.
  void run(const FakeTransport::Answer& answer) {
    transport.answer = answer;
    do {
      isKilled = false;
      Forwarder({source, transport, marks, waits, clock, random}, {}, marks.saved).run();
    } while (isKilled);
  }
  Reply kill() {
    isKilled = true;
    Reply reply;
    reply.isInterrupted = true;
    return reply;
  }

  void makeStoreAnew() {
    source.store = "another store";
    source.reports.clear();
  }

  ManualClock clock;
  SeededRandom random{20261121};
  FakeReportSource source;
  FakeTransport transport;
  FakeMarkKeeper marks;
  FakeWaits waits{clock};
  TakenRecords taken;
  std::vector<std::string> sent;  // The IDs of all messages that there were.
  std::function<std::string(int)> payload = [](int) { return "plain"; };
  bool isKilled = false;

 private:
  void addDue() {
    while (added_ < kMessages && added_ * kBetweenMessages <= elapsed()) {
      source.add(payload(added_++));
      sent.push_back(recordID(source.reports.rbegin()->second, source.store));
    }
  }
  bool waitForMessage() {
    if (added_ == kMessages) return false;
    clock.advance(added_ * kBetweenMessages - elapsed() + milliseconds(1));
    return true;
  }

  const nanoseconds start_ = clock.monotonicNow();
  int added_ = 0;
};

struct Fault {
  const char* name;
  /// Sets it up and gives the collector's answer.
  std::function<FakeTransport::Answer(World&)> make;
  /// Whether a message may be missing; none: no one may.
  std::function<bool(int number)> mayMiss;
  /// Until all is forwarded.
  minutes longest{90};

  friend std::ostream& operator<<(std::ostream& out, const Fault& fault) {
    return out << fault.name;
  }
};

/// As long as it lasts, all requests are answered so.
std::function<FakeTransport::Answer(World&)> always(std::function<Reply(World&)> answer) {
  return [answer](World& world) {
    return [&world, answer](const ReceivedRequest& request) {
      return world.isFaulty() ? answer(world) : world.take(request);
    };
  };
}

std::function<FakeTransport::Answer(World&)> alwaysStatus(int status,
                                                          std::string retryAfter = "") {
  return always([=](World& world) { return world.status(status, retryAfter); });
}

std::function<FakeTransport::Answer(World&)> alwaysNone(milliseconds time,
                                                        std::string failure) {
  return always([=](World& world) { return world.none(time, failure); });
}

/// Every so many messages one is refused for good.
std::function<FakeTransport::Answer(World&)> poison(int every, int status) {
  return [=](World& world) {
    world.payload = [every](int number) {
      return number % every == 0 ? "poison" : "plain";
    };
    return [&world, status](const ReceivedRequest& request) {
      return request.has("poison") ? FakeTransport::status(status) : world.take(request);
    };
  };
}

FakeTransport::Answer takeAndHang(World& world) {
  return [&world](const ReceivedRequest& request) {
    const Reply taken = world.take(request);
    return world.isFaulty() ? world.none(seconds(30), "timed out") : taken;
  };
}

FakeTransport::Answer byteASecond(World& world) {
  return [&world](const ReceivedRequest& request) {
    Reply reply = world.take(request);
    if (world.isFaulty()) world.clock.advance(seconds(30));
    reply.body = "{\"partialSuccess\":{\"rejecte";
    return reply;
  };
}

FakeTransport::Answer slow(World& world) {
  return [&world](const ReceivedRequest& request) {
    if (world.isFaulty()) world.clock.advance(seconds(25));
    return world.take(request);
  };
}

FakeTransport::Answer gigabyte(World& world) {
  return [&world](const ReceivedRequest& request) {
    Reply reply = world.take(request);
    if (world.isFaulty()) reply.body.assign(Transport::kMostReplyBytes, 'x');
    return reply;
  };
}

FakeTransport::Answer retryAtDate(World& world) {
  return [&world](const ReceivedRequest& request) {
    if (!world.isFaulty()) return world.take(request);
    const auto then = static_cast<std::time_t>(world.clock.now().secondsSince1970) + 600;
    std::tm calendar{};
    char text[64];
    std::strftime(text, sizeof text, "%a, %d %b %Y %H:%M:%S GMT",
                  ::gmtime_r(&then, &calendar));
    return world.status(503, text);
  };
}

FakeTransport::Answer tooLarge(World& world) {
  return [&world](const ReceivedRequest& request) {
    return request.bytes > 8'000 ? FakeTransport::status(413) : world.take(request);
  };
}

FakeTransport::Answer oneTooLarge(World& world) {
  world.payload = [](int number) { return std::string(number == 200 ? 50'000 : 5, 'x'); };
  return [&world](const ReceivedRequest& request) {
    return request.bytes > 20'000 ? FakeTransport::status(413) : world.take(request);
  };
}

/// Takes out the first of each request, and says so.
FakeTransport::Answer takesOut(World& world) {
  world.payload = [](int number) { return number % 100 == 0 ? "unwanted" : "plain"; };
  return [&world](const ReceivedRequest& request) {
    ReceivedRequest kept = request;
    std::erase_if(kept.records, [](const auto& record) {
      return record.second.find("unwanted") != std::string::npos;
    });
    Reply reply = world.take(kept);
    reply.body = R"({"partialSuccess":{"rejectedLogRecords":")" +
                 std::to_string(request.records.size() - kept.records.size()) + "\"}}";
    return reply;
  };
}

FakeTransport::Answer flaps(World& world) {
  return [&world](const ReceivedRequest& request) {
    const bool isAway = world.isFaulty() && world.elapsed().count() / 60 % 2 == 0;
    return isAway ? world.none(milliseconds(1), "Connection refused")
                  : world.take(request);
  };
}

/// Half of the time before the request was read, half of it after.
FakeTransport::Answer cutsConnections(World& world) {
  return [&world](const ReceivedRequest& request) {
    if (!world.isFaulty() || world.random.uniform(2) == 0) return world.take(request);
    if (world.random.uniform(2) == 0) world.take(request);
    return world.none(milliseconds(1), "Connection reset by peer");
  };
}

FakeTransport::Answer answersAtRandom(World& world) {
  return [&world](const ReceivedRequest& request) {
    constexpr int kStatuses[] = {301, 401, 403, 404, 405, 408, 415,
                                 429, 500, 501, 502, 503, 504, 599};
    if (!world.isFaulty() || world.random.uniform(4) == 0) return world.take(request);
    return FakeTransport::status(kStatuses[world.random.uniform(std::size(kStatuses))]);
  };
}

FakeTransport::Answer unreadableStore(World& world) {
  const auto add = world.source.beforeRead;
  world.source.beforeRead = [&world, add] {
    add();
    world.source.fault.reset();
    if (world.isFaulty()) world.source.fault = "the store cannot be read";
  };
  return [&world](const ReceivedRequest& request) { return world.take(request); };
}

/// At half an hour, when all that came before was forwarded.
FakeTransport::Answer anotherStore(World& world) {
  const auto add = world.source.beforeRead;
  world.source.beforeRead = [&world, add] {
    if (world.elapsed() > kHour / 2 && world.source.store == "store") {
      world.makeStoreAnew();
    }
    add();
  };
  return [&world](const ReceivedRequest& request) { return world.take(request); };
}

FakeTransport::Answer killed(World& world) {
  return [&world](const ReceivedRequest& request) {
    if (!world.isFaulty() || world.random.uniform(3) != 0) return world.take(request);
    if (world.random.uniform(2) == 0) world.take(request);
    world.clock.advance(seconds(1));
    return world.kill();
  };
}

FakeTransport::Answer markIsNotKept(World& world) {
  return [&world](const ReceivedRequest& request) {
    world.marks.fails = world.isFaulty();
    Reply reply = world.take(request);
    if (!world.isFaulty() || world.random.uniform(50) != 0) return reply;
    return world.kill();
  };
}

/// The clock on the wall goes to 1970, 2038 and back, an hour at a time and ten years.
FakeTransport::Answer clockJumps(World& world) {
  return [&world](const ReceivedRequest& request) {
    if (!world.isFaulty()) return world.take(request);
    constexpr double kTimes[] = {0, 2147483647, 1769857200, 2085220800, 1769860800};
    world.clock.setWallClock(Date{kTimes[world.random.uniform(std::size(kTimes))]});
    return world.status(503, "Sat, 31 Jan 2026 12:00:00 GMT");
  };
}

const Fault kFaults[] = {
    {"IsDown", alwaysNone(milliseconds(1), "Connection refused"), {}},
    {"Hangs", alwaysNone(seconds(30), "Operation timed out"), {}},
    {"TakesAndNeverAnswers", takeAndHang, {}},
    {"AnswersAByteASecond", byteASecond, {}},
    {"IsSlow", slow, {}},
    {"AsksForPatience", alwaysStatus(429), {}},
    {"AsksForTwoMinutes", alwaysStatus(429, "120"), {}},
    {"AsksForATrillionSeconds", alwaysStatus(503, "1000000000000"), {}, minutes(1500)},
    {"AsksForATimeThatIsPast", alwaysStatus(503, "Sun, 06 Nov 1994 08:49:37 GMT"), {}},
    {"AsksForADate", retryAtDate, {}},
    {"RefusesSomeMessages", poison(97, 400), [](int number) { return number % 97 == 0; }},
    {"FailsOnAMessage", poison(300, 500), [](int number) { return number % 300 == 0; }},
    {"RefusesEveryOther", poison(2, 400), [](int number) { return number % 2 == 0; }},
    {"RefusesLargeRequests", tooLarge, {}},
    {"RefusesALargeMessage", oneTooLarge, [](int number) { return number == 200; }},
    {"TakesOutPart", takesOut, [](int number) { return number % 100 == 0; }},
    {"AnswersAGigabyte", gigabyte, {}},
    {"Redirects", alwaysStatus(307), {}},
    {"HasABadCertificate",
     alwaysNone(milliseconds(50), "SSL certificate problem: certificate has expired"),
     {}},
    {"HasNoAddress", alwaysNone(seconds(5), "Could not resolve host"), {}},
    {"WantsAnotherKey", alwaysStatus(401), {}},
    {"ForbidsIt", alwaysStatus(403), {}},
    {"IsNotAtThisPath", alwaysStatus(404), {}},
    {"IsBroken", alwaysStatus(500), {}},
    {"ComesAndGoes", flaps, {}},
    {"CutsConnections", cutsConnections, {}},
    {"AnswersAtRandom", answersAtRandom, {}},
    {"CannotBeSentTheStore", unreadableStore, {}},
    {"IsSentAnotherStore", anotherStore, {}},
    {"IsSentToByAForwarderThatIsKilled", killed, {}},
    {"IsSentToByAForwarderWithoutRoom", markIsNotKept, {}},
    {"AsksForADateWhileTheClockJumps", clockJumps, {}, minutes(1500)},
};

class CollectorThat : public ::testing::TestWithParam<Fault> {};

TEST_P(CollectorThat, CostsNothingThatItDidNotRefuse) {
  const Fault& fault = GetParam();
  const CapturedLog log;
  World world;

  world.run(fault.make(world));

  const auto drained = std::chrono::duration_cast<minutes>(world.elapsed());
  RecordProperty("minutes", static_cast<int>(drained.count()));
  ASSERT_EQ(world.sent.size(), static_cast<std::size_t>(kMessages));
  std::size_t missing = 0;
  for (std::size_t i = 0; i < world.sent.size(); ++i) {
    if (world.taken.has(world.sent[i])) continue;
    ++missing;
    EXPECT_TRUE(fault.mayMiss && fault.mayMiss(static_cast<int>(i))) << "lost: " << i;
  }
  EXPECT_EQ(world.taken.size() + missing, world.sent.size());
  EXPECT_EQ(world.marks.saved.parked + world.marks.saved.rejected,
            static_cast<std::int64_t>(missing));
  EXPECT_EQ(world.marks.saved.dropped, 0);
  EXPECT_GE(drained, kHour);
  EXPECT_LE(drained, fault.longest);
}

INSTANTIATE_TEST_SUITE_P(ForAnHour, CollectorThat, ::testing::ValuesIn(kFaults),
                         [](const auto& fault) { return fault.param.name; });

}  // namespace
}  // namespace ostrel
