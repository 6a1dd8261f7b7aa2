#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "benchmarks/wholepath/ChildProcess.h"
#include "benchmarks/wholepath/ServiceCounts.h"

namespace ostrel::bench {

enum class ServiceKind {
  kProduct,   // ostrelreportingd with its store.
  kCounting,  // The same with a backend and sinks that only count.
};

/// A service on private directories of its own, ended and removed with this object.
/// Its log lines go to a file there.
class ServiceProcess {
 public:
  struct Settings {
    ServiceKind kind = ServiceKind::kCounting;
    bool isInternalBuild = false;  // Writes the session log.
    int onlyCPU = -1;
  };

  /// Returns when it accepts connections.
  explicit ServiceProcess(const Settings& settings);

  const std::string& socketPath() const { return socketPath_; }
  const ChildProcess& process() const { return *process_; }
  /// From exec until a connection was accepted.
  Seconds startTime() const { return startTime_; }

  /// Of a counting service.
  ServiceCounts& counts() { return *counts_; }
  /// Rows of a product's store that can be read by others: messages with a session.
  std::uint64_t storedMessages() const;
  std::uint64_t storedAnalyticsEvents() const;
  /// Bytes of the session logs that it wrote.
  std::uint64_t sessionLogBytes() const;

  /// Waits until `isDone`; ends the run when that takes longer than a few minutes or
  /// the service ended.
  void waitUntil(const std::string& what, const std::function<bool()>& isDone);

 private:
  std::uint64_t storedRows(const char* table) const;

  PrivateDirectory directory_;
  std::string socketPath_;
  ServiceCounts* counts_ = nullptr;
  std::unique_ptr<ChildProcess> process_;
  Seconds startTime_{};
};

/// Directory of the programs of this build.
std::string programDirectory();

/// A connected stream socket; -1 when nobody listens at `path`.
int connectTo(const std::string& path);

}  // namespace ostrel::bench
