#include "benchmarks/wholepath/ServiceProcess.h"

#include <sqlite3.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <fstream>
#include <thread>

namespace ostrel::bench {
namespace {

constexpr std::chrono::seconds kStartPatience{10};
constexpr std::chrono::seconds kWorkPatience{240};
constexpr std::chrono::microseconds kLookAgain{200};

const char* programName(ServiceKind kind) {
  return kind == ServiceKind::kProduct ? "/ostrelreportingd"
                                       : "/ostrel_bench_counting_service";
}

std::string lastLines(const std::string& path) {
  std::ifstream file(path);
  std::string text((std::istreambuf_iterator<char>(file)), {});
  constexpr std::size_t kShown = 2000;
  return text.size() > kShown ? text.substr(text.size() - kShown) : text;
}

}  // namespace

ServiceProcess::ServiceProcess(const Settings& settings) {
  const std::string& root = directory_.path();
  for (const char* name : {"/run", "/state", "/log"}) {
    std::filesystem::create_directory(root + name);
  }
  std::ofstream(root + "/machine-info")
      << "CHASSIS=handset\n"
      << (settings.isInternalBuild ? "DEPLOYMENT=development\n" : "");
  std::ofstream(root + "/os-release") << "ID=bench\n";
  socketPath_ = root + "/run/reporting.sock";
  if (settings.kind == ServiceKind::kCounting) {
    counts_ = &mapServiceCounts(countsPath(root + "/run"));
  }
  ChildProcess::Settings child;
  child.environment = {"RUNTIME_DIRECTORY=" + root + "/run",
                       "STATE_DIRECTORY=" + root + "/state",
                       "LOGS_DIRECTORY=" + root + "/log",
                       "SYSTEMD_ETC_MACHINE_INFO=" + root + "/machine-info",
                       "SYSTEMD_OS_RELEASE=" + root + "/os-release"};
  child.outputPath = root + "/service.log";
  child.onlyCPU = settings.onlyCPU;
  const auto started = Clock::now();
  process_ = std::make_unique<ChildProcess>(
      ChildProcess::execute({programDirectory() + programName(settings.kind)}, child));
  int socket = -1;
  while ((socket = connectTo(socketPath_)) < 0) {
    if (!process_->isRunning() || Clock::now() - started > kStartPatience) {
      fail("the service did not start: " + lastLines(root + "/service.log"));
    }
    // Close looks, so that a start is timed to a few microseconds.
    std::this_thread::sleep_for(std::chrono::microseconds(20));
  }
  startTime_ = Clock::now() - started;
  ::close(socket);
}

void ServiceProcess::waitUntil(const std::string& what,
                               const std::function<bool()>& isDone) {
  const auto deadline = Clock::now() + kWorkPatience;
  auto nextCheck = Clock::now() + std::chrono::seconds(1);
  while (!isDone()) {
    std::this_thread::sleep_for(kLookAgain);
    const auto now = Clock::now();
    if (now < nextCheck) continue;
    nextCheck = now + std::chrono::seconds(1);
    if (now > deadline || !process_->isRunning()) {
      fail("waited in vain until " + what + ": " +
           lastLines(directory_.path() + "/service.log"));
    }
  }
}

std::uint64_t ServiceProcess::storedMessages() const {
  return storedRows("telemetry_messages");
}

std::uint64_t ServiceProcess::storedAnalyticsEvents() const {
  return storedRows("analytics_events");
}

std::uint64_t ServiceProcess::sessionLogBytes() const {
  std::uint64_t bytes = 0;
  std::error_code error;
  for (const auto& file : std::filesystem::directory_iterator(
           directory_.path() + "/log/Audio/Reporting", error)) {
    bytes += file.file_size();
  }
  return bytes;
}

// Rows are numbered from 1 and never removed here, so that the last tells them all.
std::uint64_t ServiceProcess::storedRows(const char* table) const {
  sqlite3* store = nullptr;
  sqlite3_stmt* statement = nullptr;
  std::uint64_t rows = 0;
  const std::string path = directory_.path() + "/state/reports.db";
  const std::string query = std::string("SELECT max(id) FROM ") + table;
  if (sqlite3_open_v2(path.c_str(), &store, SQLITE_OPEN_READONLY, /*zVfs=*/nullptr) ==
          SQLITE_OK &&
      sqlite3_prepare_v2(store, query.c_str(), /*nByte=*/-1, &statement,
                         /*pzTail=*/nullptr) == SQLITE_OK &&
      sqlite3_step(statement) == SQLITE_ROW) {
    rows = static_cast<std::uint64_t>(sqlite3_column_int64(statement, /*iCol=*/0));
  }
  sqlite3_finalize(statement);
  sqlite3_close(store);
  return rows;
}

std::string programDirectory() {
  return std::filesystem::read_symlink("/proc/self/exe").parent_path();
}

int connectTo(const std::string& path) {
  const int socket = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, /*protocol=*/0);
  if (socket < 0) failWithErrno("socket");
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  if (::connect(socket, reinterpret_cast<const sockaddr*>(&address), sizeof address) ==
      0) {
    return socket;
  }
  ::close(socket);
  return -1;
}

}  // namespace ostrel::bench
