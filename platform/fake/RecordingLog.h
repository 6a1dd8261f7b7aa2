#pragma once

#include <cstddef>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "platform/ScopedLog.h"
#include "platform/fake/EventLog.h"

namespace ostrel {

/// The system log of a test. Keeps every line that is written.
class RecordingLog final : public ScopedLog,
                           public std::enable_shared_from_this<RecordingLog> {
 public:
  struct Line {
    LogLevel level;
    std::string scopeCode;
    std::string text;  // Without the "file:line:function: " prefix.

    friend bool operator==(const Line&, const Line&) = default;
  };

  /// As the process's log until `uninstall`, with all lines on but debug lines.
  /// Only one at a time.
  static std::shared_ptr<RecordingLog> install();
  /// Back to lines on standard error.
  void uninstall();

  int verbosity(std::string_view verbosityKey) const override;
  LogLevel lowestLevel() const override;
  void write(const LogLine& line) override;

  /// Both take effect at once for every scope registered.
  void setVerbosity(std::string_view verbosityKey, int verbosity);
  void setLowestLevel(LogLevel level);

  /// Adds "log LEVEL SCOPE TEXT" to `events` for each line from now on, LEVEL
  /// being "error", "default", "info" or "debug".
  void recordInto(SharedEventLog events);

  std::vector<Line> lines() const;
  /// The lines as they were written, prefix included.
  std::vector<std::string> fullTexts() const;
  /// The texts without prefix: all of them, or those of one level.
  std::vector<std::string> texts() const;
  std::vector<std::string> texts(LogLevel level) const;
  bool contains(LogLevel level, std::string_view scopeCode, std::string_view text) const;
  std::size_t count(std::string_view text) const;
  void clear();

  /// What follows the "file:line:function: " prefix of a line.
  static std::string withoutPrefix(std::string_view fullText);

 private:
  RecordingLog() = default;
  void refreshScopes();

  mutable std::mutex mutex_;
  bool isInstalled_ = false;
  LogLevel lowestLevel_ = LogLevel::kInfo;
  std::map<std::string, int, std::less<>> verbosities_;
  std::vector<Line> lines_;
  std::vector<std::string> fullTexts_;
  SharedEventLog events_;
};

}  // namespace ostrel
