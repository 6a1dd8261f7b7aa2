#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/ProcessInfo.h"
#include "platform/linux/PeerRegistry.h"

namespace ostrel {

/// Process names by /proc. A client's name is read while its process is known to
/// live, so that it is never that of a later process with the same id.
class ProcProcessInfo final : public ProcessInfo {
 public:
  /// `procDirectory` is "/proc" but in tests. `farewell` is called before the process
  /// ends by `endProcess`.
  explicit ProcProcessInfo(std::shared_ptr<PeerRegistry> peers,
                           std::string procDirectory = "/proc",
                           std::function<void()> farewell = nullptr);

  ProcessID processIdentifier() const override;
  std::string processName() const override;

  /// For a client, to be asked once for each of its connections. None for an id
  /// of 0 or below, for a name that is not UTF-8, once the client is gone, and where
  /// there is no descriptor of its process.
  std::optional<std::string> commandName(ProcessID pid) const override;

  /// Never returns.
  void endProcess(int status) override;

 private:
  std::optional<std::string> readCommandName(ProcessID pid) const;

  const std::shared_ptr<PeerRegistry> peers_;
  const std::string procDirectory_;
  const std::function<void()> farewell_;
};

/// Opens a descriptor of a running process; none when there is none.
FileDescriptor openProcess(ProcessID pid);

}  // namespace ostrel
