#include "platform/linux/SensorProxyOrientation.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <systemd/sd-bus.h>

#include <atomic>
#include <fstream>
#include <functional>
#include <thread>
#include <vector>

#include "platform/linux/ChildProcess.h"
#include "platform/linux/LinuxOrientationService.h"
#include "platform/linux/TestSockets.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;
using testing_support::ChildProcess;
using testing_support::eventually;
using testing_support::TemporaryDirectory;

constexpr milliseconds kFirstBackOff{10};

/// A bus of its own, where the system bus of this process is said to be.
class PrivateBus {
 public:
  PrivateBus() {
    directory_.write("bus.conf",
                     "<busconfig><type>system</type><listen>" + address() +
                         "</listen><policy context=\"default\"><allow user=\"*\"/>"
                         "<allow own=\"*\"/><allow send_destination=\"*\"/>"
                         "<allow receive_sender=\"*\"/></policy></busconfig>");
    ::setenv("DBUS_SYSTEM_BUS_ADDRESS", address().c_str(), /*replace=*/1);
  }
  ~PrivateBus() { ::unsetenv("DBUS_SYSTEM_BUS_ADDRESS"); }

  void start() {
    std::filesystem::remove(socketPath());
    daemon_ = std::make_unique<ChildProcess>(std::vector<std::string>{
        "dbus-daemon", "--config-file=" + directory_ / "bus.conf", "--nofork"});
    // The socket's file is there before anybody listens on it.
    ASSERT_TRUE(
        eventually([this] { return testing_support::isListenedTo(socketPath()); }));
  }
  void stop() { daemon_.reset(); }

  std::string socketPath() const { return directory_ / "bus"; }
  std::string address() const { return "unix:path=" + socketPath(); }

 private:
  const TemporaryDirectory directory_;
  std::unique_ptr<ChildProcess> daemon_;
};

/// The sensor service as a test wants it to be.
class ScriptedSensors {
 public:
  enum class Answer { kYes, kError, kNever };

  ScriptedSensors(Answer toClaims, std::string orientation)
      : answer_(toClaims), orientation_(std::move(orientation)) {
    thread_ = std::thread([this] { run(); });
    eventually([this] { return isReady_.load(); });
  }
  ~ScriptedSensors() {
    isDone_ = true;
    thread_.join();
  }

  int claims() const { return claims_; }
  int releases() const { return releases_; }
  bool isRead() const { return reads_ > 0; }

  void answerClaims(Answer answer) { answer_ = answer; }
  void turn(const std::string& orientation) {
    call([=, this](sd_bus* bus) {
      orientation_ = orientation;
      sd_bus_emit_signal(bus, kPath, kProperties, "PropertiesChanged", "sa{sv}as", kName,
                         1, "AccelerometerOrientation", "s", orientation.c_str(), 0);
    });
  }
  /// Runs `step` on the service's thread.
  void call(std::function<void(sd_bus*)> step) {
    std::unique_lock lock(mutex_);
    step_ = std::move(step);
    changed_.wait(lock, [this] { return !step_; });
  }

  static constexpr const char* kName = "net.hadess.SensorProxy";
  static constexpr const char* kPath = "/net/hadess/SensorProxy";
  static constexpr const char* kProperties = "org.freedesktop.DBus.Properties";

 private:
  void run() {
    sd_bus* bus = nullptr;
    EXPECT_GE(sd_bus_open_system(&bus), 0);
    EXPECT_GE(sd_bus_add_object(bus, nullptr, kPath, &handle, this), 0);
    EXPECT_GE(sd_bus_add_match(bus, nullptr,
                               "type='signal',sender='org.freedesktop.DBus',"
                               "member='NameOwnerChanged'",
                               &clientChanged, this),
              0);
    EXPECT_GE(sd_bus_request_name(bus, kName, 0), 0);
    isReady_ = true;
    while (!isDone_) {
      while (sd_bus_process(bus, nullptr) > 0) {
      }
      {
        const std::lock_guard lock(mutex_);
        if (step_) {
          step_(bus);
          sd_bus_flush(bus);
          step_ = nullptr;
          changed_.notify_all();
        }
      }
      sd_bus_wait(bus, 1000);
    }
    sd_bus_flush_close_unref(bus);
  }

  // A claim ends with a word or with the claimer, as the real service has it.
  void release() {
    if (!claimer_.empty()) ++releases_;
    claimer_.clear();
  }

  static int clientChanged(sd_bus_message* signal, void* data, sd_bus_error*) {
    auto& self = *static_cast<ScriptedSensors*>(data);
    const char* name = nullptr;
    const char* before = nullptr;
    const char* now = nullptr;
    sd_bus_message_read(signal, "sss", &name, &before, &now);
    if (self.claimer_ == name && *now == '\0') self.release();
    return 0;
  }

  static int handle(sd_bus_message* message, void* data, sd_bus_error*) {
    auto& self = *static_cast<ScriptedSensors*>(data);
    if (sd_bus_message_is_method_call(message, kName, "ClaimAccelerometer") > 0) {
      ++self.claims_;
      self.claimer_ = sd_bus_message_get_sender(message);
      if (self.answer_ == Answer::kNever) return 1;
      if (self.answer_ == Answer::kError) {
        return sd_bus_reply_method_errorf(message, SD_BUS_ERROR_FAILED, "no sensor");
      }
      return sd_bus_reply_method_return(message, "");
    }
    if (sd_bus_message_is_method_call(message, kName, "ReleaseAccelerometer") > 0) {
      self.release();
      return sd_bus_reply_method_return(message, "");
    }
    if (sd_bus_message_is_method_call(message, kProperties, "Get") > 0) {
      ++self.reads_;
      return sd_bus_reply_method_return(message, "v", "s", self.orientation_.c_str());
    }
    return 0;
  }

  std::atomic<Answer> answer_;
  std::string orientation_;
  std::string claimer_;  // On the service's thread.
  std::atomic<int> claims_ = 0;
  std::atomic<int> releases_ = 0;
  std::atomic<int> reads_ = 0;
  std::atomic<bool> isReady_ = false;
  std::atomic<bool> isDone_ = false;
  std::mutex mutex_;
  std::condition_variable changed_;
  std::function<void(sd_bus*)> step_;
  std::thread thread_;
};

using Answer = ScriptedSensors::Answer;
using Names = std::vector<std::string>;

class SensorProxyOrientationBus : public testing::Test {
 protected:
  void observe() {
    service_->registerDeviceOrientationObserver("a", [this](std::int32_t code) {
      const std::lock_guard lock(mutex_);
      names_.push_back(service_->orientationName(code));
    });
  }
  void unobserve() { service_->unregisterDeviceOrientationObserver("a"); }

  Names names() {
    const std::lock_guard lock(mutex_);
    return names_;
  }
  bool hears(const Names& names) {
    return eventually([&] { return this->names() == names; });
  }
  /// Makes the sensor service and lets it see the observer's first look.
  std::unique_ptr<ScriptedSensors> observed(const std::string& orientation) {
    auto sensors = std::make_unique<ScriptedSensors>(Answer::kYes, orientation);
    observe();
    EXPECT_TRUE(eventually([&] { return sensors->isRead(); }));
    return sensors;
  }

  std::mutex mutex_;
  Names names_;
  PrivateBus bus_;
  std::unique_ptr<LinuxOrientationService> service_ =
      std::make_unique<LinuxOrientationService>(kFirstBackOff);
};

TEST_F(SensorProxyOrientationBus, ReportsChangesButNotWhatHoldsAtFirst) {
  bus_.start();
  const auto sensors = observed("normal");
  sensors->turn("left-up");
  sensors->turn("left-up");
  sensors->turn("right-up");
  sensors->turn("bottom-up");
  sensors->turn("normal");
  EXPECT_TRUE(hears({"left-up", "right-up", "bottom-up", "normal"}));
}

TEST_F(SensorProxyOrientationBus, ReportsTheFirstReadingOfASensorThatHadNone) {
  bus_.start();
  const auto sensors = observed("undefined");
  sensors->turn("left-up");
  sensors->turn("undefined");
  sensors->turn("left-up");
  sensors->turn("normal");
  EXPECT_TRUE(hears({"left-up", "normal"}));
}

TEST_F(SensorProxyOrientationBus, ClaimsTheSensorOnlyWhileItIsObserved) {
  bus_.start();
  ScriptedSensors sensors(Answer::kYes, "normal");
  EXPECT_EQ(sensors.claims(), 0);
  observe();
  ASSERT_TRUE(eventually([&] { return sensors.isRead(); }));
  EXPECT_EQ(sensors.claims(), 1);
  EXPECT_EQ(sensors.releases(), 0);
  unobserve();
  EXPECT_TRUE(eventually([&] { return sensors.releases() == 1; }));
  observe();
  EXPECT_TRUE(eventually([&] { return sensors.claims() == 2; }));
}

TEST_F(SensorProxyOrientationBus, ClaimsAgainWhenTheSensorServiceComesBack) {
  bus_.start();
  auto sensors = observed("normal");
  sensors->turn("left-up");
  EXPECT_TRUE(hears({"left-up"}));
  sensors.reset();
  sensors = std::make_unique<ScriptedSensors>(Answer::kYes, "right-up");
  EXPECT_TRUE(hears({"left-up", "right-up"}));
  sensors->turn("normal");
  EXPECT_TRUE(hears({"left-up", "right-up", "normal"}));
}

TEST_F(SensorProxyOrientationBus, FindsABusThatComesLater) {
  observe();
  bus_.start();
  ScriptedSensors sensors(Answer::kYes, "normal");
  ASSERT_TRUE(eventually([&] { return sensors.isRead(); }));
  sensors.turn("left-up");
  EXPECT_TRUE(hears({"left-up"}));
}

TEST_F(SensorProxyOrientationBus, FindsABusThatIsStartedAgain) {
  bus_.start();
  auto sensors = observed("normal");
  sensors->turn("right-up");
  ASSERT_TRUE(hears({"right-up"}));
  bus_.stop();
  sensors.reset();
  bus_.start();
  sensors = std::make_unique<ScriptedSensors>(Answer::kYes, "left-up");
  EXPECT_TRUE(hears({"right-up", "left-up"}));
}

TEST_F(SensorProxyOrientationBus, AsksAgainForASensorThatIsRefused) {
  bus_.start();
  ScriptedSensors sensors(Answer::kError, "normal");
  observe();
  ASSERT_TRUE(eventually([&] { return sensors.claims() >= 3; }));
  EXPECT_FALSE(sensors.isRead());
  sensors.answerClaims(Answer::kYes);
  ASSERT_TRUE(eventually([&] { return sensors.isRead(); }));
  sensors.turn("left-up");
  EXPECT_TRUE(hears({"left-up"}));
}

TEST_F(SensorProxyOrientationBus, GivesUpACallThatIsNeverAnswered) {
  bus_.start();
  ScriptedSensors sensors(Answer::kNever, "normal");
  observe();
  EXPECT_TRUE(eventually([&] { return sensors.claims() >= 2; }));
}

TEST_F(SensorProxyOrientationBus, PassesOverWhatItDoesNotUnderstand) {
  bus_.start();
  const auto sensors = observed("normal");
  const auto emit = [&](const char* types, auto... arguments) {
    sensors->call([=](sd_bus* bus) {
      sd_bus_emit_signal(bus, ScriptedSensors::kPath, ScriptedSensors::kProperties,
                         "PropertiesChanged", types, ScriptedSensors::kName,
                         arguments...);
    });
  };
  const char* property = "AccelerometerOrientation";
  emit("sa{sv}as", 1, property, "i", 3, 0);
  emit("sa{sv}as", 1, property, "s", "upside-down", 0);
  emit("sa{sv}as", 1, property, "as", 1, "left-up", 0);
  emit("sa{sv}as", 1, "LightLevel", "d", 0.5, 0);
  emit("sas", 1, property);
  emit("s");
  emit("sa{sv}as", 2, "LightLevel", "d", 0.5, property, "s", "left-up", 0);
  EXPECT_TRUE(hears({"left-up"}));
}

TEST_F(SensorProxyOrientationBus, StaysUsableUnderAFlood) {
  bus_.start();
  const auto sensors = observed("normal");
  for (int burst = 0; burst < 20; ++burst) {
    sensors->call([](sd_bus* bus) {
      for (int i = 0; i < 500; ++i) {
        sd_bus_emit_signal(bus, ScriptedSensors::kPath, ScriptedSensors::kProperties,
                           "PropertiesChanged", "sa{sv}as", ScriptedSensors::kName, 1,
                           "AccelerometerOrientation", "s",
                           i % 2 != 0 ? "left-up" : "right-up", 0);
      }
    });
  }
  EXPECT_LT(names().size(), 1000u);
  const auto begin = steady_clock::now();
  unobserve();
  EXPECT_LT(steady_clock::now() - begin, milliseconds(100));
  EXPECT_TRUE(eventually([&] { return sensors->releases() == 1; }));
}

/// A listener where the bus should be that is none.
class SensorProxyOrientationNoBus : public SensorProxyOrientationBus {
 protected:
  void SetUp() override {
    listener_ = testing_support::listeningSocket(bus_.socketPath());
    ASSERT_TRUE(listener_);
  }
  FileDescriptor accept() {
    return FileDescriptor(::accept4(listener_.get(), nullptr, nullptr, SOCK_CLOEXEC));
  }

  FileDescriptor listener_;
};

TEST_F(SensorProxyOrientationNoBus, ThatNeverAnswersHoldsNobody) {
  observe();
  const FileDescriptor client = accept();
  const auto begin = steady_clock::now();
  unobserve();
  observe();
  unobserve();
  service_.reset();
  EXPECT_LT(steady_clock::now() - begin, milliseconds(500));
}

TEST_F(SensorProxyOrientationNoBus, ThatNeverAnswersIsLeftForAnother) {
  observe();
  const FileDescriptor first = accept();
  const FileDescriptor second = accept();
  EXPECT_TRUE(second);
}

TEST_F(SensorProxyOrientationNoBus, ThatTalksNonsenseIsLeft) {
  observe();
  for (int i = 0; i < 3; ++i) {
    const FileDescriptor client = accept();
    const std::string junk(4096, '\xff');
    EXPECT_GT(::send(client.get(), junk.data(), junk.size(), MSG_NOSIGNAL), 0);
  }
}

/// The sensor service's public test double, driven as its users do.
TEST_F(SensorProxyOrientationBus, HearsTheMockedSensorService) {
  bus_.start();
  const ChildProcess mock({"/usr/bin/python3", "-m", "dbusmock", "--system", "--template",
                           "iio-sensors-proxy", "--parameters",
                           R"({"has_accelerometer": true,
                               "accelerometer_orientation": "normal"})"});
  sd_bus* bus = nullptr;
  ASSERT_GE(sd_bus_open_system(&bus), 0);
  const auto call = [&](const char* member, sd_bus_message** reply, const char* types,
                        auto... arguments) {
    return sd_bus_call_method(bus, ScriptedSensors::kName, ScriptedSensors::kPath,
                              "org.freedesktop.DBus.Mock", member, nullptr, reply, types,
                              arguments...) >= 0;
  };
  const auto owners = [&] {
    int count = 0;
    sd_bus_message* reply = nullptr;
    if (call("GetInternalProperty", &reply, "s", "AccelerometerOwners")) {
      sd_bus_message_enter_container(reply, 'v', "as");
      sd_bus_message_enter_container(reply, 'a', "s");
      while (sd_bus_message_skip(reply, "s") > 0) ++count;
    }
    sd_bus_message_unref(reply);
    return count;
  };
  const auto turn = [&](const char* name) {
    return call("SetInternalProperty", nullptr, "ssv", ScriptedSensors::kName,
                "AccelerometerOrientation", "s", name);
  };
  ASSERT_TRUE(eventually([&] {
    return call("GetInternalProperty", nullptr, "s", "HasAccelerometer");
  })) << "python3-dbusmock is needed";
  EXPECT_EQ(owners(), 0);
  observe();
  ASSERT_TRUE(eventually([&] { return owners() == 1; }));
  // Our reading comes after our claim and is not seen from here: turn until heard.
  ASSERT_TRUE(eventually(
      [&] { return turn("bottom-up") && turn("left-up") && !names().empty(); }));
  ASSERT_TRUE(eventually([&] { return names().back() == "left-up"; }));
  ASSERT_TRUE(turn("normal"));
  EXPECT_TRUE(eventually([&] { return names().back() == "normal"; }));
  unobserve();
  EXPECT_TRUE(eventually([&] { return owners() == 0; }));
  sd_bus_flush_close_unref(bus);
}

}  // namespace
}  // namespace ostrel
