#include "platform/linux/WaylandInterfaceOrientation.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>

#include <cstring>
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
using Names = std::vector<std::string>;

constexpr uid_t kNobody = 65534;

class WaylandInterfaceOrientationDisplay : public testing::Test {
 protected:
  WaylandInterfaceOrientationDisplay() {
    ::setenv("XDG_RUNTIME_DIR", directory_.path().c_str(), /*replace=*/1);
    ::setenv("WAYLAND_DISPLAY", "wayland-1", /*replace=*/1);
  }
  ~WaylandInterfaceOrientationDisplay() override {
    ::unsetenv("WAYLAND_DISPLAY");
    ::unsetenv("XDG_RUNTIME_DIR");
  }

  void observe() {
    service_.registerInterfaceOrientationObserver("a", [this](std::int32_t code) {
      const std::lock_guard lock(mutex_);
      names_.push_back(service_.orientationName(code));
    });
  }
  void unobserve() { service_.unregisterInterfaceOrientationObserver("a"); }
  Names names() {
    const std::lock_guard lock(mutex_);
    return names_;
  }
  std::string socketPath() const { return directory_ / "wayland-1"; }

  const TemporaryDirectory directory_;
  std::mutex mutex_;
  Names names_;
  LinuxOrientationService service_{milliseconds(10)};
};

/// A compositor without a screen.
class WaylandInterfaceOrientationSway : public WaylandInterfaceOrientationDisplay {
 protected:
  void SetUp() override {
    ASSERT_EQ(ChildProcess({"sway", "--version"}).wait(), 0)
        << "sway is missing: scripts/install-packages test installs it";
    directory_.write("config", "");
    // It refuses to run as root.
    if (::geteuid() == 0) {
      ASSERT_EQ(::chown(directory_.path().c_str(), kNobody, kNobody), 0);
      ASSERT_EQ(::chmod((directory_ / "config").c_str(), 0644), 0);
    }
  }

  std::vector<std::string> asUser(std::vector<std::string> command) const {
    if (::geteuid() == 0) {
      const std::string id = std::to_string(kNobody);
      command.insert(command.begin(),
                     {"setpriv", "--reuid=" + id, "--regid=" + id, "--clear-groups"});
    }
    return command;
  }
  void startSway() {
    std::filesystem::remove(socketPath());
    std::filesystem::remove(commandPath());
    sway_ = std::make_unique<ChildProcess>(
        asUser({"sway", "--config", directory_ / "config"}), directory_ / "output",
        std::vector<std::string>{"WLR_BACKENDS=headless", "WLR_RENDERER=pixman",
                                 "WLR_LIBINPUT_NO_DEVICES=1", "SWAYSOCK=" + commandPath(),
                                 "XDG_RUNTIME_DIR=" + directory_.path(),
                                 "HOME=" + directory_.path()});
    ASSERT_TRUE(eventually([this] { return turn("normal"); }));
  }
  bool turn(const std::string& transform) const {
    return ChildProcess(asUser({"swaymsg", "--socket", commandPath(), "output",
                                "HEADLESS-1", "transform", transform}))
               .wait() == 0;
  }
  std::string commandPath() const { return directory_ / "commands"; }

  std::unique_ptr<ChildProcess> sway_;
};

TEST_F(WaylandInterfaceOrientationSway, ReportsChangesOfTheOutput) {
  startSway();
  observe();
  // Not seen from here: when the first state has come. Turn until heard.
  ASSERT_TRUE(eventually(
      [this] { return turn("flipped") && turn("flipped-90") && !names().empty(); }));
  ASSERT_TRUE(eventually([this] { return names().back() == "flipped-270"; }))
      << names().back();
  const std::size_t before = names().size();
  // The compositor's clockwise 90 is the protocol's 270.
  for (const auto* transform : {"90", "180", "270", "normal"}) {
    const std::size_t seen = names().size();
    ASSERT_TRUE(turn(transform));
    ASSERT_TRUE(eventually([&] { return names().size() > seen; })) << transform;
  }
  const Names all = names();
  EXPECT_EQ(Names(all.begin() + static_cast<std::ptrdiff_t>(before), all.end()),
            (Names{"270", "180", "90", "normal"}));
}

TEST_F(WaylandInterfaceOrientationSway, FindsACompositorThatIsStartedAgain) {
  startSway();
  observe();
  ASSERT_TRUE(
      eventually([this] { return turn("90") && turn("180") && !names().empty(); }));
  ASSERT_TRUE(eventually([this] { return names().back() == "180"; }));
  sway_.reset();
  startSway();
  EXPECT_TRUE(eventually([this] { return names().back() == "normal"; }));
}

TEST_F(WaylandInterfaceOrientationDisplay, IsConfiguredByTheEnvironment) {
  const WaylandInterfaceOrientation source(BackOff::kFirst);
  EXPECT_TRUE(source.isConfigured());
  ::unsetenv("XDG_RUNTIME_DIR");
  EXPECT_FALSE(source.isConfigured());
  ::setenv("WAYLAND_DISPLAY", "/full/path", /*replace=*/1);
  EXPECT_TRUE(source.isConfigured());
  ::setenv("WAYLAND_DISPLAY", "", /*replace=*/1);
  EXPECT_FALSE(source.isConfigured());
  ::unsetenv("WAYLAND_DISPLAY");
  EXPECT_FALSE(source.isConfigured());
}

TEST_F(WaylandInterfaceOrientationDisplay, MayBeMissing) {
  observe();
  const auto begin = steady_clock::now();
  unobserve();
  EXPECT_LT(steady_clock::now() - begin, milliseconds(100));
}

TEST_F(WaylandInterfaceOrientationDisplay, ThatHangsOrTalksNonsenseCostsNothing) {
  const FileDescriptor listener = testing_support::listeningSocket(socketPath());
  ASSERT_TRUE(listener);
  observe();
  // An event of an object that never was, one too long, and random bytes.
  const std::string junk[] = {std::string("\x63\0\0\0\0\0\x0c\0\0\0\0\0", 12),
                              std::string("\1\0\0\0\0\0\xff\xff", 8),
                              std::string(4096, '\xa5')};
  for (const std::string& bytes : junk) {
    const FileDescriptor client(
        ::accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
    ASSERT_TRUE(client);
    EXPECT_GT(::send(client.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL), 0);
  }
  const FileDescriptor silent(::accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
  const auto begin = steady_clock::now();
  unobserve();
  EXPECT_LT(steady_clock::now() - begin, milliseconds(100));
  EXPECT_TRUE(names().empty());
}

}  // namespace
}  // namespace ostrel
