// That the manual twins keep time and order as the tests on them believe, and
// end a test that misuses them.
#include "platform/fake/FakePlatform.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/Logging.h"

namespace ostrel {
namespace {

using std::chrono::milliseconds;
using std::chrono::nanoseconds;
using std::chrono::seconds;
using testing::ElementsAre;

LogScope testScope("test", "reporting_test_verbose");

class FakePlatformTest : public testing::Test {
 protected:
  std::shared_ptr<WorkQueue> makeQueue(std::string_view label = "test") {
    return fake_.workQueues->makeSerialQueue(label, QualityOfService::kUtility,
                                             /*relativePriority=*/0);
  }
  Task note(std::string text) {
    return [this, text = std::move(text)] { fake_.events->add(text); };
  }

  FakePlatform fake_;
};

TEST_F(FakePlatformTest, RunsStepsOfAllQueuesInTheOrderOfQueueing) {
  const auto a = makeQueue();
  const auto b = makeQueue();
  a->async(note("a1"));
  b->async(note("b1"));
  fake_.workQueues->backgroundQueue().asyncAfter(nanoseconds(0), note("background"));
  a->async(note("a2"));
  fake_.runUntilIdle();
  EXPECT_THAT(fake_.events->all(), ElementsAre("a1", "b1", "background", "a2"));
}

TEST_F(FakePlatformTest, RunsOneStepAtATimeWhenAsked) {
  const auto queue = makeQueue();
  queue->async(note("first"));
  queue->async(note("second"));
  EXPECT_TRUE(fake_.workQueues->runOne());
  EXPECT_THAT(fake_.events->all(), ElementsAre("first"));
  EXPECT_TRUE(fake_.workQueues->runOne());
  EXPECT_FALSE(fake_.workQueues->runOne());
}

TEST_F(FakePlatformTest, RunsNothingUntilAsked) {
  makeQueue()->async(note("step"));
  EXPECT_TRUE(fake_.events->all().empty());
  EXPECT_EQ(fake_.workQueues->runUntilIdle(), 1u);
}

TEST_F(FakePlatformTest, StopsTheClockAtEachDelayOnTheWay) {
  std::vector<nanoseconds> times;
  const nanoseconds start = fake_.clock->monotonicNow();
  ConcurrentQueue& background = fake_.workQueues->backgroundQueue();
  background.asyncAfter(seconds(1), [&] {
    times.push_back(fake_.clock->monotonicNow() - start);
    background.asyncAfter(seconds(1),
                          [&] { times.push_back(fake_.clock->monotonicNow() - start); });
  });
  background.asyncAfter(milliseconds(1500),
                        [&] { times.push_back(fake_.clock->monotonicNow() - start); });
  fake_.advance(milliseconds(1999));
  EXPECT_THAT(times, ElementsAre(seconds(1), milliseconds(1500)));
  fake_.advance(milliseconds(1));
  EXPECT_THAT(times, ElementsAre(seconds(1), milliseconds(1500), seconds(2)));
  EXPECT_EQ(fake_.clock->monotonicNow() - start, seconds(2));
}

TEST_F(FakePlatformTest, TellsTheDelaysThatTheBackgroundQueueWasGiven) {
  fake_.workQueues->backgroundQueue().asyncAfter(seconds(59), [] {});
  fake_.workQueues->backgroundQueue().asyncAfter(nanoseconds(0), [] {});
  EXPECT_THAT(fake_.workQueues->backgroundDelays(),
              ElementsAre(nanoseconds(seconds(59)), nanoseconds(0)));
}

TEST_F(FakePlatformTest, MovesTheWallClockWithTheMonotonicOne) {
  fake_.advance(milliseconds(2500));
  EXPECT_EQ(fake_.clock->now().secondsSince1970,
            ManualClock::kStart.secondsSince1970 + 2.5);
  fake_.clock->setWallClock({5});
  EXPECT_EQ(fake_.clock->now(), Date{5});
}

TEST_F(FakePlatformTest, CanRunAnOperationAsAStepOfAQueue) {
  const auto queue = fake_.workQueues->makeSerialQueue("own", QualityOfService::kUtility,
                                                       /*relativePriority=*/0);
  const auto manual = fake_.workQueues->queue("own");
  bool wasCurrent = false;
  manual->runAs([&] { wasCurrent = queue->isCurrent(); });
  EXPECT_TRUE(wasCurrent);
  EXPECT_FALSE(queue->isCurrent());
}

TEST_F(FakePlatformTest, CanSuspendAQueueInsideAnOperationRunAsAStep) {
  const auto queue = makeQueue("own");
  queue->async(note("waits"));
  fake_.workQueues->queue("own")->runAs([&] { queue->suspend(); });
  fake_.runUntilIdle();
  EXPECT_TRUE(fake_.workQueues->queue("own")->isSuspended());
  EXPECT_EQ(fake_.workQueues->queue("own")->waitingCount(), 1u);
  queue->resume(note("first"));
  fake_.runUntilIdle();
  EXPECT_THAT(fake_.events->all(), ElementsAre("first", "waits"));
}

TEST_F(FakePlatformTest, RunsAStepOfTheQueueThatTheTestChooses) {
  const auto first = makeQueue("first");
  const auto second = makeQueue("second");
  first->async(note("first"));
  second->async(note("second"));
  const auto ready = fake_.workQueues->readyQueues();
  ASSERT_EQ(ready.size(), 2u);
  fake_.workQueues->runOneOf(ready[1], /*position=*/0);
  EXPECT_EQ(fake_.workQueues->readyQueues(), std::vector<std::size_t>{ready[0]});
  fake_.workQueues->runOneOf(ready[0], /*position=*/0);
  EXPECT_TRUE(fake_.workQueues->readyQueues().empty());
  EXPECT_THAT(fake_.events->all(), ElementsAre("second", "first"));
}

TEST_F(FakePlatformTest, RunsTheBackgroundStepThatTheTestChooses) {
  fake_.workQueues->backgroundQueue().asyncAfter(seconds(0), note("first"));
  fake_.workQueues->backgroundQueue().asyncAfter(seconds(0), note("second"));
  EXPECT_EQ(fake_.workQueues->backgroundCount(), 2u);
  fake_.workQueues->runOneOf(/*number=*/0, /*position=*/1);
  fake_.workQueues->runOneOf(/*number=*/0, /*position=*/0);
  EXPECT_THAT(fake_.events->all(), ElementsAre("second", "first"));
}

TEST_F(FakePlatformTest, ShowsTheArgumentsOfCallsWhenAsked) {
  fake_.events->showArguments();
  fake_.telemetryBackend->sendOneMessage({{"a", 1}}, {{"b", 1.0}}, /*category=*/2,
                                         /*type=*/3, {{"c", "1"}});
  fake_.analyticsSink->sendEventLazy("name", [] { return Dictionary{{"d", true}}; });
  EXPECT_THAT(
      fake_.events->take(),
      ElementsAre("backend.sendOneMessage 2 3 {\"a\":1} {\"b\":1.0} {\"c\":\"1\"}",
                  "analytics name {\"d\":true}"));
  EXPECT_TRUE(fake_.events->all().empty());
}

TEST_F(FakePlatformTest, ForgetsTheCompletionOfADiscovery) {
  fake_.telemetryBackend->setDiscovery(FakeDiscovery::held());
  const auto held = std::make_shared<int>(0);
  const auto session =
      fake_.telemetryBackend->createSession({}, {}, /*frameworksToCheck=*/{});
  session->startConfiguration([held](const std::optional<Array>&) {});
  EXPECT_EQ(held.use_count(), 2);
  fake_.telemetryBackend->lastSession()->forgetDiscovery();
  EXPECT_EQ(held.use_count(), 1);
  EXPECT_FALSE(fake_.telemetryBackend->lastSession()->isDiscovering());
}

TEST_F(FakePlatformTest, WakesWaitersSpuriously) {
  const auto condition = fake_.conditions->makeCondition();
  std::vector<Condition::Wake> wakes;
  condition->lock();
  condition->wait(seconds(9), [&](Condition::Wake wake) { wakes.push_back(wake); });
  condition->unlock();
  EXPECT_EQ(fake_.conditions->waiterCount(), 1u);
  EXPECT_EQ(fake_.conditions->wakeAllSpuriously(), 1u);
  fake_.advance(seconds(9));
  EXPECT_THAT(wakes, ElementsAre(Condition::Wake::kSignalled));
}

TEST_F(FakePlatformTest, FindsTheTelemetryBackendAtOnceUnlessToldOtherwise) {
  const auto session =
      fake_.telemetryBackend->createSession({}, {}, /*frameworksToCheck=*/{});
  int answers = 0;
  session->startConfiguration([&](const std::optional<Array>& backends) {
    ++answers;
    EXPECT_TRUE(backends);
  });
  EXPECT_EQ(answers, 1);
}

TEST_F(FakePlatformTest, HoldsADiscoveryUntilItIsAnswered) {
  fake_.telemetryBackend->setDiscovery(FakeDiscovery::held());
  auto session = fake_.telemetryBackend->createSession({}, {}, /*frameworksToCheck=*/{});
  int answers = 0;
  session->startConfiguration([&](const std::optional<Array>&) { ++answers; });
  EXPECT_EQ(answers, 0);
  fake_.telemetryBackend->lastSession()->answerDiscovery(Array());
  EXPECT_EQ(answers, 1);
  session.reset();
  fake_.telemetryBackend->lastSession()->answerDiscovery(Array());
  EXPECT_EQ(answers, 1);  // Never after the release.
  fake_.telemetryBackend->lastSession()->answerDiscoveryDespiteRelease(Array());
  EXPECT_EQ(answers, 2);
}

TEST_F(FakePlatformTest, GivesTheScriptedResultsOfSendsInTurn) {
  const auto session =
      fake_.telemetryBackend->createSession({}, {}, /*frameworksToCheck=*/{});
  fake_.telemetryBackend->scriptSend({false, ErrorObject{"d", 3, "full"}});
  EXPECT_EQ(session->sendMessage(1, 2, {}).error->code, 3);
  EXPECT_TRUE(session->sendMessage(1, 2, {}).succeeded);
  EXPECT_THAT(fake_.events->startingWith("backend.send"),
              ElementsAre("backend.sendMessage 1 1 2", "backend.sendMessage 1 1 2"));
}

TEST_F(FakePlatformTest, HoldsFlushesUntilTheyAreAnswered) {
  fake_.telemetryBackend->setFlush({/*isHeld=*/true, std::nullopt});
  auto session = fake_.telemetryBackend->createSession({}, {}, /*frameworksToCheck=*/{});
  std::optional<ErrorObject> seen;
  session->flush([&](std::optional<ErrorObject> error) { seen = std::move(error); });
  session.reset();
  EXPECT_FALSE(seen);
  fake_.telemetryBackend->lastSession()->answerFlush(ErrorObject{"d", 5, "late"});
  EXPECT_EQ(seen->code, 5);
  EXPECT_TRUE(fake_.events->inOrder("backend.flush 1", "backend.release 1"));
}

TEST_F(FakePlatformTest, KeepsLogLinesWithoutTheirPrefix) {
  registerLogScope(testScope);
  OSTREL_LOG_ERROR(testScope, "a: %i", 1);
  OSTREL_LOG_INFO(testScope, "b");
  EXPECT_THAT(fake_.log->texts(), ElementsAre("a: 1", "b"));
  EXPECT_TRUE(fake_.log->contains(LogLevel::kError, "test", "a: 1"));
  EXPECT_THAT(fake_.log->fullTexts().front(),
              testing::MatchesRegex("FakePlatformTest.cpp:[0-9]+:.*: a: 1"));
}

TEST_F(FakePlatformTest, PutsLogLinesAmongTheEventsWhenAsked) {
  registerLogScope(testScope);
  fake_.log->recordInto(fake_.events);
  fake_.events->add("before");
  OSTREL_LOG_DEFAULT(testScope, "text");
  EXPECT_THAT(fake_.events->all(), ElementsAre("before", "log default test text"));
}

TEST_F(FakePlatformTest, ChangesLevelsOfScopesAtOnce) {
  registerLogScope(testScope);
  fake_.log->setLowestLevel(LogLevel::kError);
  EXPECT_FALSE(testScope.isOn(LogLevel::kDefault));
  fake_.log->setVerbosity("reporting_test_verbose", 5);
  EXPECT_TRUE(testScope.isOn(LogLevel::kDebug));
}

TEST_F(FakePlatformTest, DropsWhatItHoldsAtItsEnd) {
  auto held = std::make_shared<int>(0);
  const std::weak_ptr<int> watch = held;
  {
    // What a session is: kept by its own steps, timers and callbacks.
    struct Circle {
      OstrelReportingPlatform platform;
      std::shared_ptr<WorkQueue> queue;
      std::shared_ptr<int> held;
    };
    fake_.log->uninstall();
    FakePlatform inner;
    const auto circle = std::make_shared<Circle>();
    circle->platform = inner.platform();
    circle->queue = inner.workQueues->makeSerialQueue(
        "circle", QualityOfService::kUtility, /*relativePriority=*/0);
    circle->held = std::move(held);
    circle->queue->async([circle] {});
    inner.workQueues->backgroundQueue().asyncAfter(seconds(1), [circle] {});
    inner.analyticsSink->sendEventLazy("e", [circle] { return Dictionary(); });
    inner.orientationService->registerDeviceOrientationObserver("o", [circle](int) {});
    inner.telemetryBackend->setDiscovery(FakeDiscovery::held());
    inner.telemetryBackend->createSession({}, {}, /*frameworksToCheck=*/{})
        ->startConfiguration([circle](const std::optional<Array>&) {});
  }
  EXPECT_TRUE(watch.expired());
}

class FakeMisuse : public FakePlatformTest {
 protected:
  FakeMisuse() { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST_F(FakeMisuse, EndsTheTestThatRunsStepsInsideAStep) {
  makeQueue()->async([this] { fake_.runUntilIdle(); });
  EXPECT_DEATH(fake_.runUntilIdle(), "not run from inside a step");
}

TEST_F(FakeMisuse, EndsTheTestThatSuspendsTwice) {
  const auto queue = makeQueue();
  queue->async([&] {
    queue->suspend();
    queue->suspend();
  });
  EXPECT_DEATH(fake_.runUntilIdle(), "one resume for each suspend");
}

TEST_F(FakeMisuse, EndsTheTestThatSignalsWithoutTheLock) {
  const auto condition = fake_.conditions->makeCondition();
  // The compiler's own check of locks would find this too.
  const auto signal = [](Condition& one)
                          OSTREL_NO_THREAD_SAFETY_ANALYSIS { one.signal(); };
  EXPECT_DEATH(signal(*condition), "signalling needs the condition's lock");
}

TEST_F(FakeMisuse, EndsTheTestThatTurnsTimeBack) {
  EXPECT_DEATH(fake_.clock->advance(seconds(-1)), "moves forward");
}

TEST_F(FakeMisuse, EndsTheTestWhoseDrawLiesAboveItsBound) {
  fake_.random->script({60});
  EXPECT_DEATH(fake_.random->uniform(60), "below its bound");
}

TEST_F(FakeMisuse, EndsTheTestThatConfiguresASessionTwice) {
  const auto session =
      fake_.telemetryBackend->createSession({}, {}, /*frameworksToCheck=*/{});
  session->startConfiguration([](const std::optional<Array>&) {});
  EXPECT_DEATH(session->startConfiguration([](const std::optional<Array>&) {}),
               "configured once");
}

TEST_F(FakeMisuse, EndsTheTestWhoseConnectionIsNotSetUp) {
  FakeIPCConnection connection(/*pid=*/7, fake_.events);
  EXPECT_DEATH(connection.resume(), "exports an object");
}

}  // namespace
}  // namespace ostrel
