#pragma once

#include <cstdint>
#include <string_view>

namespace ostrel {

/// The value is the syslog priority of the level.
enum class LogLevel : std::uint8_t {
  kError = 3,
  kDefault = 5,
  kInfo = 6,
  kDebug = 7,
};

struct LogLine {
  LogLevel level;
  std::string_view scopeCode;  // Four characters, such as "osrs".
  std::string_view text;       // One line, prefix included, UTF-8.
};

/// The system log. Any thread; `write` never blocks on a reader of the log.
class ScopedLog {
 public:
  virtual ~ScopedLog() = default;

  /// The verbosity that the user set for a key such as
  /// "reporting_server_verbose"; 0 when none is set.
  virtual int verbosity(std::string_view verbosityKey) const = 0;

  /// The lowest level that is written, debug lines apart: `kError`, `kDefault`
  /// or `kInfo`.
  virtual LogLevel lowestLevel() const = 0;

  virtual void write(const LogLine& line) = 0;
};

}  // namespace ostrel
