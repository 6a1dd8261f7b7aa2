// What is known of the device and of processes.
#include <unistd.h>

#include <array>
#include <cstdlib>
#include <fstream>

#include "platform/fake/FakeDeviceInfo.h"
#include "platform/fake/FakeProcessInfo.h"
#include "platform/linux/EtcDeviceInfo.h"
#include "platform/linux/ProcProcessInfo.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

struct DeviceInMemory {
  std::unique_ptr<DeviceInfo> make(std::optional<bool> isInternal,
                                   std::optional<std::int32_t> deviceClass) {
    auto info = std::make_unique<FakeDeviceInfo>(std::make_shared<EventLog>());
    if (isInternal) info->setAnswer("InternalBuild", Value(*isInternal));
    if (deviceClass) info->setDeviceClass(*deviceClass);
    return info;
  }
};

struct DeviceInFiles {
  std::unique_ptr<DeviceInfo> make(std::optional<bool> isInternal,
                                   std::optional<std::int32_t> deviceClass) {
    constexpr std::array<const char*, 8> kChassis = {"server", "handset", "tablet",
                                                     "laptop", "desktop", "convertible",
                                                     "watch",  "embedded"};
    std::string text;
    if (isInternal) {
      text += *isInternal ? "DEPLOYMENT=development\n" : "DEPLOYMENT=production\n";
    }
    if (deviceClass) {
      text += std::string("CHASSIS=") +
              kChassis.at(static_cast<std::size_t>(*deviceClass)) + "\n";
    }
    EtcDeviceInfo::Files files;
    files.machineInfo = directory / "machine-info";
    files.osRelease = {directory / "os-release"};
    std::filesystem::remove(files.machineInfo);
    if (!text.empty()) directory.write("machine-info", text);
    return std::make_unique<EtcDeviceInfo>(files);
  }

  testing_support::TemporaryDirectory directory;
};

template <typename Subject>
class DeviceInfoContract : public testing::Test {
 protected:
  Subject subject_;
};
using Devices = testing::Types<DeviceInMemory, DeviceInFiles>;
TYPED_TEST_SUITE(DeviceInfoContract, Devices);

TYPED_TEST(DeviceInfoContract, SaysWhetherTheBuildIsInternal) {
  EXPECT_EQ(this->subject_.make(true, std::nullopt)->answer("InternalBuild"),
            Value(true));
  EXPECT_EQ(this->subject_.make(false, std::nullopt)->answer("InternalBuild"),
            Value(false));
}

TYPED_TEST(DeviceInfoContract, DoesNotKnowTheBuildOfAnUnknownDevice) {
  EXPECT_FALSE(this->subject_.make(std::nullopt, std::nullopt)->answer("InternalBuild"));
}

TYPED_TEST(DeviceInfoContract, AnswersNoOtherQuestion) {
  const auto info = this->subject_.make(true, 1);
  EXPECT_FALSE(info->answer("SerialNumber"));
  EXPECT_FALSE(info->answer(""));
}

TYPED_TEST(DeviceInfoContract, NumbersTheDeviceClass) {
  for (std::int32_t deviceClass = 0; deviceClass <= 7; ++deviceClass) {
    EXPECT_EQ(this->subject_.make(std::nullopt, deviceClass)->deviceClass(), deviceClass);
  }
  EXPECT_EQ(this->subject_.make(std::nullopt, std::nullopt)->deviceClass(), 0);
}

// Processes: this one, whose name is known, and one that is not there.
struct ProcessesInMemory {
  ProcessesInMemory() { info.setCommandName(running, "audio-client"); }
  FakeProcessInfo info{std::make_shared<EventLog>()};
  const ProcessID running = 77;
  const std::string name = "audio-client";
};

struct ProcessesOfTheKernel {
  ProcessesOfTheKernel() {
    std::ifstream comm("/proc/self/comm");
    std::getline(comm, name);
  }
  ProcProcessInfo info{std::make_shared<PeerRegistry>()};
  const ProcessID running = getpid();
  std::string name;
};

template <typename Subject>
class ProcessInfoContract : public testing::Test {
 protected:
  Subject subject_;
};
using Processes = testing::Types<ProcessesInMemory, ProcessesOfTheKernel>;
TYPED_TEST_SUITE(ProcessInfoContract, Processes);

TYPED_TEST(ProcessInfoContract, KnowsItsOwnProcess) {
  EXPECT_GT(this->subject_.info.processIdentifier(), 0);
  EXPECT_FALSE(this->subject_.info.processName().empty());
}

TYPED_TEST(ProcessInfoContract, NamesARunningProcess) {
  EXPECT_EQ(this->subject_.info.commandName(this->subject_.running), this->subject_.name);
  EXPECT_LE(this->subject_.name.size(), 16u);
}

TYPED_TEST(ProcessInfoContract, HasNoNameForAProcessThatIsNotThere) {
  constexpr ProcessID kBeyondEveryKernel = 0x7FFFFFFF;
  EXPECT_FALSE(this->subject_.info.commandName(kBeyondEveryKernel));
}

TYPED_TEST(ProcessInfoContract, HasNoNameForAnIdThatIsNone) {
  EXPECT_FALSE(this->subject_.info.commandName(0));
  EXPECT_FALSE(this->subject_.info.commandName(-1));
}

TEST(ProcProcessInfo, EndsTheProcessWithItsStatusAndUnwindsNothing) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(
      {
        std::atexit([] { std::_Exit(9); });
        ProcProcessInfo(std::make_shared<PeerRegistry>()).endProcess(2);
      },
      testing::ExitedWithCode(2), "");
}

TEST(FakeProcessInfo, OnlyRecordsItsEnd) {
  FakeProcessInfo info(std::make_shared<EventLog>());
  EXPECT_FALSE(info.endStatus());
  info.endProcess(2);
  info.endProcess(3);
  EXPECT_EQ(info.endStatus(), 2);
}

}  // namespace
}  // namespace ostrel
