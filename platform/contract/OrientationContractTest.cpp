#include <atomic>
#include <limits>
#include <set>

#include "platform/fake/FakeOrientationService.h"
#include "platform/linux/LinuxOrientationService.h"

namespace ostrel {
namespace {

struct OrientationInMemory {
  FakeOrientationService service{std::make_shared<EventLog>()};
};
struct OrientationOfTheMachine {
  LinuxOrientationService service;
};

template <typename Subject>
class OrientationContract : public testing::Test {
 protected:
  Subject subject_;
};
using Subjects = testing::Types<OrientationInMemory, OrientationOfTheMachine>;
TYPED_TEST_SUITE(OrientationContract, Subjects);

TYPED_TEST(OrientationContract, HasANameForEveryCode) {
  for (const OrientationService::OrientationCode code :
       {std::numeric_limits<std::int32_t>::min(), -1, 0, 1, 100, 1000,
        std::numeric_limits<std::int32_t>::max()}) {
    EXPECT_FALSE(this->subject_.service.orientationName(code).empty());
  }
}

TYPED_TEST(OrientationContract, NamesWhatTheSourcesSay) {
  std::set<std::string> names;
  for (OrientationService::OrientationCode code = 0; code < 200; ++code) {
    names.insert(this->subject_.service.orientationName(code));
  }
  for (const auto name :
       {"normal", "bottom-up", "left-up", "right-up", "90", "180", "270", "flipped"}) {
    EXPECT_TRUE(names.contains(name)) << name;
  }
}

TYPED_TEST(OrientationContract, TakesWhatHoldsForNoChange) {
  std::atomic<int> changes{0};
  const auto count = [&changes](OrientationService::OrientationCode) { ++changes; };
  this->subject_.service.registerDeviceOrientationObserver("observer", count);
  this->subject_.service.registerInterfaceOrientationObserver("observer", count);
  this->subject_.service.unregisterDeviceOrientationObserver("observer");
  this->subject_.service.unregisterInterfaceOrientationObserver("observer");
  EXPECT_EQ(changes, 0);
}

TYPED_TEST(OrientationContract, ReplacesAnObserverOfTheSameId) {
  auto first = std::make_shared<int>(0);
  const std::weak_ptr<int> watch = first;
  this->subject_.service.registerDeviceOrientationObserver(
      "observer", [first = std::move(first)](OrientationService::OrientationCode) {});
  this->subject_.service.registerDeviceOrientationObserver(
      "observer", [](OrientationService::OrientationCode) {});
  EXPECT_TRUE(watch.expired());
  this->subject_.service.unregisterDeviceOrientationObserver("observer");
}

TYPED_TEST(OrientationContract, LetsTheCallbackGoWhenItsObserverIsUnregistered) {
  auto held = std::make_shared<int>(0);
  const std::weak_ptr<int> watch = held;
  this->subject_.service.registerInterfaceOrientationObserver(
      "observer", [held = std::move(held)](OrientationService::OrientationCode) {});
  this->subject_.service.unregisterInterfaceOrientationObserver("observer");
  EXPECT_TRUE(watch.expired());
}

TYPED_TEST(OrientationContract, PassesOverAnObserverThatIsNotRegistered) {
  this->subject_.service.unregisterDeviceOrientationObserver("nobody");
  this->subject_.service.unregisterInterfaceOrientationObserver("nobody");
}

TEST(FakeOrientationService, CallsTheObserversOfTheKindThatTurns) {
  FakeOrientationService service(std::make_shared<EventLog>());
  std::vector<int> device;
  std::vector<int> interface;
  service.registerDeviceOrientationObserver("a",
                                            [&](int code) { device.push_back(code); });
  service.registerInterfaceOrientationObserver(
      "a", [&](int code) { interface.push_back(code); });
  service.turnDevice(3);
  service.turnInterface(11);
  service.unregisterDeviceOrientationObserver("a");
  service.turnDevice(4);
  EXPECT_THAT(device, testing::ElementsAre(3));
  EXPECT_THAT(interface, testing::ElementsAre(11));
}

}  // namespace
}  // namespace ostrel
