#pragma once

#include <optional>
#include <string>

#include "platform/IPCListener.h"

namespace ostrel {

class ProcessInfo {
 public:
  virtual ~ProcessInfo() = default;

  virtual ProcessID processIdentifier() const = 0;
  virtual std::string processName() const = 0;

  /// The short command name (16 bytes at most, UTF-8) of a running process. None
  /// when there is no such process, its record cannot be read whole, or the id
  /// may have been given to another process since the client connected.
  virtual std::optional<std::string> commandName(ProcessID pid) const = 0;

  /// Ends the process at once with `status`: nothing is unwound or flushed.
  /// Returns only in tests.
  virtual void endProcess(int status) = 0;
};

}  // namespace ostrel
