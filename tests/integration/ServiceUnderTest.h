// What the tests of the running service share: the program in directories of its own,
// clients that write down what they are answered, and a look into the store.
#pragma once

#include <signal.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "client/ServiceConnection.h"
#include "platform/linux/ChildProcess.h"
#include "platform/linux/store/StoreTesting.h"

namespace ostrel {

/// A program beside this one.
inline std::string programBeside(const std::string& name) {
  return std::filesystem::read_symlink("/proc/self/exe").parent_path() / name;
}

/// The service in directories of its own, seeing nothing of the machine's buses and
/// files. It is not started until `start`, and killed at the end.
class ServiceUnderTest {
 public:
  using ChildProcess = testing_support::ChildProcess;
  using Rows = std::vector<std::string>;

  ServiceUnderTest() {
    write("machine-info", "CHASSIS=handset\n");
    write("os-release", "");
  }

  std::string operator/(const std::string& name) const {
    return directory_.path() + '/' + name;
  }
  void write(const std::string& name, const std::string& text) const {
    std::ofstream(*this / name, std::ios::binary) << text;
  }
  std::string read(const std::string& name) const {
    std::ifstream file(*this / name, std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
  }
  std::string socketPath() const { return *this / "run/reporting.sock"; }

  /// Variables for the service and for tools that shall find what it finds. A name
  /// alone takes the variable away.
  std::vector<std::string> environment() const {
    return {"RUNTIME_DIRECTORY=" + *this / "run",
            "STATE_DIRECTORY=" + *this / "state",
            "LOGS_DIRECTORY=" + *this / "logs",
            "SYSTEMD_ETC_MACHINE_INFO=" + *this / "machine-info",
            "SYSTEMD_OS_RELEASE=" + *this / "os-release",
            "DBUS_SYSTEM_BUS_ADDRESS=unix:path=" + *this / "bus",
            "OSTREL_REPORTING_SOCKET",
            "WAYLAND_DISPLAY",
            "NOTIFY_SOCKET",
            "LISTEN_FDS",
            "LISTEN_PID",
            "JOURNAL_STREAM"};
  }

  void start() { start({programBeside("ostrelreportingd")}, {}); }
  /// By this command, with `variables` besides.
  void start(std::vector<std::string> command,
             const std::vector<std::string>& variables) {
    std::vector<std::string> all = environment();
    all.insert(all.end(), variables.begin(), variables.end());
    process_ = std::make_unique<ChildProcess>(std::move(command), *this / "log.txt", all);
  }
  ChildProcess& process() { return *process_; }
  void kill() { process_.reset(); }
  /// The exit status after SIGTERM.
  int terminate() {
    ::kill(process_->pid(), SIGTERM);
    return process_->wait();
  }

  /// Rows of the store, columns separated by "|", an absent value "NULL"; none as long
  /// as there is no store.
  Rows rows(const std::string& sql) const {
    const std::string path = *this / "state/reports.db";
    if (!std::filesystem::exists(path)) return {};
    OtherConnection store(path);
    if (store.rows("SELECT name FROM sqlite_master").empty()) return {};
    return store.rows(sql);
  }
  /// Waits for what is durable a moment after it happened.
  bool waitForRows(const std::string& sql, std::size_t count) const {
    return eventually([&] { return rows(sql).size() >= count; });
  }

  /// The exit status of `ostrelctl`, with these arguments.
  int ostrelctl(std::vector<std::string> arguments) const {
    arguments.insert(arguments.begin(), programBeside("ostrelctl"));
    return ChildProcess(std::move(arguments), *this / "ostrelctl.txt", environment())
        .wait();
  }

 private:
  const TemporaryDirectory directory_;
  std::unique_ptr<ChildProcess> process_;
};

/// A client of the service that writes down each reply as it comes: the name of the
/// request and the value.
class RecordingClient {
 public:
  using Replies = std::vector<std::string>;

  /// Waits for the service to be there.
  explicit RecordingClient(const std::string& socketPath) {
    eventually([&] {
      auto connected = ServiceConnection::connect(socketPath);
      if (connected.value) connection_ = *std::move(connected.value);
      return connection_ != nullptr;
    });
    if (connection_ == nullptr) throw std::runtime_error("no service: " + socketPath);
    connection_->setClosedHandler([this](const std::string&) { write("closed"); });
  }
  ~RecordingClient() { connection_->abort(); }
  RecordingClient(const RecordingClient&) = delete;
  RecordingClient& operator=(const RecordingClient&) = delete;

  ServiceConnection* operator->() { return connection_.get(); }

  BoolReply boolean(std::string name) {
    return [this, name = std::move(name)](bool value) {
      write(name + (value ? " true" : " false"));
    };
  }
  ServiceTypeReply serviceType(std::string name) {
    return [this, name = std::move(name)](ServiceType value) {
      write(name + ' ' + std::to_string(static_cast<int>(value)));
    };
  }
  ErrorReply error(std::string name) {
    return [this, name = std::move(name)](const std::optional<ErrorObject>& error) {
      write(name + (error ? ' ' + error->domain + ' ' + std::to_string(error->code)
                          : " no error"));
    };
  }
  DictionaryReply dictionary(std::string name) {
    return [this, name = std::move(name)](const Dictionary& value) {
      std::string text = name;
      for (const auto& [key, each] : value) {
        text += ' ' + std::string(*key.string()) + '=' +
                std::to_string(each.signedInteger().value_or(-1));
      }
      write(std::move(text));
    };
  }
  ReporterIDsReply reporterIDs(std::string name) {
    return [this, name = std::move(name)](const ReporterIDs& ids) {
      std::string text = name;
      for (const ReporterID id : ids) {
        text += ' ' + std::to_string(static_cast<std::int64_t>(id));
      }
      write(std::move(text));
    };
  }

  /// The replies so far, once there are `count` of them or it takes too long.
  Replies wait(std::size_t count) {
    std::unique_lock lock(mutex_);
    changed_.wait_for(lock, std::chrono::seconds(30),
                      [&] { return replies_.size() >= count; });
    return replies_;
  }
  /// All replies to the requests so far that are answered at once: one more request is
  /// answered behind them. Forgets them.
  Replies takeReplies() {
    connection_->getAllReporters([this](const ReporterIDs&) { write(kEnd); });
    std::unique_lock lock(mutex_);
    const auto end = [this] { return std::ranges::find(replies_, kEnd); };
    if (!changed_.wait_for(lock, std::chrono::seconds(30),
                           [&] { return end() != replies_.end(); })) {
      replies_.push_back("not all came");
      return replies_;
    }
    replies_.erase(end());
    return std::exchange(replies_, {});
  }

 private:
  static constexpr const char* kEnd = "end";

  void write(std::string text) {
    const std::lock_guard lock(mutex_);
    replies_.push_back(std::move(text));
    changed_.notify_all();
  }

  std::shared_ptr<ServiceConnection> connection_;
  std::mutex mutex_;
  std::condition_variable changed_;
  Replies replies_;
};

}  // namespace ostrel
