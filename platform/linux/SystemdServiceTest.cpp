#include "platform/linux/SystemdService.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <string>

#include "platform/linux/FileDescriptor.h"
#include "platform/linux/TestSockets.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using testing_support::boundSocket;
using testing_support::TemporaryDirectory;

/// What `takePassedSockets` gives in a process with this environment, whose
/// descriptor 3 is open and 4 is not. `pid` is "self" for its own.
int taken(
    const char* pid, const char* count,
    const std::function<bool()>& check = [] { return true; }) {
  std::array<int, 2> result{};
  EXPECT_EQ(::pipe(result.data()), 0);
  const pid_t child = ::fork();
  if (child == 0) {
    const int out = ::fcntl(result[1], F_DUPFD, 100);
    const int open = ::open("/dev/null", O_RDONLY);
    ::dup2(open, kFirstPassedSocket);
    ::close(kFirstPassedSocket + 1);
    const std::string self = std::to_string(::getpid());
    ::setenv("LISTEN_FDNAMES", "request", /*replace=*/1);
    if (pid != nullptr) {
      ::setenv("LISTEN_PID", pid == std::string("self") ? self.c_str() : pid, 1);
    }
    if (count != nullptr) ::setenv("LISTEN_FDS", count, /*replace=*/1);
    int taken = takePassedSockets();
    const bool isClean = std::getenv("LISTEN_PID") == nullptr &&
                         std::getenv("LISTEN_FDS") == nullptr &&
                         std::getenv("LISTEN_FDNAMES") == nullptr;
    if (!isClean || !check()) taken = 9999;
    if (::write(out, &taken, sizeof taken) < 0) ::_exit(1);
    ::_exit(0);
  }
  int taken = 0;
  EXPECT_EQ(::read(result[0], &taken, sizeof taken), ssize_t{sizeof taken});
  ::close(result[0]);
  ::close(result[1]);
  ::waitpid(child, nullptr, 0);
  return taken;
}

TEST(SystemdServiceSockets, AreCountedAndTheEnvironmentIsCleaned) {
  EXPECT_EQ(taken("self", "1"), 1);
  EXPECT_EQ(taken("self", "0"), 0);
}

TEST(SystemdServiceSockets, AreClosedInProgramsThatAreStarted) {
  EXPECT_EQ(
      taken("self", "1",
            [] { return (::fcntl(kFirstPassedSocket, F_GETFD) & FD_CLOEXEC) != 0; }),
      1);
}

TEST(SystemdServiceSockets, AreNoneWhenTheyAreMeantForAnother) {
  EXPECT_EQ(taken("1", "1"), 0);
  EXPECT_EQ(taken(nullptr, "1"), 0);
  EXPECT_EQ(taken("self", nullptr), 0);
  EXPECT_EQ(taken(nullptr, nullptr), 0);
}

TEST(SystemdServiceSockets, AreAnErrorWhenTheVariablesAreWrong) {
  for (const auto* count : {"", "x", "1x", "-1", "99999999999", "2147483647"}) {
    EXPECT_EQ(taken("self", count), -EINVAL) << count;
  }
  EXPECT_EQ(taken("me", "1"), -EINVAL);
  EXPECT_EQ(taken("self", "2"), -EBADF);
}

TEST(SystemdServiceSockets, AreToldByTheirKind) {
  const TemporaryDirectory directory;
  const FileDescriptor stream = boundSocket(SOCK_STREAM, directory / "stream");
  EXPECT_FALSE(isListeningUnixStream(stream.get()));
  ASSERT_EQ(::listen(stream.get(), 1), 0);
  EXPECT_TRUE(isListeningUnixStream(stream.get()));
  const FileDescriptor packets = boundSocket(SOCK_SEQPACKET, directory / "packets");
  ASSERT_EQ(::listen(packets.get(), 1), 0);
  EXPECT_FALSE(isListeningUnixStream(packets.get()));
  const FileDescriptor file(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  EXPECT_FALSE(isListeningUnixStream(file.get()));
  EXPECT_FALSE(isListeningUnixStream(-1));
}

class SystemdServiceNotification : public testing::Test {
 protected:
  ~SystemdServiceNotification() override { ::unsetenv("NOTIFY_SOCKET"); }
  const TemporaryDirectory directory_;
};

TEST_F(SystemdServiceNotification, ReachesASocketOfAnyName) {
  for (const std::string& path :
       {directory_ / "notify", "@ostrel-test-" + std::to_string(::getpid())}) {
    const FileDescriptor socket = boundSocket(SOCK_DGRAM, path);
    ::setenv("NOTIFY_SOCKET", path.c_str(), /*replace=*/1);
    notifySystemd("READY=1");
    std::array<char, 64> text{};
    EXPECT_EQ(::recv(socket.get(), text.data(), text.size(), MSG_DONTWAIT), 7) << path;
    EXPECT_STREQ(text.data(), "READY=1");
  }
}

TEST_F(SystemdServiceNotification, IsNothingWithoutASocket) {
  for (const std::string& path :
       {std::string(), std::string("/"), directory_ / "none", std::string(500, 'x')}) {
    ::setenv("NOTIFY_SOCKET", path.c_str(), /*replace=*/1);
    notifySystemd("READY=1");
  }
  ::unsetenv("NOTIFY_SOCKET");
  notifySystemd("READY=1");
}

}  // namespace
}  // namespace ostrel
