#include "platform/Logging.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <mutex>
#include <vector>

namespace ostrel {
namespace {

constexpr std::size_t kMostArgumentBytes = LogArgument::kMostBytes;

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

// Whether the well-formed sequence at the start of `text` may end a line or
// command a terminal: a control character, or a line separator.
bool isControl(std::string_view text) {
  const auto first = static_cast<unsigned char>(text.front());
  if (first < 0x20 || first == 0x7F) return true;
  if (first == 0xC2) return static_cast<unsigned char>(text[1]) < 0xA0;
  return text.starts_with("\xE2\x80\xA8") || text.starts_with("\xE2\x80\xA9");
}

void appendEscape(std::string& out, char byte) {
  if (byte == '\n') {
    out += "\\n";
    return;
  }
  constexpr std::string_view kDigits = "0123456789abcdef";
  const auto code = static_cast<unsigned char>(byte);
  out += {'\\', 'x', kDigits[code >> 4], kDigits[code & 0xF]};
}

void appendEscaped(std::string& out, std::string_view text) {
  constexpr std::string_view kCut = "...";
  const std::size_t limit = out.size() + kMostArgumentBytes;
  std::size_t cut = out.size();  // As far as the text goes when it is cut.
  while (!text.empty()) {
    std::size_t length = sequenceLength(text);
    if (length == 0) {
      length = 1;
      appendEscape(out, text.front());
    } else if (isControl(text)) {
      for (const char byte : text.substr(0, length)) appendEscape(out, byte);
    } else {
      out += text.substr(0, length);
    }
    text.remove_prefix(length);
    if (out.size() > limit) {
      out.resize(cut);
      out += kCut;
      return;
    }
    if (out.size() + kCut.size() <= limit) cut = out.size();
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
