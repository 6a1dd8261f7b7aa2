#include "platform/Logging.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <mutex>
#include <vector>

namespace ostrel {
namespace {

constexpr std::size_t kMostArgumentBytes = 2048;

class StandardErrorLog final : public ScopedLog {
 public:
  int verbosity(std::string_view) const override { return 0; }
  LogLevel lowestLevel() const override { return LogLevel::kDefault; }
  void write(const LogLine& line) override {
    std::fprintf(stderr, "<%d>%.*s\n", static_cast<int>(line.level),
                 static_cast<int>(line.text.size()), line.text.data());
  }
};

struct SystemLog {
  std::mutex mutex;
  std::shared_ptr<ScopedLog> log = std::make_shared<StandardErrorLog>();
  std::vector<LogScope*> scopes;
};

// Never destroyed: lines are written until the last thread ends.
SystemLog& systemLog() {
  static SystemLog& instance = *new SystemLog;
  return instance;
}

void setLevels(LogScope& scope, const ScopedLog& log) {
  scope.setLevels(log.lowestLevel(), log.verbosity(scope.verbosityKey()));
}

// The length of the well-formed UTF-8 sequence at the start of `text`, or 0.
std::size_t sequenceLength(std::string_view text) {
  const auto byte = [&](std::size_t i) { return static_cast<unsigned char>(text[i]); };
  const auto continues = [&](std::size_t i, unsigned low, unsigned high) {
    return i < text.size() && byte(i) >= low && byte(i) <= high;
  };
  const unsigned lead = byte(0);
  if (lead < 0x80) return 1;
  if (lead >= 0xC2 && lead <= 0xDF) return continues(1, 0x80, 0xBF) ? 2 : 0;
  if (lead >= 0xE0 && lead <= 0xEF) {
    const unsigned low = lead == 0xE0 ? 0xA0 : 0x80;
    const unsigned high = lead == 0xED ? 0x9F : 0xBF;
    return continues(1, low, high) && continues(2, 0x80, 0xBF) ? 3 : 0;
  }
  if (lead >= 0xF0 && lead <= 0xF4) {
    const unsigned low = lead == 0xF0 ? 0x90 : 0x80;
    const unsigned high = lead == 0xF4 ? 0x8F : 0xBF;
    return continues(1, low, high) && continues(2, 0x80, 0xBF) && continues(3, 0x80, 0xBF)
               ? 4
               : 0;
  }
  return 0;
}

void appendEscaped(std::string& out, std::string_view text) {
  const std::size_t limit = out.size() + kMostArgumentBytes;
  while (!text.empty()) {
    if (out.size() + 4 > limit) {
      out += "...";
      return;
    }
    const auto byte = static_cast<unsigned char>(text.front());
    std::size_t length = sequenceLength(text);
    if (byte == '\n') {
      out += "\\n";
    } else if (length == 0 || byte < 0x20 || byte == 0x7F) {
      std::array<char, 5> escape{};
      std::snprintf(escape.data(), escape.size(), "\\x%02x", byte);
      out += escape.data();
      length = 1;
    } else {
      out += text.substr(0, length);
    }
    text.remove_prefix(length);
  }
}

}  // namespace

LogScope processLogScope("osrp", "reporting_process_verbose");

void LogScope::setLevels(LogLevel lowest, int verbosity) {
  std::uint32_t levels = 0;
  for (const LogLevel level : {LogLevel::kError, LogLevel::kDefault, LogLevel::kInfo}) {
    if (level <= lowest) levels |= 1u << static_cast<unsigned>(level);
  }
  if (verbosity >= kDebugVerbosity) {
    levels |= 1u << static_cast<unsigned>(LogLevel::kDebug);
  }
  levels_.store(levels, std::memory_order_relaxed);
}

void registerLogScope(LogScope& scope) {
  SystemLog& system = systemLog();
  const std::lock_guard lock(system.mutex);
  if (std::find(system.scopes.begin(), system.scopes.end(), &scope) ==
      system.scopes.end()) {
    system.scopes.push_back(&scope);
  }
  setLevels(scope, *system.log);
}

void setSystemLog(std::shared_ptr<ScopedLog> log) {
  SystemLog& system = systemLog();
  const std::lock_guard lock(system.mutex);
  system.log = log ? std::move(log) : std::make_shared<StandardErrorLog>();
  for (LogScope* scope : system.scopes) setLevels(*scope, *system.log);
}

void LogArgument::appendFloatingPoint(std::string& out, double value) {
  std::array<char, 352> text{};  // Longest: -DBL_MAX with six decimals.
  std::snprintf(text.data(), text.size(), "%f", value);
  out += text.data();
}

std::string formatText(std::string_view format, std::span<const LogArgument> arguments) {
  std::string out;
  std::string text;
  std::size_t next = 0;
  for (std::size_t i = 0; i < format.size(); ++i) {
    if (format[i] != '%') {
      out += format[i];
      continue;
    }
    ++i;
    if (i < format.size() && format[i] == '%') {
      out += '%';
      continue;
    }
    while (i < format.size() && (format[i] == 'l' || format[i] == 'h')) ++i;
    if (next >= arguments.size()) continue;
    text.clear();
    arguments[next++].appendTo(text);
    appendEscaped(out, text);
  }
  return out;
}

void writeLogLine(const LogScope& scope, LogLevel level, const LogPlace& place,
                  const std::string& message) {
  std::string text = place.file;
  text += ':';
  text += std::to_string(place.line);
  text += ':';
  text += place.function;
  text += ": ";
  text += message;
  SystemLog& system = systemLog();
  std::shared_ptr<ScopedLog> log;
  {
    const std::lock_guard lock(system.mutex);
    log = system.log;
  }
  log->write({level, scope.code(), text});
}

}  // namespace ostrel
