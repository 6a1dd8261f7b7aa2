// Log lines: `OSTREL_LOG_DEFAULT(scope, "removing %i from the list", id)`.
//
// Each source file names its scope once and registers it; a line that is off
// costs one branch and its arguments are not built. The number of arguments is
// checked against the format when the file is compiled.
#pragma once

#include <atomic>
#include <concepts>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <tuple>
#include <type_traits>

#include "platform/ErrorObject.h"
#include "platform/ScopedLog.h"
#include "platform/Value.h"

namespace ostrel {

/// Where a source file's lines belong. Lives as long as the process.
class LogScope {
 public:
  /// Until it is registered, error and default lines are on.
  constexpr LogScope(std::string_view code, std::string_view verbosityKey)
      : code_(code), verbosityKey_(verbosityKey) {}

  std::string_view code() const { return code_; }
  std::string_view verbosityKey() const { return verbosityKey_; }

  /// Debug lines need a verbosity of 5 or more.
  static constexpr int kDebugVerbosity = 5;

  bool isOn(LogLevel level) const {
    return (levels_.load(std::memory_order_relaxed) &
            1u << static_cast<unsigned>(level)) != 0;
  }

  void setLevels(LogLevel lowest, int verbosity);

 private:
  static constexpr std::uint32_t kStartLevels =
      1u << static_cast<unsigned>(LogLevel::kError) |
      1u << static_cast<unsigned>(LogLevel::kDefault);

  const std::string_view code_;
  const std::string_view verbosityKey_;
  std::atomic<std::uint32_t> levels_{kStartLevels};
};

/// All scopes belong to it.
inline constexpr std::string_view kLogSubsystem = "com.orbisk.ostrel";

/// Lines without a scope of their own: the bindings and the bridges.
extern LogScope processLogScope;

/// Sets the scope's levels by the system log, now and whenever that changes.
void registerLogScope(LogScope& scope);

/// Replaces the process's log; none goes back to lines on standard error.
/// Called before threads start, or by tests between them.
void setSystemLog(std::shared_ptr<ScopedLog> log);

/// One argument of a log line, as the formatter sees it.
class LogArgument {
 public:
  template <typename T>
  explicit LogArgument(const T& value)
      : value_(&value), append_([](std::string& out, const void* at) {
          appendText(out, *static_cast<const T*>(at));
        }) {}

  /// What of its text a line takes at most.
  static constexpr std::size_t kMostBytes = 2048;

  /// All of its text, or more of it than that.
  void appendTo(std::string& out) const { append_(out, value_); }

 private:
  template <typename T>
  static void appendText(std::string& out, const T& value) {
    if constexpr (std::is_convertible_v<const T&, std::string_view>) {
      out += std::string_view(value);
    } else if constexpr (std::is_same_v<T, bool>) {
      out += value ? "1" : "0";
    } else if constexpr (std::is_enum_v<T>) {
      appendText(out, static_cast<std::underlying_type_t<T>>(value));
    } else if constexpr (std::is_integral_v<T>) {
      out += std::to_string(value);
    } else if constexpr (std::is_floating_point_v<T>) {
      appendFloatingPoint(out, value);
    } else if constexpr (std::is_same_v<T, ValueView> || std::is_same_v<T, Value>) {
      appendDescription(out, value);
    } else if constexpr (std::is_same_v<T, Dictionary> || std::is_same_v<T, Array>) {
      appendDescription(out, value.value());
    } else if constexpr (std::is_same_v<T, ErrorObject>) {
      out += value.description;
    } else if constexpr (requires { value.description(); }) {
      out += value.description();
    } else if constexpr (
        requires {
          value.has_value();
          *value;
        } ||
        requires {
          value.get();
          *value;
        }) {
      if (value) {
        appendText(out, *value);
      } else {
        out += kNullText;
      }
    } else {
      out += '(';
      bool isFirst = true;
      for (const auto& element : value) {
        if (out.size() > kMostBytes) return;  // The rest would be cut off.
        if (!isFirst) out += ", ";
        isFirst = false;
        appendText(out, element);
      }
      out += ')';
    }
  }
  static void appendFloatingPoint(std::string& out, double value);

  static constexpr std::string_view kNullText = "(null)";

  const void* value_;
  void (*append_)(std::string&, const void*);
};

/// Fills `format` ("%@", "%i", "%lli", "%lu", "%f", ...): each conversion takes
/// the next argument in its own text, whatever its letter. An argument takes
/// 2 KiB at most; its control characters and invalid UTF-8 are escaped, so that
/// it can neither end the line nor forge one.
std::string formatText(std::string_view format, std::span<const LogArgument> arguments);

template <typename... Arguments>
std::string format(std::string_view format, const Arguments&... arguments) {
  if constexpr (sizeof...(Arguments) == 0) {
    return formatText(format, {});
  } else {
    const LogArgument list[] = {LogArgument(arguments)...};
    return formatText(format, list);
  }
}

/// Where a line was written: file name without directories, line, function.
struct LogPlace {
  const char* file;
  int line;
  std::string_view function;
};

void writeLogLine(const LogScope& scope, LogLevel level, const LogPlace& place,
                  const std::string& message);

constexpr int countConversions(std::string_view format) {
  int count = 0;
  for (std::size_t i = 0; i < format.size(); ++i) {
    if (format[i] != '%') continue;
    if (i + 1 < format.size() && format[i + 1] == '%') {
      ++i;
    } else {
      ++count;
    }
  }
  return count;
}

/// "ostrel::Class::operation" out of the compiler's full signature.
constexpr std::string_view qualifiedName(std::string_view signature) {
  constexpr std::string_view kAnonymous = "(anonymous namespace)";
  int angles = 0;
  std::size_t begin = 0;
  for (std::size_t i = 0; i < signature.size(); ++i) {
    const char c = signature[i];
    if (signature.substr(i, kAnonymous.size()) == kAnonymous) {
      i += kAnonymous.size() - 1;
    } else if (c == '<') {
      ++angles;
    } else if (c == '>') {
      --angles;
    } else if (c == ' ' && angles == 0) {
      begin = i + 1;
    } else if (c == '(' && angles == 0) {
      while (begin < i && (signature[begin] == '*' || signature[begin] == '&')) {
        ++begin;
      }
      return signature.substr(begin, i - begin);
    }
  }
  return signature;
}

}  // namespace ostrel

#define OSTREL_LOG(scope, level, format_, ...)                                         \
  do {                                                                                 \
    static_assert(::ostrel::countConversions(format_) ==                               \
                      std::tuple_size_v<decltype(std::forward_as_tuple(__VA_ARGS__))>, \
                  "one argument for each conversion of the format");                   \
    if ((scope).isOn(level)) {                                                         \
      ::ostrel::writeLogLine(                                                          \
          scope, level,                                                                \
          {__FILE_NAME__, __LINE__,                                                    \
           ::ostrel::qualifiedName(static_cast<const char*>(__PRETTY_FUNCTION__))},    \
          ::ostrel::format(format_ __VA_OPT__(, ) __VA_ARGS__));                       \
    }                                                                                  \
  } while (false)

#define OSTREL_LOG_ERROR(scope, ...) \
  OSTREL_LOG(scope, ::ostrel::LogLevel::kError, __VA_ARGS__)
#define OSTREL_LOG_DEFAULT(scope, ...) \
  OSTREL_LOG(scope, ::ostrel::LogLevel::kDefault, __VA_ARGS__)
#define OSTREL_LOG_INFO(scope, ...) \
  OSTREL_LOG(scope, ::ostrel::LogLevel::kInfo, __VA_ARGS__)
#define OSTREL_LOG_DEBUG(scope, ...) \
  OSTREL_LOG(scope, ::ostrel::LogLevel::kDebug, __VA_ARGS__)
