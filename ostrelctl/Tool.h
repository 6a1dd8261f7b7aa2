#pragma once

#include <istream>
#include <ostream>
#include <string>
#include <string_view>

#include "ostrelctl/ScriptPlayer.h"
#include "ostrelctl/ToolClock.h"

namespace ostrel {

/// What the tool works with: where it reads and writes, and the service's places.
struct Tool {
  std::istream& in;
  std::ostream& out;
  std::ostream& err;
  ToolClock& clock;
  ServiceConnector connect;
  std::string socketPath;
  std::string storePath;
  std::string defaultsPath;      // Of the defaults suite.
  std::string notificationPath;  // Of the change notification.
  std::string channelsDirectory;
  bool colours = false;

  // Exit statuses.
  static constexpr int kDone = 0;
  static constexpr int kFailed = 1;
  static constexpr int kWrongUsage = 2;

  /// Writes "ostrelctl: SENTENCE" to `err`. Returns `kFailed`.
  int fail(std::string_view sentence) const;
};

/// Runs the tool as `argv` says, the program's name first. Returns the exit
/// status.
int runTool(const Tool& tool, int argc, const char* const* argv);

}  // namespace ostrel
