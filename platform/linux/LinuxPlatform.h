#pragma once

#include <chrono>
#include <memory>

#include "platform/IPCListener.h"
#include "platform/OstrelReportingPlatform.h"
#include "platform/Outcome.h"

namespace ostrel {

/// Every role bound to Linux: the one place that picks the bindings and says how
/// they are connected. One per process.
class LinuxPlatform {
 public:
  /// Installs the process's log, opens the socket (the one that systemd passed, or
  /// our own) and makes all bindings. An error is a sentence for people: somebody
  /// else serves that socket, or it cannot be made. Nothing else is touched then.
  static Outcome<std::unique_ptr<LinuxPlatform>> open();
  ~LinuxPlatform();

  IPCListener& listener();
  const OstrelReportingPlatform& platform() const { return platform_; }

  /// Runs what is queued, then makes durable what was accepted, by `deadline`.
  /// False, with an error logged, when that was too soon. After the listener
  /// returned; nothing can be sent afterwards.
  bool finish(std::chrono::steady_clock::time_point deadline);

 private:
  struct Bindings;

  explicit LinuxPlatform(std::unique_ptr<Bindings> bindings);

  const std::unique_ptr<Bindings> bindings_;
  OstrelReportingPlatform platform_;
};

}  // namespace ostrel
