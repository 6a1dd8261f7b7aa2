// The language of `ostrelctl script`: one JSON object a line.
#pragma once

#include <chrono>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "Statistics/Service/OstrelReportingServiceProtocol.h"

namespace ostrel {

/// Receives one reply to a request as the last member of its output line:
/// `"reply":true` or `"error":{...}`.
using ScriptAnswer = std::function<void(std::string member)>;

/// One request, on the connection of the name `client`.
struct ScriptRequest {
  std::string client;
  std::string operation;
  std::function<void(OstrelReportingServiceProtocol& service, ScriptAnswer answer)> send;
};

/// Until every request is answered, at most so long.
struct ScriptWait {
  std::chrono::nanoseconds longest;
};
struct ScriptSleep {
  std::chrono::nanoseconds duration;
};
/// Ends the connection of the name well.
struct ScriptClose {
  std::string client;
};
/// Drops the connection of the name.
struct ScriptAbort {
  std::string client;
};

using ScriptCommand =
    std::variant<ScriptRequest, ScriptWait, ScriptSleep, ScriptClose, ScriptAbort>;

/// What a line says: a command, or why it says none, as a phrase for people.
struct ScriptLine {
  std::optional<ScriptCommand> command;
  std::string error;
  /// Members that the command has no use for.
  std::vector<std::string> ignoredMembers;
};

/// `text` is one line that is not blank.
ScriptLine parseScriptLine(std::string_view text);

/// Whether a line holds nothing but blanks.
bool isBlankLine(std::string_view text);

/// A code or an ID as people write it: decimal, or hexadecimal behind "0x". None
/// when it is neither or is above `highest`.
std::optional<std::uint64_t> codeFrom(std::string_view text, std::uint64_t highest);

}  // namespace ostrel
