#include "forwarder/Forwarder.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <numeric>

#include "forwarder/ForwarderTesting.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using std::chrono::milliseconds;
using testing_support::CapturedLog;
using testing_support::FakeMarkKeeper;
using testing_support::FakeReportSource;
using testing_support::FakeTransport;
using testing_support::FakeWaits;
using testing_support::ReceivedRequest;
using testing_support::SeededRandom;
using testing_support::TakenRecords;

class ForwarderTest : public ::testing::Test {
 protected:
  ForwarderTest() {
    transport_.answer = [this](const ReceivedRequest& request) { return take(request); };
  }

  void add(int count) {
    for (int i = 0; i < count; ++i) source_.add("plain");
  }
  /// The collector takes every request and says that it took so many messages out.
  void sayRejected(const std::string& count) {
    transport_.answer = [count](const ReceivedRequest&) {
      Reply reply = FakeTransport::status(200);
      reply.body = R"({"partialSuccess":{"rejectedLogRecords":")" + count + "\"}}";
      return reply;
    };
  }
  Reply take(const ReceivedRequest& request) {
    taken_.take(request);
    return FakeTransport::status(200);
  }
  /// Refuses what has "poison" in it.
  void refusePoison(int status) {
    transport_.answer = [this, status](const ReceivedRequest& request) {
      return request.has("poison") ? FakeTransport::status(status) : take(request);
    };
  }
  Forwarder forwarder() {
    return Forwarder({source_, transport_, marks_, waits_, clock_, random_}, {},
                     marks_.saved);
  }
  void run() { forwarder().run(); }

  CapturedLog log_;
  ManualClock clock_;
  SeededRandom random_{1};
  FakeReportSource source_;
  FakeTransport transport_;
  FakeMarkKeeper marks_;
  FakeWaits waits_{clock_};
  TakenRecords taken_;
};

TEST_F(ForwarderTest, SendsWhatThereIsInBatches) {
  add(1100);
  run();
  EXPECT_EQ(transport_.sizes, (std::vector<std::size_t>{512, 512, 76}));
  EXPECT_EQ(taken_.size(), 1100u);
  EXPECT_EQ(marks_.saved.store, "store");
  EXPECT_EQ(marks_.saved.through, 1100);
  EXPECT_EQ(marks_.saved.forwarded, 1100);
}

TEST_F(ForwarderTest, ReadsNoMoreThanAMebibyteAtOnce) {
  for (int i = 0; i < 5; ++i) source_.add(std::string(500'000, 'x'));
  run();
  EXPECT_EQ(transport_.sizes, (std::vector<std::size_t>{3, 2}));
}

TEST_F(ForwarderTest, SendsNoMoreThanTwoMebibytesAtOnce) {
  // Each takes six times as much when it is sent.
  for (int i = 0; i < 12; ++i) source_.add(std::string(80'000, '\x01'));
  run();
  EXPECT_EQ(taken_.size(), 12u);
  for (const std::size_t bytes : transport_.bytes) {
    EXPECT_LE(bytes, Forwarder::kMostRecordBytes + 1000);
  }
  EXPECT_EQ(transport_.sizes, (std::vector<std::size_t>{4, 4, 4}));
}

TEST_F(ForwarderTest, GoesOnWhereItStopped) {
  add(10);
  run();
  add(5);
  run();
  EXPECT_EQ(transport_.sizes, (std::vector<std::size_t>{10, 5}));
  EXPECT_EQ(taken_.repeated(), 0u);
}

TEST_F(ForwarderTest, SendsWhatComesLater) {
  int changes = 3;
  waits_.nextChange = [&] {
    if (changes == 0) return false;
    --changes;
    add(2);
    return true;
  };
  run();
  EXPECT_EQ(transport_.sizes, (std::vector<std::size_t>{2, 2, 2}));
}

TEST_F(ForwarderTest, SendsNothingAsLongAsThereIsNoStore) {
  source_.store.clear();
  run();
  EXPECT_TRUE(transport_.sizes.empty());
  EXPECT_TRUE(waits_.pauses.empty());
}

TEST_F(ForwarderTest, ParksTheOneMessageThatIsRefused) {
  add(400);
  source_.add("poison");
  add(400);
  refusePoison(400);
  run();
  EXPECT_EQ(taken_.size(), 800u);
  EXPECT_EQ(marks_.saved.parked, 1);
  EXPECT_EQ(marks_.saved.forwarded, 800);
  EXPECT_LE(transport_.sizes.size(), 25u);
  EXPECT_TRUE(waits_.pauses.empty());
  EXPECT_EQ(log_.lines(LogLevel::kError).size(), 1u);
}

TEST_F(ForwarderTest, ParksTheFirstAndTheLast) {
  source_.add("poison");
  add(3);
  source_.add("poison");
  refusePoison(400);
  run();
  EXPECT_EQ(taken_.size(), 3u);
  EXPECT_EQ(marks_.saved.parked, 2);
  EXPECT_EQ(marks_.saved.through, 5);
}

TEST_F(ForwarderTest, PausesForEachMessageOfACollectorThatRefusesAll) {
  add(1000);
  transport_.answer = [](const ReceivedRequest&) { return FakeTransport::status(400); };
  waits_.mostPauses = 5;
  run();
  EXPECT_EQ(marks_.saved.parked, Forwarder::kParkedAtOnce + 5);
  transport_.answer = [this](const ReceivedRequest& request) { return take(request); };
  waits_.mostPauses = 1'000'000;
  run();
  EXPECT_EQ(taken_.size(), 1000u - static_cast<std::size_t>(marks_.saved.parked));
}

TEST_F(ForwarderTest, FindsASizeThatTheCollectorTakes) {
  add(300);
  transport_.answer = [this](const ReceivedRequest& request) {
    return request.bytes > 20'000 ? FakeTransport::status(413) : take(request);
  };
  run();
  EXPECT_EQ(taken_.size(), 300u);
  EXPECT_EQ(marks_.saved.parked, 0);
}

TEST_F(ForwarderTest, DoesNotTryALargerSizeAgainAndAgain) {
  for (int i = 0; i < 200; ++i) source_.add(std::string(10'000, 'x'));
  int refused = 0;
  transport_.answer = [&](const ReceivedRequest& request) {
    if (request.bytes <= 300'000) return take(request);
    ++refused;
    return FakeTransport::status(413);
  };
  run();
  EXPECT_EQ(taken_.size(), 200u);
  EXPECT_LE(refused, 3);
}

TEST_F(ForwarderTest, ParksAMessageThatIsTooLargeAlone) {
  add(10);
  source_.add("poison");
  add(10);
  refusePoison(413);
  run();
  EXPECT_EQ(taken_.size(), 20u);
  EXPECT_EQ(marks_.saved.parked, 1);
}

TEST_F(ForwarderTest, ParksAMessageThatTheCollectorFailsOnAgainAndAgain) {
  add(100);
  source_.add("poison");
  add(100);
  refusePoison(500);
  run();
  EXPECT_EQ(taken_.size(), 200u);
  EXPECT_EQ(marks_.saved.parked, 1);
  EXPECT_GE(waits_.pauses.size(), 1u * Forwarder::kFailuresOfSuspect);
  EXPECT_LE(taken_.repeated(), 1u);
}

TEST_F(ForwarderTest, ParksNothingForACollectorThatFailsOnAll) {
  add(100);
  int attempts = 0;
  transport_.answer = [&](const ReceivedRequest& request) {
    return ++attempts < 200 ? FakeTransport::status(500) : take(request);
  };
  run();
  EXPECT_EQ(taken_.size(), 100u);
  EXPECT_EQ(marks_.saved.parked, 0);
}

TEST_F(ForwarderTest, WaitsWithTheLastMessageUntilAnotherShowsWhoseFaultItIs) {
  source_.add("poison");
  refusePoison(500);
  waits_.mostPauses = 50;
  run();
  EXPECT_EQ(marks_.saved.parked, 0);
  add(1);
  waits_.pauses.clear();
  waits_.mostPauses = 1'000'000;
  run();
  EXPECT_EQ(marks_.saved.parked, 1);
  EXPECT_EQ(taken_.size(), 1u);
}

TEST_F(ForwarderTest, CountsWhatTheCollectorTookOut) {
  add(10);
  sayRejected("3");
  run();
  EXPECT_EQ(marks_.saved.forwarded, 7);
  EXPECT_EQ(marks_.saved.rejected, 3);
  EXPECT_EQ(transport_.sizes, std::vector<std::size_t>{10});
}

TEST_F(ForwarderTest, CountsNoMoreTakenOutThanWasSent) {
  add(10);
  sayRejected("9223372036854775807");
  run();
  EXPECT_EQ(marks_.saved.forwarded, 0);
  EXPECT_EQ(marks_.saved.rejected, 10);
}

TEST_F(ForwarderTest, WaitsLongerEachTimeTheCollectorIsAway) {
  add(1);
  transport_.answer = [](const ReceivedRequest&) {
    Reply reply;
    reply.failure = "Connection refused";
    return reply;
  };
  waits_.mostPauses = 50;
  run();
  EXPECT_GE(waits_.pauses.front(), milliseconds(2500));
  EXPECT_LE(waits_.pauses.front(), milliseconds(5000));
  EXPECT_GE(waits_.pauses.back(), milliseconds(450'000));
  EXPECT_LE(waits_.pauses.back(), milliseconds(900'000));
  EXPECT_EQ(log_.lines(LogLevel::kError).size(), 1u);  // Not one for each attempt.
}

TEST_F(ForwarderTest, SaysThatItGoesOn) {
  add(1);
  int attempts = 0;
  transport_.answer = [&](const ReceivedRequest& request) {
    return ++attempts < 3 ? FakeTransport::status(503) : take(request);
  };
  run();
  EXPECT_EQ(log_.lines(LogLevel::kError).size(), 1u);
  EXPECT_EQ(log_.lines(LogLevel::kDefault).size(), 1u);
}

TEST_F(ForwarderTest, CountsWhatWasGoneFromTheStore) {
  add(100);
  source_.reports.erase(source_.reports.find(1), source_.reports.find(11));
  source_.reports.erase(50);
  run();
  EXPECT_EQ(marks_.saved.dropped, 11);
  EXPECT_EQ(marks_.saved.forwarded, 89);
}

TEST_F(ForwarderTest, CountsWhatWentWhileTheCollectorWasAway) {
  add(100);
  int attempts = 0;
  transport_.answer = [&](const ReceivedRequest& request) {
    if (++attempts > 3) return take(request);
    source_.reports.erase(source_.reports.begin());
    return FakeTransport::status(503);
  };
  run();
  EXPECT_EQ(marks_.saved.dropped, 3);
  EXPECT_EQ(taken_.size(), 97u);
}

TEST_F(ForwarderTest, BeginsAnewWithANewStore) {
  add(10);
  run();
  source_.store = "another";
  source_.reports.clear();
  add(12);
  run();
  EXPECT_EQ(taken_.size(), 22u);
  EXPECT_EQ(marks_.saved.store, "another");
  EXPECT_EQ(marks_.saved.through, 12);
  EXPECT_EQ(marks_.saved.dropped, 0);
  EXPECT_EQ(marks_.saved.forwarded, 22);
}

TEST_F(ForwarderTest, BeginsAnewWithAStoreThatWasEmptied) {
  add(10);
  run();
  source_.reports.clear();
  source_.add("plain");
  source_.reports.at(1).createdAt = 5;
  run();
  EXPECT_EQ(taken_.size(), 11u);
}

TEST_F(ForwarderTest, TriesAgainWhenTheStoreCannotBeRead) {
  add(3);
  source_.fault = "the store is locked";
  int reads = 0;
  source_.beforeRead = [&] {
    if (++reads == 4) source_.fault.reset();
  };
  run();
  EXPECT_EQ(waits_.pauses.size(), 3u);
  EXPECT_EQ(taken_.size(), 3u);
}

TEST_F(ForwarderTest, GoesOnWithoutAMarkThatCannotBeKept) {
  add(600);
  marks_.fails = true;
  run();
  EXPECT_EQ(taken_.size(), 600u);
  EXPECT_EQ(taken_.repeated(), 0u);
  EXPECT_EQ(log_.lines(LogLevel::kError).size(), 1u);
  marks_.fails = false;
  run();
  EXPECT_EQ(taken_.size(), 600u);
  EXPECT_EQ(taken_.repeated(), 600u);
}

TEST_F(ForwarderTest, EndsWhenARequestIsInterrupted) {
  add(3);
  transport_.answer = [](const ReceivedRequest&) {
    Reply reply;
    reply.isInterrupted = true;
    return reply;
  };
  run();
  EXPECT_EQ(marks_.saved, ForwardMark());
}

TEST_F(ForwarderTest, DoneOnceSucceedsWhenAllWasTaken) {
  EXPECT_TRUE(forwarder().runOnce().succeeded);
  add(600);
  EXPECT_TRUE(forwarder().runOnce().succeeded);
  EXPECT_EQ(taken_.size(), 600u);
}

TEST_F(ForwarderTest, DoneOnceSaysWhatWasNotTaken) {
  add(3);
  source_.add("poison");
  refusePoison(400);
  const Success success = forwarder().runOnce();
  EXPECT_FALSE(success.succeeded);
  EXPECT_EQ(success.error->description,
            "1 messages were refused by the collector or gone from the store before they "
            "could be sent");
  EXPECT_EQ(taken_.size(), 3u);
  EXPECT_TRUE(forwarder().runOnce().succeeded);  // It was told.
}

TEST_F(ForwarderTest, DoneOnceDoesNotWait) {
  add(1);
  transport_.answer = [](const ReceivedRequest&) { return FakeTransport::status(503); };
  const Success success = forwarder().runOnce();
  EXPECT_FALSE(success.succeeded);
  EXPECT_EQ(success.error->description,
            "the collector does not take anything now: it answers with status 503");
  EXPECT_TRUE(waits_.pauses.empty());
}

}  // namespace
}  // namespace ostrel
