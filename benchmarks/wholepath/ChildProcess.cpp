#include "benchmarks/wholepath/ChildProcess.h"

#include <fcntl.h>
#include <sched.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>
#include <utility>

namespace ostrel::bench {
namespace {

constexpr std::chrono::seconds kEndPatience{3};

Seconds timeOf(clockid_t clock) {
  timespec time{};
  ::clock_gettime(clock, &time);
  return Seconds(static_cast<double>(time.tv_sec) +
                 1e-9 * static_cast<double>(time.tv_nsec));
}

// "VmRSS:     1234 kB" and the like; 0 when there is none.
std::uint64_t statusNumber(const std::string& path, const std::string& name) {
  std::ifstream file(path);
  std::string line;
  while (std::getline(file, line)) {
    if (line.rfind(name + ":", 0) == 0) {
      return std::strtoull(line.c_str() + name.size() + 1, /*endptr=*/nullptr, 10);
    }
  }
  return 0;
}

int statusCode(int status) {
  return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

}  // namespace

void fail(const std::string& sentence) {
  std::fprintf(stderr, "ostrel_bench: %s\n", sentence.c_str());
  std::exit(EXIT_FAILURE);
}

void failWithErrno(const std::string& what) { fail(what + ": " + std::strerror(errno)); }

ChildProcess ChildProcess::fork(const std::function<void()>& body, int onlyCPU) {
  std::fflush(/*stream=*/nullptr);
  const pid_t pid = ::fork();
  if (pid < 0) failWithErrno("fork");
  if (pid == 0) {
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    useOnlyCPU(onlyCPU);
    body();
    std::_Exit(EXIT_SUCCESS);
  }
  return ChildProcess(pid);
}

ChildProcess ChildProcess::execute(const std::vector<std::string>& command,
                                   const Settings& settings) {
  std::vector<std::string> texts;
  for (char** entry = environ; *entry != nullptr; ++entry) texts.emplace_back(*entry);
  texts.insert(texts.end(), settings.environment.begin(), settings.environment.end());
  std::vector<char*> environment;
  // The last of one name counts.
  for (auto text = texts.rbegin(); text != texts.rend(); ++text) {
    environment.push_back(text->data());
  }
  environment.push_back(nullptr);
  std::vector<std::string> words = command;
  std::vector<char*> arguments;
  for (std::string& word : words) arguments.push_back(word.data());
  arguments.push_back(nullptr);

  const pid_t pid = ::vfork();
  if (pid < 0) failWithErrno("vfork");
  if (pid == 0) {
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (settings.onlyCPU >= 0) useOnlyCPU(settings.onlyCPU);
    if (!settings.outputPath.empty()) {
      const int output = ::open(settings.outputPath.c_str(),
                                O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
      ::dup2(output, STDOUT_FILENO);
      ::dup2(output, STDERR_FILENO);
    }
    ::execve(arguments[0], arguments.data(), environment.data());
    ::_exit(127);
  }
  return ChildProcess(pid);
}

ChildProcess::ChildProcess(ChildProcess&& other) noexcept
    : pid_(std::exchange(other.pid_, -1)) {}

ChildProcess::~ChildProcess() {
  if (pid_ < 0) return;
  ::kill(pid_, SIGTERM);
  const auto deadline = Clock::now() + kEndPatience;
  while (::waitpid(pid_, /*status=*/nullptr, WNOHANG) == 0) {
    if (Clock::now() > deadline) {
      ::kill(pid_, SIGKILL);
      ::waitpid(pid_, /*status=*/nullptr, /*options=*/0);
      return;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
}

int ChildProcess::wait() {
  int status = 0;
  while (::waitpid(pid_, &status, /*options=*/0) < 0) {
    if (errno != EINTR) failWithErrno("waitpid");
  }
  pid_ = -1;
  return statusCode(status);
}

bool ChildProcess::isRunning() const {
  siginfo_t ended{};
  return pid_ >= 0 &&
         ::waitid(P_PID, static_cast<id_t>(pid_), &ended, WEXITED | WNOHANG | WNOWAIT) ==
             0 &&
         ended.si_pid == 0;
}

Seconds ChildProcess::processorTime() const {
  clockid_t clock = 0;
  if (::clock_getcpuclockid(pid_, &clock) != 0) fail("a measured process has ended");
  return timeOf(clock);
}

Memory ChildProcess::memory() const {
  constexpr std::uint64_t kKilobyte = 1024;
  const std::string path = "/proc/" + std::to_string(pid_) + "/status";
  return {statusNumber(path, "VmRSS") * kKilobyte,
          statusNumber(path, "RssAnon") * kKilobyte,
          statusNumber(path, "VmHWM") * kKilobyte, statusNumber(path, "Threads")};
}

void ChildProcess::forgetPeakMemory() const {
  std::ofstream("/proc/" + std::to_string(pid_) + "/clear_refs") << "5\n";
}

std::uint64_t ChildProcess::wakeups() const {
  std::uint64_t count = 0;
  const std::string tasks = "/proc/" + std::to_string(pid_) + "/task";
  for (const auto& task : std::filesystem::directory_iterator(tasks)) {
    count += statusNumber(task.path().string() + "/status", "voluntary_ctxt_switches");
  }
  return count;
}

Seconds ownProcessorTime() { return timeOf(CLOCK_PROCESS_CPUTIME_ID); }

void useOnlyCPU(int cpu) {
  cpu_set_t set;
  CPU_ZERO(&set);
  for (int i = 0; i < CPU_SETSIZE; ++i) {
    if (cpu < 0 || i == cpu) CPU_SET(i, &set);
  }
  ::sched_setaffinity(/*pid=*/0, sizeof set, &set);
}

PrivateDirectory::PrivateDirectory() {
  std::string pattern =
      (std::filesystem::temp_directory_path() / "ostrel-bench-XXXXXX").string();
  if (::mkdtemp(pattern.data()) == nullptr) failWithErrno(pattern);
  path_ = pattern;
}

PrivateDirectory::~PrivateDirectory() {
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

}  // namespace ostrel::bench
