// The names of clients whose process IDs become other processes' at once. They connect
// from under names that their sockets bear too, so that each name that is found can be
// told to be right.
#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>

#include <cerrno>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <ostream>
#include <string>
#include <thread>

#include "platform/linux/PIDNamespace.h"
#include "platform/linux/ProcProcessInfo.h"
#include "platform/linux/UnixSocketIPCListenerTestSupport.h"

namespace ostrel {
namespace {

using testing_support::chooseNextPID;
using testing_support::RecordingService;
using testing_support::TemporaryDirectory;
using testing_support::UnixAddress;

/// What becomes of a client once it has connected.
enum class Fate { kStays, kTurnsInto, kEnds, kTurnsIntoAndEnds, kLeavesSocketToChild };
constexpr std::size_t kFates = 5;

/// Until when the service waits with it, if its ID is taken again.
enum class Wait { kNot, kWithTheLookUp, kWithAccepting };
constexpr std::size_t kWaits = 3;

enum class Kernel { kThis, kWithoutDescriptorsOfPeers };

std::ostream& operator<<(std::ostream& out, Kernel kernel) {
  return out << (kernel == Kernel::kThis ? "ThisKernel" : "AnOlderKernel");
}

struct Tally {
  int connections = 0;
  int reused = 0;  // IDs that another process had at once.
  int right = 0;
  int none = 0;     // No name, of one that had ended or might have.
  int missing = 0;  // No name, of one that stayed.
  int wrong = 0;
  int lost = 0;  // Never asked for.

  auto tied() { return std::tie(connections, reused, right, none, missing, wrong, lost); }
};

std::size_t clientsToMeet() {
  const char* text = std::getenv("OSTREL_CLIENTS");
  return text != nullptr ? std::strtoul(text, nullptr, /*base=*/10) : 200;
}

/// The listener and the process information of the service. Names are asked for as soon
/// as a client is accepted.
class NamingService final : public IPCListenerDelegate {
 public:
  explicit NamingService(const std::string& path) : info_(peers_) {
    ListenerOptions options;
    options.identityOf = [this](int socket) { return identityOf(socket); };
    auto opened = UnixSocketIPCListener::open(path, peers_, std::move(options));
    if (!opened.value) std::abort();
    listener_ = *std::move(opened.value);
    listener_->setDelegate(this);
    thread_ = std::thread([this] { listener_->resume(); });
  }
  ~NamingService() override {
    listener_->stop();
    thread_.join();
  }

  /// Waits as told with the clients that come, until `goOn`.
  void wait(Wait wait) {
    const std::lock_guard lock(mutex_);
    wait_ = wait;
  }
  /// Until a client waits.
  void awaitClient() {
    std::unique_lock lock(mutex_);
    changed_.wait(lock, [&] { return isWaiting_; });
  }
  void goOn() {
    const std::lock_guard lock(mutex_);
    wait_ = Wait::kNot;
    isWaiting_ = false;
    changed_.notify_all();
  }

  /// The name that was found for the client whose socket has this one; no string where
  /// none was, nothing where nobody asked.
  std::optional<std::optional<std::string>> nameOf(const std::string& label) {
    std::unique_lock lock(mutex_);
    changed_.wait_for(lock, std::chrono::seconds(20),
                      [&] { return names_.contains(label); });
    const auto found = names_.extract(label);
    if (found.empty()) return std::nullopt;
    return found.mapped();
  }

  bool listenerShouldAcceptNewConnection(
      IPCListener&, const std::shared_ptr<IPCConnection>& connection) override {
    connection->setExportedObject(service_);
    connection->resume();
    waitWhile(Wait::kWithTheLookUp);
    const auto name = info_.commandName(connection->processIdentifier());
    const std::lock_guard lock(mutex_);
    names_[label_] = name;
    changed_.notify_all();
    return true;
  }

 private:
  PeerIdentity identityOf(int socket) {
    sockaddr_un address{};
    socklen_t size = sizeof address;
    ::getpeername(socket, reinterpret_cast<sockaddr*>(&address), &size);
    label_.assign(address.sun_path + 1, size - offsetof(sockaddr_un, sun_path) - 1);
    waitWhile(Wait::kWithAccepting);
    ucred credentials{};
    size = sizeof credentials;
    ::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &size);
    return {credentials.pid, credentials.uid};
  }
  void waitWhile(Wait wait) {
    std::unique_lock lock(mutex_);
    isWaiting_ = wait_ == wait;
    changed_.notify_all();
    changed_.wait(lock, [&] { return wait_ != wait; });
  }

  const std::shared_ptr<PeerRegistry> peers_ = std::make_shared<PeerRegistry>();
  const ProcProcessInfo info_;
  const std::shared_ptr<RecordingService> service_ = std::make_shared<RecordingService>();
  std::unique_ptr<UnixSocketIPCListener> listener_;
  std::thread thread_;
  std::string label_;  // The listener's thread's.
  std::mutex mutex_;
  std::condition_variable changed_;
  Wait wait_ = Wait::kNot;
  bool isWaiting_ = false;
  std::map<std::string, std::optional<std::string>> names_;
};

/// A pipe whose reading ends are told of its end.
class Signal {
 public:
  Signal() {
    if (::pipe2(ends_, O_CLOEXEC) != 0) std::abort();
  }
  ~Signal() {
    ::close(ends_[0]);
    ::close(ends_[1]);
  }
  Signal(const Signal&) = delete;
  Signal& operator=(const Signal&) = delete;

  void give() const { [[maybe_unused]] const ssize_t sent = ::write(ends_[1], "", 1); }
  void await() const {
    char byte;
    [[maybe_unused]] const ssize_t count = ::read(ends_[0], &byte, 1);
  }

 private:
  int ends_[2];
};

/// One client and, where it ends, the process that has its ID then. What the children do
/// is what a copy of a process with threads may.
class Encounter {
 public:
  Encounter(std::size_t number, Fate fate, std::string servicePath,
            const std::string& directory)
      : name_("c" + std::to_string(number)),
        laterName_("x" + std::to_string(number)),
        impostor_("i" + std::to_string(number)),
        fate_(fate),
        servicePath_(std::move(servicePath)),
        program_(directory + "/" + laterName_),
        service_(servicePath_),
        label_("@" + name_),
        impostorLabel_("@" + impostor_) {
    std::filesystem::create_symlink("/bin/sleep", program_);
  }
  ~Encounter() {
    std::filesystem::remove(program_);
    if (pid_ > 0 && stays()) ::kill(pid_, SIGKILL);
    if (other_ > 0) ::kill(other_, SIGKILL);
    isOver_.give();
    while (::waitpid(-1, nullptr, /*options=*/0) > 0) {
    }
  }
  Encounter(const Encounter&) = delete;
  Encounter& operator=(const Encounter&) = delete;

  const std::string& name() const { return name_; }
  const std::string& impostor() const { return impostor_; }
  bool stays() const { return fate_ == Fate::kStays || fate_ == Fate::kTurnsInto; }
  bool isRight(const std::string& name) const {
    return name == name_ || name == laterName_;
  }

  void connectAs(pid_t pid) {
    chooseNextPID(pid);
    pid_ = ::fork();
    if (pid_ == 0) beClient();
    hasConnected_.await();
    if (!stays()) ::waitpid(pid_, nullptr, /*options=*/0);
  }
  /// Whether another has the client's ID now, and is connected too.
  bool takeAgain() {
    chooseNextPID(pid_);
    other_ = ::fork();
    if (other_ == 0) {
      connectUnder(impostor_, impostorLabel_);
      for (;;) ::pause();
    }
    hasConnected_.await();
    return other_ == pid_;
  }

 private:
  void connectUnder(const std::string& name, const UnixAddress& label) const {
    ::prctl(PR_SET_NAME, name.c_str());
    const int socket = ::socket(AF_UNIX, SOCK_STREAM, /*protocol=*/0);
    if (::bind(socket, label.get(), label.size()) != 0 ||
        ::connect(socket, service_.get(), service_.size()) != 0) {
      ::_exit(1);
    }
    hasConnected_.give();
  }
  [[noreturn]] void beClient() const {
    connectUnder(name_, label_);
    if (fate_ == Fate::kLeavesSocketToChild && ::fork() == 0) {
      isOver_.await();
      ::_exit(0);
    }
    if (fate_ == Fate::kTurnsInto) become("1000");
    if (fate_ == Fate::kTurnsIntoAndEnds) become("0");
    if (fate_ == Fate::kStays) {
      for (;;) ::pause();
    }
    ::_exit(0);
  }
  [[noreturn]] void become(const char* seconds) const {
    ::execl(program_.c_str(), "sleep", seconds, nullptr);
    ::_exit(1);
  }

  const std::string name_;
  const std::string laterName_;
  const std::string impostor_;
  const Fate fate_;
  const std::string servicePath_;
  const std::string program_;
  const UnixAddress service_;
  const UnixAddress label_;
  const UnixAddress impostorLabel_;
  const Signal hasConnected_;
  const Signal isOver_;
  pid_t pid_ = 0;
  pid_t other_ = 0;
};

/// Takes from this process, and those that it starts, what kernels before 6.5 have not.
bool forgetDescriptorsOfPeers() {
  constexpr std::uint32_t kPeerPIDFD = 77;
  constexpr auto kSecond = static_cast<std::uint32_t>(offsetof(seccomp_data, args[1]));
  constexpr auto kThird = static_cast<std::uint32_t>(offsetof(seccomp_data, args[2]));
  sock_filter filter[] = {
      BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
      BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_getsockopt, 0, 5),
      BPF_STMT(BPF_LD | BPF_W | BPF_ABS, kSecond),
      BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SOL_SOCKET, 0, 3),
      BPF_STMT(BPF_LD | BPF_W | BPF_ABS, kThird),
      BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, kPeerPIDFD, 0, 1),
      BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | ENOPROTOOPT),
      BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
  };
  const sock_fprog program{std::size(filter), filter};
  return ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
         ::prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program) == 0;
}

// An older kernel does not tell of a client that ended and left its socket to another
// before it was accepted.
bool isKnowable(Kernel kernel, Fate fate, Wait wait) {
  return kernel == Kernel::kThis || fate != Fate::kLeavesSocketToChild ||
         wait == Wait::kWithTheLookUp;
}

void judge(Tally& tally, const Encounter& encounter, NamingService& service) {
  ++tally.connections;
  const auto found = service.nameOf(encounter.name());
  if (!found) {
    ++tally.lost;
  } else if (!*found) {
    ++(encounter.stays() ? tally.missing : tally.none);
  } else {
    ++(encounter.isRight(**found) ? tally.right : tally.wrong);
  }
}

void judgeImpostor(Tally& tally, const Encounter& encounter, NamingService& service) {
  ++tally.connections;
  const auto found = service.nameOf(encounter.impostor());
  if (!found) {
    ++tally.lost;
  } else if (!*found) {
    ++tally.missing;
  } else {
    ++(**found == encounter.impostor() ? tally.right : tally.wrong);
  }
}

int meetAll(Kernel kernel, const TemporaryDirectory& directory, std::size_t clients) {
  if (kernel != Kernel::kThis && !forgetDescriptorsOfPeers()) return 1;
  const std::string path = directory / "run/reporting.sock";
  Tally tally;
  NamingService service(path);
  constexpr pid_t kFirst = 300;
  constexpr pid_t kPIDs = 300;
  for (std::size_t i = 0; i < clients; ++i) {
    const Fate fate{static_cast<int>(i % kFates)};
    const Wait wait{static_cast<int>(i / kFates % kWaits)};
    if (!isKnowable(kernel, fate, wait)) continue;
    Encounter encounter(i, fate, path, directory.path());
    service.wait(encounter.stays() ? Wait::kNot : wait);
    encounter.connectAs(kFirst + static_cast<pid_t>(i) % kPIDs);
    // What was accepted in time is told from what was accepted too late.
    if (!encounter.stays() && wait == Wait::kWithTheLookUp) service.awaitClient();
    if (!encounter.stays() && encounter.takeAgain()) ++tally.reused;
    service.goOn();
    judge(tally, encounter, service);
    if (!encounter.stays()) judgeImpostor(tally, encounter, service);
  }
  std::ofstream file(directory / "tally");
  std::apply([&](auto... counts) { ((file << counts << '\n'), ...); }, tally.tied());
  return file.flush() ? 0 : 1;
}

class NamesOfClients : public testing::TestWithParam<Kernel> {};

TEST_P(NamesOfClients, AreNeverThoseOfProcessesThatHaveTheirIDsByNow) {
  TemporaryDirectory directory;
  const std::size_t clients = clientsToMeet();
  const int status = testing_support::inPIDNamespace(
      [&] { return meetAll(GetParam(), directory, clients); });
  if (status < 0) FAIL() << testing_support::kPIDNamespaceMissing;
  ASSERT_EQ(status, 0);

  Tally tally;
  std::ifstream file(directory / "tally");
  std::apply([&](auto&... counts) { (file >> ... >> counts); }, tally.tied());
  std::printf("%d connections, %d IDs taken again: %d right names, %d none, %d wrong\n",
              tally.connections, tally.reused, tally.right, tally.none, tally.wrong);
  EXPECT_EQ(tally.wrong, 0);
  EXPECT_EQ(tally.missing, 0) << "of clients that were there all the time";
  EXPECT_EQ(tally.lost, 0);
  EXPECT_GE(tally.connections, static_cast<int>(clients));
  EXPECT_GE(tally.reused, tally.connections / 4);
}

INSTANTIATE_TEST_SUITE_P(On, NamesOfClients,
                         testing::Values(Kernel::kThis,
                                         Kernel::kWithoutDescriptorsOfPeers),
                         testing::PrintToStringParamName());

}  // namespace
}  // namespace ostrel
