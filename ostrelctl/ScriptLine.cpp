#include "ostrelctl/ScriptLine.h"

#include <algorithm>
#include <charconv>
#include <limits>
#include <utility>

#include "ostrelctl/JSONNode.h"
#include "platform/ValueJSON.h"

namespace ostrel {
namespace {

/// Reads the members of a line and remembers the first that is missing or wrong.
class Arguments {
 public:
  explicit Arguments(const JSONObject& members) : members_(members) {}

  const std::string& error() const { return error_; }

  ReporterID reporterID() {
    const JSONNode* node = need("reporterID");
    const auto integer = node != nullptr ? node->signedInteger() : std::nullopt;
    if (!integer) fail("reporterID", "must be an integer of 64 bits with a sign");
    return ReporterID{integer.value_or(0)};
  }

  template <typename Code>
  Code code(std::string_view name) {
    using Number = std::underlying_type_t<Code>;
    constexpr std::uint64_t kHighest = std::numeric_limits<Number>::max();
    const JSONNode* node = need(name);
    std::optional<std::uint64_t> number;
    if (node != nullptr && node->string() != nullptr) {
      number = codeFrom(*node->string(), kHighest);
    } else if (node != nullptr) {
      number = node->unsignedInteger();
    }
    if (!number || *number > kHighest) {
      fail(name, "must be a code from 0 to " + std::to_string(kHighest));
    }
    return Code{static_cast<Number>(number.value_or(0))};
  }

  Dictionary dictionary(std::string_view name) {
    const JSONNode* node = need(name);
    if (node == nullptr) return {};
    auto read = dictionaryFrom(*node);
    if (!read.value) fail(name, "is no dictionary: " + read.error->description);
    return read.value.value_or(Dictionary());
  }

  std::optional<Dictionary> optionalDictionary(std::string_view name) {
    const JSONNode* node = need(name);
    if (node == nullptr || node->isNull()) return std::nullopt;
    return dictionary(name);
  }

  std::optional<ReporterIDs> reporterIDs() {
    const JSONNode* node = take("reporterIDs");
    if (node == nullptr || node->isNull()) return std::nullopt;
    ReporterIDs ids;
    if (node->array() == nullptr) {
      fail("reporterIDs", "must be an array of integers");
      return ids;
    }
    for (const JSONNode& element : *node->array()) {
      const auto id = element.signedInteger();
      if (!id) fail("reporterIDs", "must hold integers of 64 bits with a sign");
      ids.push_back(ReporterID{id.value_or(0)});
    }
    return ids;
  }

  std::chrono::nanoseconds seconds(std::string_view name) {
    // A century stands for every time that is longer.
    constexpr double kLongest = 3e9;
    const JSONNode* node = need(name);
    const auto number = node != nullptr ? node->number() : std::nullopt;
    if (!number || *number < 0) {
      fail(name, "must be a number of seconds, 0 or more");
      return {};
    }
    return std::chrono::duration_cast<std::chrono::nanoseconds>(
        std::chrono::duration<double>(std::min(*number, kLongest)));
  }

  std::string text(std::string_view name) {
    const JSONNode* node = need(name);
    if (node == nullptr) return {};
    if (node->string() == nullptr) fail(name, "must be a text");
    return node->string() != nullptr ? *node->string() : std::string();
  }

  std::string textOr(std::string_view name, std::string_view otherwise) {
    return find(members_, name) != nullptr ? text(name) : std::string(otherwise);
  }

  /// The members that nobody asked for.
  std::vector<std::string> leftOver() const {
    std::vector<std::string> names;
    for (const JSONMember& member : members_) {
      if (std::find(taken_.begin(), taken_.end(), member.key) == taken_.end()) {
        names.push_back(member.key);
      }
    }
    return names;
  }

 private:
  const JSONNode* take(std::string_view name) {
    taken_.push_back(name);
    return find(members_, name);
  }
  const JSONNode* need(std::string_view name) {
    const JSONNode* node = take(name);
    if (node == nullptr) fail(name, "is missing");
    return node;
  }
  void fail(std::string_view name, const std::string& what) {
    if (error_.empty()) error_ = std::string(name) + " " + what;
  }

  const JSONObject& members_;
  std::vector<std::string_view> taken_;
  std::string error_;
};

std::string replyMember(ValueView value) {
  std::string member = "\"reply\":";
  appendJSON(member, value, JSONLayout::kCompact, JSONStrictness::kLenient, /*indent=*/0);
  return member;
}

BoolReply boolReply(ScriptAnswer answer) {
  return [answer = std::move(answer)](bool value) { answer(replyMember(Value(value))); };
}

ServiceTypeReply serviceTypeReply(ScriptAnswer answer) {
  return [answer = std::move(answer)](ServiceType value) {
    answer(replyMember(Value(static_cast<std::uint16_t>(value))));
  };
}

DictionaryReply dictionaryReply(ScriptAnswer answer) {
  return [answer = std::move(answer)](const Dictionary& value) {
    answer(replyMember(value.value()));
  };
}

ReporterIDsReply reporterIDsReply(ScriptAnswer answer) {
  return [answer = std::move(answer)](const ReporterIDs& ids) {
    ArrayBuilder array;
    for (const ReporterID id : ids) array.append(Value(static_cast<std::int64_t>(id)));
    answer(replyMember(array.build().value()));
  };
}

ErrorReply errorReply(ScriptAnswer answer) {
  return [answer = std::move(answer)](const std::optional<ErrorObject>& error) {
    if (!error) return answer("\"reply\":null");
    std::string member = "\"error\":{\"domain\":";
    appendQuoted(member, error->domain);
    member += ",\"code\":" + std::to_string(error->code) + ",\"description\":";
    appendQuoted(member, error->description);
    answer(member + "}");
  };
}

using Service = OstrelReportingServiceProtocol;
using Send = decltype(ScriptRequest::send);

Send createReportingSession(Arguments& arguments) {
  const ReporterID id = arguments.reporterID();
  return [id](Service& service, ScriptAnswer answer) {
    service.createReportingSession(id, boolReply(std::move(answer)));
  };
}

Send setServiceType(Arguments& arguments) {
  const auto type = arguments.code<ServiceType>("serviceType");
  const ReporterID id = arguments.reporterID();
  return [type, id](Service& service, ScriptAnswer answer) {
    service.setServiceType(type, id, boolReply(std::move(answer)));
  };
}

Send getServiceNameForReporterID(Arguments& arguments) {
  const ReporterID id = arguments.reporterID();
  return [id](Service& service, ScriptAnswer answer) {
    service.getServiceNameForReporterID(id, serviceTypeReply(std::move(answer)));
  };
}

Send setConfiguration(Arguments& arguments) {
  const auto configuration = arguments.optionalDictionary("configuration");
  const ReporterID id = arguments.reporterID();
  return [configuration, id](Service& service, ScriptAnswer answer) {
    service.setConfiguration(configuration, id, boolReply(std::move(answer)));
  };
}

Send startReportingSessionForID(Arguments& arguments) {
  const ReporterID id = arguments.reporterID();
  return [id](Service& service, ScriptAnswer answer) {
    service.startReportingSessionForID(id, boolReply(std::move(answer)));
  };
}

Send sendMessage(Arguments& arguments) {
  const Dictionary message = arguments.dictionary("message");
  const auto category = arguments.code<MessageCategory>("category");
  const auto type = arguments.code<MessageType>("type");
  const auto ids = arguments.reporterIDs();
  return [message, category, type, ids](Service& service, ScriptAnswer answer) {
    service.sendMessage(message, category, type, ids, errorReply(std::move(answer)));
  };
}

Send stopReportingSessionForID(Arguments& arguments) {
  const ReporterID id = arguments.reporterID();
  return [id](Service& service, ScriptAnswer answer) {
    service.stopReportingSessionForID(id, boolReply(std::move(answer)));
  };
}

Send destroyReportingSession(Arguments& arguments) {
  const ReporterID id = arguments.reporterID();
  return [id](Service& service, ScriptAnswer answer) {
    service.destroyReportingSession(id, boolReply(std::move(answer)));
  };
}

Send reporterIDValid(Arguments& arguments) {
  const ReporterID id = arguments.reporterID();
  return [id](Service& service, ScriptAnswer answer) {
    service.reporterIDValid(id, dictionaryReply(std::move(answer)));
  };
}

Send getAllReporters(Arguments&) {
  return [](Service& service, ScriptAnswer answer) {
    service.getAllReporters(reporterIDsReply(std::move(answer)));
  };
}

Send killService(Arguments&) {
  return [](Service& service, ScriptAnswer answer) {
    service.killService(boolReply(std::move(answer)));
  };
}

struct Operation {
  std::string_view name;
  Send (*read)(Arguments& arguments);
};

constexpr Operation kOperations[] = {
    {"createReportingSession", createReportingSession},
    {"setServiceType", setServiceType},
    {"getServiceNameForReporterID", getServiceNameForReporterID},
    {"setConfiguration", setConfiguration},
    {"startReportingSessionForID", startReportingSessionForID},
    {"sendMessage", sendMessage},
    {"stopReportingSessionForID", stopReportingSessionForID},
    {"destroyReportingSession", destroyReportingSession},
    {"reporterIDValid", reporterIDValid},
    {"getAllReporters", getAllReporters},
    {"killService", killService},
};

ScriptLine failed(std::string phrase) { return {std::nullopt, std::move(phrase), {}}; }

ScriptLine finished(const Arguments& arguments, ScriptCommand command) {
  if (!arguments.error().empty()) return failed(arguments.error());
  return {std::move(command), {}, arguments.leftOver()};
}

ScriptLine parseRequest(Arguments& arguments) {
  const std::string name = arguments.text("op");
  if (!arguments.error().empty()) return failed(arguments.error());
  const auto* operation =
      std::find_if(std::begin(kOperations), std::end(kOperations),
                   [&name](const Operation& each) { return each.name == name; });
  if (operation == std::end(kOperations)) {
    return failed("there is no operation " + inQuotes(name));
  }
  std::string client = arguments.textOr("client", "default");
  Send send = operation->read(arguments);
  ScriptLine line =
      finished(arguments, ScriptRequest{std::move(client), name, std::move(send)});
  if (!line.command) line.error = name + ": " + line.error;
  return line;
}

}  // namespace

std::optional<std::uint64_t> codeFrom(std::string_view text, std::uint64_t highest) {
  int base = 10;
  if (text.starts_with("0x") || text.starts_with("0X")) {
    base = 16;
    text.remove_prefix(2);
  }
  std::uint64_t number = 0;
  const char* end = text.data() + text.size();
  const auto [stop, error] = std::from_chars(text.data(), end, number, base);
  if (text.empty() || error != std::errc() || stop != end || number > highest) {
    return std::nullopt;
  }
  return number;
}

bool isBlankLine(std::string_view text) {
  return text.find_first_not_of(" \t\r") == std::string_view::npos;
}

ScriptLine parseScriptLine(std::string_view text) {
  const auto parsed = parseJSON(text);
  if (!parsed.value) return failed("not a JSON object: " + parsed.error->description);
  const JSONObject* members = parsed.value->object();
  if (members == nullptr) return failed("not a JSON object");

  std::vector<std::string_view> commands;
  for (const std::string_view name : {"op", "wait", "sleep", "close", "abort"}) {
    if (find(*members, name) != nullptr) commands.push_back(name);
  }
  if (commands.empty()) {
    return failed(
        "the object has none of \"op\", \"wait\", \"sleep\", \"close\", \"abort\"");
  }
  if (commands.size() > 1) {
    return failed(inQuotes(commands[0]) + " and " + inQuotes(commands[1]) +
                  " stand in one object");
  }

  Arguments arguments(*members);
  if (commands[0] == "op") return parseRequest(arguments);
  if (commands[0] == "wait") {
    return finished(arguments, ScriptWait{arguments.seconds("wait")});
  }
  if (commands[0] == "sleep") {
    return finished(arguments, ScriptSleep{arguments.seconds("sleep")});
  }
  if (commands[0] == "close") {
    return finished(arguments, ScriptClose{arguments.text("close")});
  }
  return finished(arguments, ScriptAbort{arguments.text("abort")});
}

}  // namespace ostrel
