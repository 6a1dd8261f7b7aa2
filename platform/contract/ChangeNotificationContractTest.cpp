#include <atomic>
#include <fstream>

#include "platform/contract/Time.h"
#include "platform/fake/FakeChangeNotification.h"
#include "platform/linux/InotifyChangeNotification.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

constexpr auto kName = "com.orbisk.ostrel.reporting";

struct PostsInMemory {
  void post(const std::string& name) { notification.post(name); }
  ManualTime time;
  FakeChangeNotification notification{std::make_shared<EventLog>()};
};

struct PostsByFile {
  void post(const std::string& name) { directory.write(name, "posted"); }
  RealTime time;
  testing_support::TemporaryDirectory directory;
  InotifyChangeNotification notification{directory.path()};
};

template <typename Subject>
class ChangeNotificationContract : public testing::Test {
 protected:
  // Registers a handler that counts its calls.
  ChangeNotification::Registration countInto(const std::string& name,
                                             std::atomic<int>& count) {
    return subject_.notification.registerDispatch(name, queue_,
                                                  [&count](int) { ++count; });
  }

  Subject subject_;
  const std::shared_ptr<WorkQueue> queue_ = subject_.time.queues().makeSerialQueue(
      "notifications", QualityOfService::kUserInteractive, /*relativePriority=*/0);
};
using Subjects = testing::Types<PostsInMemory, PostsByFile>;
TYPED_TEST_SUITE(ChangeNotificationContract, Subjects);

TYPED_TEST(ChangeNotificationContract, RunsTheHandlerOnItsQueueWithItsToken) {
  std::atomic<int> token{-1};
  std::atomic<bool> wasOnQueue{false};
  const auto registration =
      this->subject_.notification.registerDispatch(kName, this->queue_, [&](int given) {
        wasOnQueue = this->queue_->isCurrent();
        token = given;
      });
  ASSERT_EQ(registration.status, 0);
  this->subject_.post(kName);
  ASSERT_TRUE(this->subject_.time.reaches([&] { return token != -1; }));
  EXPECT_EQ(token, registration.token);
  EXPECT_TRUE(wasOnQueue);
}

TYPED_TEST(ChangeNotificationContract, HandsOnEveryPostThatStandsAlone) {
  std::atomic<int> count{0};
  ASSERT_EQ(this->countInto(kName, count).status, 0);
  for (int posts = 1; posts <= 3; ++posts) {
    this->subject_.post(kName);
    ASSERT_TRUE(this->subject_.time.reaches([&] { return count >= posts; }));
  }
}

TYPED_TEST(ChangeNotificationContract, GivesEachRegistrationATokenOfItsOwn) {
  std::atomic<int> first{0};
  std::atomic<int> second{0};
  const auto one = this->countInto(kName, first);
  const auto other = this->countInto(kName, second);
  EXPECT_NE(one.token, other.token);
  this->subject_.post(kName);
  EXPECT_TRUE(this->subject_.time.reaches([&] { return first >= 1 && second >= 1; }));
}

TYPED_TEST(ChangeNotificationContract, PassesOverPostsOfOtherNames) {
  std::atomic<int> ours{0};
  std::atomic<int> others{0};
  ASSERT_EQ(this->countInto(kName, ours).status, 0);
  ASSERT_EQ(this->countInto("com.orbisk.other", others).status, 0);
  this->subject_.post("com.orbisk.third");
  this->subject_.post("com.orbisk.other");
  ASSERT_TRUE(this->subject_.time.reaches([&] { return others >= 1; }));
  ASSERT_TRUE(this->subject_.time.settle());
  EXPECT_EQ(ours, 0);
}

TYPED_TEST(ChangeNotificationContract, RunsNoHandlerWithoutAPost) {
  std::atomic<int> count{0};
  ASSERT_EQ(this->countInto(kName, count).status, 0);
  ASSERT_TRUE(this->subject_.time.settle());
  EXPECT_EQ(count, 0);
}

}  // namespace
}  // namespace ostrel
