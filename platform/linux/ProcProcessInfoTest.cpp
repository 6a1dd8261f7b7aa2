#include "platform/linux/ProcProcessInfo.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <utility>

#include "platform/linux/ChildProcess.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using namespace std::chrono_literals;
using testing_support::TemporaryDirectory;

TEST(ProcProcessInfo, NamesAProcessThatIsConnected) {
  testing_support::ChildProcess sleeper({"sleep", "60"});
  const auto peers = std::make_shared<PeerRegistry>();
  peers->peerConnected(sleeper.pid(), /*connection=*/1, openProcess(sleeper.pid()));
  const ProcProcessInfo info(peers);

  // The name is the new program's as soon as it runs.
  std::optional<std::string> name;
  for (int i = 0; i < 500 && name != "sleep"; ++i) {
    std::this_thread::sleep_for(10ms);
    name = info.commandName(sleeper.pid());
  }

  EXPECT_EQ(name, "sleep");
}

TEST(ProcProcessInfo, DoesNotNameAProcessThatHasEndedOrThatIsNone) {
  const auto peers = std::make_shared<PeerRegistry>();
  ProcessID pid = 0;
  {
    testing_support::ChildProcess sleeper({"sleep", "60"});
    pid = sleeper.pid();
    peers->peerConnected(pid, /*connection=*/1, openProcess(pid));
  }
  const ProcProcessInfo info(peers);

  EXPECT_EQ(info.commandName(pid), std::nullopt);
  EXPECT_EQ(info.commandName(0), std::nullopt);
  EXPECT_EQ(info.commandName(-1), std::nullopt);
}

TEST(ProcProcessInfo, DoesNotNameAnotherProcessThatHasTheIDByNow) {
  TemporaryDirectory proc;
  std::filesystem::create_directories(proc / std::to_string(::getpid() + 1));
  proc.write(std::to_string(::getpid() + 1) + "/comm", "impostor\n");
  const auto peers = std::make_shared<PeerRegistry>();
  testing_support::ChildProcess gone({"true"});
  FileDescriptor process = openProcess(gone.pid());
  gone.wait();
  peers->peerConnected(::getpid() + 1, /*connection=*/1, std::move(process));

  EXPECT_EQ(ProcProcessInfo(peers, proc.path()).commandName(::getpid() + 1),
            std::nullopt);
}

TEST(ProcProcessInfo, DoesNotNameAClientThatHasDisconnected) {
  testing_support::ChildProcess sleeper({"sleep", "60"});
  const auto peers = std::make_shared<PeerRegistry>();
  peers->peerConnected(sleeper.pid(), /*connection=*/1, openProcess(sleeper.pid()));
  peers->peerDisconnected(sleeper.pid(), /*connection=*/1);

  EXPECT_EQ(ProcProcessInfo(peers).commandName(sleeper.pid()), std::nullopt);
}

TEST(ProcProcessInfo, DoesNotNameAClientWhoseProcessIsNotKnown) {
  testing_support::ChildProcess another({"sleep", "60"});
  const auto peers = std::make_shared<PeerRegistry>();
  peers->peerConnected(another.pid(), /*connection=*/1, FileDescriptor());

  EXPECT_EQ(ProcProcessInfo(peers).commandName(another.pid()), std::nullopt);
}

TEST(ProcProcessInfo, PassesOverANameThatIsNotText) {
  TemporaryDirectory proc;
  testing_support::ChildProcess sleeper({"sleep", "60"});
  std::filesystem::create_directories(proc / std::to_string(sleeper.pid()));
  proc.write(std::to_string(sleeper.pid()) + "/comm", "\xFF\xFE\n");

  EXPECT_EQ(ProcProcessInfo(std::make_shared<PeerRegistry>(), proc.path())
                .commandName(sleeper.pid()),
            std::nullopt);
}

TEST(ProcProcessInfo, SaysFarewellBeforeItEndsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  const auto farewell = [] { std::fputs("farewell", stderr); };
  EXPECT_EXIT(
      ProcProcessInfo(std::make_shared<PeerRegistry>(), "/proc", farewell).endProcess(2),
      testing::ExitedWithCode(2), "farewell");
}

}  // namespace
}  // namespace ostrel
