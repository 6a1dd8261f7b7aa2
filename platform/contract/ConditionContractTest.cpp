#include <atomic>

#include "platform/contract/Time.h"

namespace ostrel {
namespace {

using std::chrono::milliseconds;
using std::chrono::nanoseconds;
using Wake = Condition::Wake;

// What a waiter was told, and how often.
struct Woken {
  std::atomic<int> count{0};
  std::atomic<Wake> last{Wake::kSignalled};

  Condition::Waiter waiter() {
    return [this](Wake wake) {
      last = wake;
      ++count;
    };
  }
};

void wait(Condition& condition, nanoseconds timeout, Condition::Waiter waiter) {
  condition.lock();
  condition.wait(timeout, std::move(waiter));
  condition.unlock();
}

void signal(Condition& condition) {
  condition.lock();
  condition.signal();
  condition.unlock();
}

template <typename Time>
class ConditionContract : public testing::Test {
 protected:
  Time time_;
  std::shared_ptr<Condition> condition_ = time_.conditions().makeCondition();
  Woken woken_;
};

using Times = testing::Types<ManualTime, RealTime>;
TYPED_TEST_SUITE(ConditionContract, Times);

TYPED_TEST(ConditionContract, WakesTheWaiterAtASignal) {
  wait(*this->condition_, std::chrono::hours(1), this->woken_.waiter());
  signal(*this->condition_);
  EXPECT_TRUE(this->time_.reaches([&] { return this->woken_.count == 1; }));
  EXPECT_EQ(this->woken_.last, Wake::kSignalled);
}

TYPED_TEST(ConditionContract, TimesOutNotBeforeItsTime) {
  const nanoseconds before = this->time_.clock().monotonicNow();
  std::atomic<std::int64_t> wokenAt{0};
  std::atomic<Wake> reason{Wake::kSignalled};
  wait(*this->condition_, milliseconds(30), [&](Wake wake) {
    reason = wake;
    wokenAt = this->time_.clock().monotonicNow().count();
  });
  ASSERT_TRUE(this->time_.reaches([&] { return wokenAt != 0; }));
  EXPECT_EQ(reason, Wake::kTimedOut);
  EXPECT_GE(nanoseconds(wokenAt) - before, milliseconds(30));
}

TYPED_TEST(ConditionContract, WakesAWaiterOnce) {
  wait(*this->condition_, milliseconds(20), this->woken_.waiter());
  signal(*this->condition_);
  signal(*this->condition_);
  // Another wait that times out later than the first would have.
  Woken later;
  const auto other = this->time_.conditions().makeCondition();
  wait(*other, milliseconds(40), later.waiter());
  ASSERT_TRUE(this->time_.reaches([&] { return later.count == 1; }));
  EXPECT_EQ(this->woken_.count, 1);
}

TYPED_TEST(ConditionContract, LosesASignalWithoutAWaiter) {
  signal(*this->condition_);
  wait(*this->condition_, milliseconds(20), this->woken_.waiter());
  ASSERT_TRUE(this->time_.reaches([&] { return this->woken_.count == 1; }));
  EXPECT_EQ(this->woken_.last, Wake::kTimedOut);
}

TYPED_TEST(ConditionContract, MeasuresASecondWaitAfresh) {
  wait(*this->condition_, milliseconds(20), this->woken_.waiter());
  signal(*this->condition_);
  const nanoseconds before = this->time_.clock().monotonicNow();
  std::atomic<std::int64_t> wokenAt{0};
  wait(*this->condition_, milliseconds(60),
       [&](Wake) { wokenAt = this->time_.clock().monotonicNow().count(); });
  ASSERT_TRUE(this->time_.reaches([&] { return wokenAt != 0; }));
  EXPECT_GE(nanoseconds(wokenAt) - before, milliseconds(60));
}

TYPED_TEST(ConditionContract, MayBeWaitedOnAgainFromWhatTheWaiterQueued) {
  const auto queue = this->time_.queues().makeSerialQueue(
      "waits again", QualityOfService::kUtility, /*relativePriority=*/0);
  wait(*this->condition_, std::chrono::hours(1), [&](Wake) {
    queue->async(
        [&] { wait(*this->condition_, milliseconds(10), this->woken_.waiter()); });
  });
  signal(*this->condition_);
  ASSERT_TRUE(this->time_.reaches([&] { return this->woken_.count == 1; }));
  EXPECT_EQ(this->woken_.last, Wake::kTimedOut);
}

TYPED_TEST(ConditionContract, CallsItsWaiterEvenWhenNobodyElseHoldsIt) {
  wait(*this->condition_, milliseconds(10), this->woken_.waiter());
  this->condition_.reset();
  EXPECT_TRUE(this->time_.reaches([&] { return this->woken_.count == 1; }));
}

TYPED_TEST(ConditionContract, ForgetsTheWaiterOnceItIsWoken) {
  auto held = std::make_shared<int>(0);
  const std::weak_ptr<int> watch = held;
  wait(*this->condition_, std::chrono::hours(1),
       [held = std::move(held), this](Wake) { ++this->woken_.count; });
  signal(*this->condition_);
  ASSERT_TRUE(this->time_.reaches([&] { return this->woken_.count == 1; }));
  EXPECT_TRUE(this->time_.reaches([&] { return watch.expired(); }));
}

TYPED_TEST(ConditionContract, MayBeSignalledFromAnotherThread) {
  wait(*this->condition_, std::chrono::hours(1), this->woken_.waiter());
  std::thread([this] { signal(*this->condition_); }).join();
  EXPECT_TRUE(this->time_.reaches([&] { return this->woken_.count == 1; }));
  EXPECT_EQ(this->woken_.last, Wake::kSignalled);
}

}  // namespace
}  // namespace ostrel
