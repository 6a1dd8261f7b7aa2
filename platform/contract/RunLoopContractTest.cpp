// Run on manual time and on real threads: what either promises is asserted as
// "not before its date", "in this order" and "at last".
#include <gtest/gtest.h>

#include <atomic>
#include <condition_variable>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/fake/ManualRunLoop.h"
#include "platform/linux/ThreadRunLoop.h"

namespace ostrel {
namespace {

using std::chrono::milliseconds;
using std::chrono::nanoseconds;

struct ManualTime {
  nanoseconds now() const { return clock->monotonicNow(); }
  void pass(nanoseconds duration) { clock->advance(duration); }

  std::shared_ptr<ManualClock> clock = std::make_shared<ManualClock>();
  std::shared_ptr<RunLoopFactory> runLoops =
      std::make_shared<ManualRunLoopFactory>(clock);
};

struct RealTime {
  nanoseconds now() const { return std::chrono::steady_clock::now().time_since_epoch(); }
  void pass(nanoseconds duration) { std::this_thread::sleep_for(duration); }

  std::shared_ptr<RunLoopFactory> runLoops = std::make_shared<ThreadRunLoopFactory>();
};

/// What happened on a run loop's thread. Shared with it, for a real thread may
/// outlive the test.
class Record {
 public:
  void add(std::string event) {
    const std::lock_guard lock(mutex_);
    events_.push_back(std::move(event));
  }
  std::vector<std::string> events() const {
    const std::lock_guard lock(mutex_);
    return events_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> events_;
};

template <typename Time>
class RunLoopContract : public ::testing::Test {
 protected:
  using Events = std::vector<std::string>;

  std::shared_ptr<RunLoopTimer> timer(milliseconds delay, std::string name) {
    return time.runLoops->makeTimer(
        delay, [record = record, name = std::move(name)] { record->add(name); });
  }

  /// Runs `body` on a run loop's thread; the record ends with "end" once it has
  /// returned.
  void start(std::function<void(RunLoop&)> body) {
    time.runLoops->startThread("contract",
                               [record = record, body = std::move(body)](RunLoop& loop) {
                                 body(loop);
                                 record->add("end");
                               });
  }

  /// Lets time pass until the thread has ended, for 10 s at most.
  Events eventsAtTheEnd() {
    for (int i = 0; i < 10000; ++i) {
      Events events = record->events();
      if (!events.empty() && events.back() == "end") return events;
      time.pass(milliseconds(1));
    }
    return record->events();
  }

  Time time;
  std::shared_ptr<Record> record = std::make_shared<Record>();
};

using Times = ::testing::Types<ManualTime, RealTime>;
TYPED_TEST_SUITE(RunLoopContract, Times);

TYPED_TEST(RunLoopContract, ReturnsAtOnceWithoutTimers) {
  this->start([](RunLoop& loop) { loop.run(); });

  EXPECT_EQ(this->eventsAtTheEnd(), (std::vector<std::string>{"end"}));
}

TYPED_TEST(RunLoopContract, FiresTimersInTheOrderOfTheirDates) {
  const auto late = this->timer(milliseconds(40), "late");
  const auto early = this->timer(milliseconds(20), "early");
  const auto now = this->timer(milliseconds(0), "now");
  const auto past = this->timer(milliseconds(-1000), "past");

  this->start([=](RunLoop& loop) {
    for (const auto& timer : {late, early, now, past}) loop.add(timer);
    loop.run();
  });

  const auto events = this->eventsAtTheEnd();
  ASSERT_EQ(events.size(), 5u);
  EXPECT_EQ(events[2], "early");
  EXPECT_EQ(events[3], "late");
}

TYPED_TEST(RunLoopContract, FiresATimerOnceAndNotBeforeItsDate) {
  const nanoseconds begin = this->time.now();
  auto firedAt = std::make_shared<std::atomic<nanoseconds::rep>>(0);
  const auto timer = this->time.runLoops->makeTimer(
      milliseconds(30), [firedAt, record = this->record, &time = this->time] {
        *firedAt = time.now().count();
        record->add("fired");
      });

  this->start([timer](RunLoop& loop) {
    loop.add(timer);
    loop.add(timer);
    loop.run();
    loop.add(timer);
    loop.run();
  });

  EXPECT_EQ(this->eventsAtTheEnd(), (std::vector<std::string>{"fired", "end"}));
  EXPECT_GE(nanoseconds(firedAt->load()), begin + milliseconds(30));
}

TYPED_TEST(RunLoopContract, NeverFiresATimerThatWasNotAdded) {
  const auto timer = this->timer(milliseconds(0), "fired");

  this->start([](RunLoop& loop) { loop.run(); });

  EXPECT_EQ(this->eventsAtTheEnd(), (std::vector<std::string>{"end"}));
}

TYPED_TEST(RunLoopContract, CountsTheDelayFromTheMaking) {
  const auto overdue = this->timer(milliseconds(10), "overdue");
  this->time.pass(milliseconds(20));
  const auto later = this->timer(milliseconds(0), "later");

  this->start([=](RunLoop& loop) {
    loop.add(later);
    loop.add(overdue);
    loop.run();
  });

  EXPECT_EQ(this->eventsAtTheEnd(),
            (std::vector<std::string>{"overdue", "later", "end"}));
}

TYPED_TEST(RunLoopContract, MovesTheDatesOfTimersThatWait) {
  const auto sooner = this->timer(std::chrono::hours(1), "sooner");
  const auto later = this->timer(milliseconds(1), "later");
  const auto mover = this->time.runLoops->makeTimer(milliseconds(0), [=] {
    later->setFireDate(milliseconds(60));
    sooner->setFireDate(milliseconds(30));
  });

  this->start([=](RunLoop& loop) {
    for (const auto& timer : {sooner, later, mover}) loop.add(timer);
    loop.run();
  });

  EXPECT_EQ(this->eventsAtTheEnd(), (std::vector<std::string>{"sooner", "later", "end"}));
}

TYPED_TEST(RunLoopContract, WakesForATimerThatAnotherThreadMadeDue) {
  const auto timer = this->timer(std::chrono::hours(1), "fired");
  this->start([=](RunLoop& loop) {
    loop.add(timer);
    loop.run();
  });
  this->time.pass(milliseconds(5));

  timer->setFireDate(milliseconds(0));

  EXPECT_EQ(this->eventsAtTheEnd(), (std::vector<std::string>{"fired", "end"}));
}

TYPED_TEST(RunLoopContract, WakesForATimerThatAnotherThreadInvalidated) {
  const auto timer = this->timer(std::chrono::hours(1), "fired");
  this->start([=](RunLoop& loop) {
    loop.add(timer);
    loop.run();
  });
  this->time.pass(milliseconds(5));

  timer->invalidate();

  EXPECT_EQ(this->eventsAtTheEnd(), (std::vector<std::string>{"end"}));
}

TYPED_TEST(RunLoopContract, MovesTheDateOfATimerThatWasNotAddedYet) {
  const auto timer = this->timer(std::chrono::hours(1), "fired");
  timer->setFireDate(milliseconds(-5));

  this->start([timer](RunLoop& loop) {
    loop.add(timer);
    loop.run();
  });

  EXPECT_EQ(this->eventsAtTheEnd(), (std::vector<std::string>{"fired", "end"}));
}

TYPED_TEST(RunLoopContract, InvalidTimersFireNoMoreAndEndTheRun) {
  const auto before = this->timer(milliseconds(0), "before");
  const auto during = this->timer(std::chrono::hours(1), "during");
  before->invalidate();
  this->start([=](RunLoop& loop) {
    loop.add(before);
    loop.add(during);
    during->invalidate();
    loop.run();
  });

  EXPECT_EQ(this->eventsAtTheEnd(), (std::vector<std::string>{"end"}));
}

TYPED_TEST(RunLoopContract, BearsATimerThatInvalidatesItselfOrMovesItsDateAsItFires) {
  auto self = std::make_shared<std::shared_ptr<RunLoopTimer>>();
  *self = this->time.runLoops->makeTimer(milliseconds(0), [self, record = this->record] {
    (*self)->setFireDate(milliseconds(0));
    (*self)->invalidate();
    record->add("fired");
  });

  this->start([self](RunLoop& loop) {
    loop.add(*self);
    loop.run();
    self->reset();
  });

  EXPECT_EQ(this->eventsAtTheEnd(), (std::vector<std::string>{"fired", "end"}));
}

TYPED_TEST(RunLoopContract, RunsWhatATimerAddsAsItFires) {
  const auto inner = this->timer(milliseconds(0), "inner");

  this->start([inner, &time = this->time, record = this->record](RunLoop& loop) {
    loop.add(time.runLoops->makeTimer(milliseconds(0), [&loop, inner, record] {
      record->add("outer");
      loop.add(inner);
    }));
    loop.run();
  });

  EXPECT_EQ(this->eventsAtTheEnd(), (std::vector<std::string>{"outer", "inner", "end"}));
}

TYPED_TEST(RunLoopContract, FiresOnTheThreadOfTheLoop) {
  auto isSame = std::make_shared<std::atomic<bool>>(false);
  auto isOther = std::make_shared<std::atomic<bool>>(false);

  this->start([=, &time = this->time, test = std::this_thread::get_id()](RunLoop& loop) {
    const auto thread = std::this_thread::get_id();
    *isOther = thread != test;
    loop.add(time.runLoops->makeTimer(milliseconds(0), [isSame, thread] {
      *isSame = std::this_thread::get_id() == thread;
    }));
    loop.run();
  });

  EXPECT_EQ(this->eventsAtTheEnd(), (std::vector<std::string>{"end"}));
  EXPECT_TRUE(*isSame);
  EXPECT_TRUE(*isOther);
}

TYPED_TEST(RunLoopContract, SleepsAtLeastAsLongAsAsked) {
  const nanoseconds begin = this->time.now();

  this->time.runLoops->sleep(milliseconds(20));

  EXPECT_GE(this->time.now(), begin + milliseconds(20));
}

TYPED_TEST(RunLoopContract, SleepsOnAThreadOfItsOwn) {
  const nanoseconds begin = this->time.now();

  this->start([&time = this->time](RunLoop&) { time.runLoops->sleep(milliseconds(20)); });

  EXPECT_EQ(this->eventsAtTheEnd(), (std::vector<std::string>{"end"}));
  EXPECT_GE(this->time.now(), begin + milliseconds(20));
}

TEST(ManualRunLoop, EndsAThreadThatWaits) {
  const auto clock = std::make_shared<ManualClock>();
  auto isGone = std::make_shared<bool>(false);
  struct SaysWhenGone {
    std::shared_ptr<bool> isGone;
    ~SaysWhenGone() { *isGone = true; }
  };
  auto runLoops = std::make_unique<ManualRunLoopFactory>(clock);
  runLoops->startThread("waits", [&runLoops, isGone](RunLoop&) {
    const SaysWhenGone says{isGone};
    while (true) runLoops->sleep(std::chrono::hours(1));
  });
  clock->advance(std::chrono::hours(10));

  runLoops.reset();

  EXPECT_TRUE(*isGone);
  clock->advance(std::chrono::hours(10));  // The turn that was due is nobody's.
}

}  // namespace
}  // namespace ostrel
