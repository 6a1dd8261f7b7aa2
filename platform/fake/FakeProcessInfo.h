#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>

#include "platform/ProcessInfo.h"
#include "platform/fake/EventLog.h"

namespace ostrel {

/// The process 4242, "ostrelreportingd", among those that the test names. Adds
/// "process.commandName PID" and "process.end STATUS" to the events.
class FakeProcessInfo final : public ProcessInfo {
 public:
  explicit FakeProcessInfo(SharedEventLog events);

  ProcessID processIdentifier() const override { return 4242; }
  std::string processName() const override { return "ostrelreportingd"; }
  std::optional<std::string> commandName(ProcessID pid) const override;
  /// Only recorded.
  void endProcess(int status) override;

  void setCommandName(ProcessID pid, std::optional<std::string> name);
  /// The status of the first `endProcess`; none when there was none.
  std::optional<int> endStatus() const;

 private:
  const SharedEventLog events_;
  mutable std::mutex mutex_;
  std::map<ProcessID, std::string> names_;
  std::optional<int> endStatus_;
};

}  // namespace ostrel
