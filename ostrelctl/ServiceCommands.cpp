#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <fstream>
#include <limits>
#include <mutex>
#include <utility>

#include "Statistics/OstrelReportingUtility.h"
#include "ostrelctl/Commands.h"
#include "ostrelctl/JSONNode.h"
#include "ostrelctl/Page.h"
#include "ostrelctl/StoreReader.h"

namespace ostrel {
namespace {

constexpr std::chrono::seconds kStatusTimeout{5};

/// A connection whose replies are waited for, with an end when the service goes.
class Conversation {
 public:
  enum class Ending { kAnswered, kClosed, kTimeout };

  Conversation(std::shared_ptr<ServiceConnection> service, ToolClock& clock)
      : service_(std::move(service)), clock_(clock) {
    service_->setClosedHandler([state = state_](const std::string& reason) {
      const std::lock_guard lock(state->mutex);
      state->closedReason = reason;
      state->changed.notify_all();
    });
  }
  ~Conversation() { service_->close(); }

  ServiceConnection& service() { return *service_; }

  /// A callback that `waitForAll` waits for; it keeps its first argument in
  /// `*place`. The type of ID 0 is replied twice.
  template <typename T>
  auto expect(std::shared_ptr<T> place) {
    {
      const std::lock_guard lock(state_->mutex);
      ++state_->outstanding;
    }
    return [state = state_, place, isFirst = true](const T& value) mutable {
      const std::lock_guard lock(state->mutex);
      if (!std::exchange(isFirst, /*new_value=*/false)) return;
      *place = value;
      --state->outstanding;
      state->changed.notify_all();
    };
  }

  Ending waitForAll(std::chrono::nanoseconds longest) {
    std::unique_lock lock(state_->mutex);
    clock_.wait(lock, state_->changed, longest, [this] {
      return state_->outstanding == 0 || state_->closedReason.has_value();
    });
    if (state_->outstanding == 0) return Ending::kAnswered;
    return state_->closedReason ? Ending::kClosed : Ending::kTimeout;
  }

  /// A sentence for an ending that is no answer.
  std::string sentence(Ending ending) const {
    const std::lock_guard lock(state_->mutex);
    return ending == Ending::kTimeout ? "the service does not answer"
                                      : "the service closed the connection: " +
                                            state_->closedReason.value_or("");
  }

 private:
  struct State {
    std::mutex mutex;  // Protects all that follows.
    std::condition_variable changed;
    int outstanding = 0;
    std::optional<std::string> closedReason;
  };

  const std::shared_ptr<ServiceConnection> service_;
  ToolClock& clock_;
  const std::shared_ptr<State> state_ = std::make_shared<State>();
};

struct LiveSession {
  ReporterID reporterID;
  std::shared_ptr<ServiceType> serviceType;
};

/// The sessions, or the ending that is no answer.
Conversation::Ending askForSessions(Conversation& conversation,
                                    std::vector<LiveSession>& sessions) {
  const auto ids = std::make_shared<ReporterIDs>();
  conversation.service().getAllReporters(conversation.expect(ids));
  const auto ending = conversation.waitForAll(kStatusTimeout);
  if (ending != Conversation::Ending::kAnswered) return ending;
  for (const ReporterID id : *ids) {
    sessions.push_back({id, std::make_shared<ServiceType>(kServiceTypeUnknown)});
    conversation.service().getServiceNameForReporterID(
        id, conversation.expect(sessions.back().serviceType));
  }
  return conversation.waitForAll(kStatusTimeout);
}

/// What the service counts about itself, by name; empty when it says nothing.
JSONObject counters(const Tool& tool) {
  JSONObject counts;
  auto store = StoreReader::open(tool.storePath);
  if (!store.value) return counts;
  const auto rows = (*store.value)->rowsOfTable("service_status");
  if (!rows.value) return counts;
  for (const JSONObject& row : *rows.value) {
    const JSONNode* key = find(row, "key");
    const JSONNode* value = find(row, "value");
    if (key != nullptr && key->string() != nullptr && value != nullptr &&
        value->number()) {
      counts.push_back({*key->string(), *value});
    }
  }
  return counts;
}

std::string compactText(const JSONNode& node) {
  std::string text;
  appendJSON(text, node, JSONSpacing::kCompact);
  return text;
}

void writeStatusJSON(const Tool& tool, const std::vector<LiveSession>& sessions,
                     const JSONObject& counts) {
  JSONArray sessionNodes;
  for (const LiveSession& session : sessions) {
    sessionNodes.push_back({JSONObject{
        {"reporterID", {static_cast<std::int64_t>(session.reporterID)}},
        {"serviceType", {static_cast<std::int64_t>(*session.serviceType)}},
        {"serviceName", {std::string(ServiceTypeName(*session.serviceType))}}}});
  }
  tool.out << compactText({JSONObject{{"running", {true}},
                                      {"socket", {tool.socketPath}},
                                      {"sessions", {std::move(sessionNodes)}},
                                      {"counters", {counts}}}})
           << '\n';
}

void writeStatusPage(const Tool& tool, const std::vector<LiveSession>& sessions,
                     const JSONObject& counts) {
  Page page(tool.out, tool.colours);
  page.line("The service is running at " + tool.socketPath, 0);
  page.heading("Sessions (" + std::to_string(sessions.size()) + ")");
  std::vector<Page::Cells> rows;
  for (const LiveSession& session : sessions) {
    rows.push_back({std::to_string(static_cast<std::int64_t>(session.reporterID)),
                    std::string(ServiceTypeName(*session.serviceType)) + " (" +
                        std::to_string(static_cast<unsigned>(*session.serviceType)) +
                        ")"});
  }
  if (!rows.empty()) page.table({"REPORTER", "SERVICE"}, rows, 2);
  if (counts.empty()) return;
  page.heading("Counters");
  rows.clear();
  for (const JSONMember& count : counts) {
    rows.push_back({count.key, count.node.string() != nullptr ? *count.node.string()
                                                              : compactText(count.node)});
  }
  page.table({}, rows, 2);
}

/// The payload of a message from the command line, or none with a sentence.
std::optional<Dictionary> payloadOf(const SendOptions& options, std::string& error) {
  JSONNode node{JSONObject{}};
  if (options.payload) {
    auto parsed = parseJSON(*options.payload);
    if (!parsed.value) {
      error = "the payload is not a JSON object: " + parsed.error->description;
      return std::nullopt;
    }
    node = std::move(*parsed.value);
  }
  auto* object = std::get_if<JSONObject>(&node.value);
  if (object == nullptr) {
    error = "the payload is not a JSON object";
    return std::nullopt;
  }
  for (const std::string& entry : options.entries) {
    const auto equals = entry.find('=');
    if (equals == std::string::npos) {
      error = inQuotes(entry) + " is not KEY=VALUE";
      return std::nullopt;
    }
    const std::string key = entry.substr(0, equals);
    const std::string text = entry.substr(equals + 1);
    if (find(*object, key) != nullptr) {
      error = "the key " + inQuotes(key) + " stands twice";
      return std::nullopt;
    }
    auto value = parseJSON(text);
    object->push_back({key, value.value ? std::move(*value.value) : JSONNode{text}});
  }
  auto dictionary = dictionaryFrom(node);
  if (!dictionary.value) error = "the payload: " + dictionary.error->description;
  return std::move(dictionary.value);
}

}  // namespace

int Tool::fail(std::string_view sentence) const {
  err << "ostrelctl: " << sentence << std::endl;
  return kFailed;
}

int runScript(const Tool& tool, const std::string& file) {
  ScriptPlayer player(tool.connect, tool.clock, tool.out, tool.err);
  if (file == "-") return player.play(tool.in);
  std::ifstream in(file);
  if (!in) return tool.fail("the script " + file + " cannot be read");
  return player.play(in);
}

int runStatus(const Tool& tool, bool json) {
  auto connected = tool.connect();
  if (!connected.value) return tool.fail(connected.error->description);
  Conversation conversation(*connected.value, tool.clock);
  std::vector<LiveSession> sessions;
  const auto ending = askForSessions(conversation, sessions);
  if (ending != Conversation::Ending::kAnswered) {
    return tool.fail(conversation.sentence(ending));
  }
  if (json) {
    writeStatusJSON(tool, sessions, counters(tool));
  } else {
    writeStatusPage(tool, sessions, counters(tool));
  }
  tool.out << std::flush;
  return tool.out ? Tool::kDone : tool.fail("the output could not be written");
}

int runSend(const Tool& tool, const SendOptions& options) {
  constexpr std::uint64_t kHighestCategory = std::numeric_limits<std::uint32_t>::max();
  constexpr std::uint64_t kHighestType = std::numeric_limits<std::uint16_t>::max();
  const auto category = codeFrom(options.category, kHighestCategory);
  const auto type = codeFrom(options.type, kHighestType);
  std::string error;
  if (!category) error = "the category must be a code from 0 to 4294967295";
  if (category && !type) error = "the type must be a code from 0 to 65535";
  std::optional<Dictionary> payload;
  if (error.empty()) payload = payloadOf(options, error);
  if (!payload) {
    tool.fail(error);
    return Tool::kWrongUsage;
  }
  std::optional<ReporterIDs> ids;
  for (const std::int64_t id : options.reporterIDs) {
    if (!ids) ids.emplace();
    ids->push_back(ReporterID{id});
  }

  auto connected = tool.connect();
  if (!connected.value) return tool.fail(connected.error->description);
  Conversation conversation(*connected.value, tool.clock);
  const auto reply = std::make_shared<std::optional<ErrorObject>>();
  conversation.service().sendMessage(
      *payload, MessageCategory{static_cast<std::uint32_t>(*category)},
      MessageType{static_cast<std::uint16_t>(*type)}, ids, conversation.expect(reply));
  const auto ending =
      conversation.waitForAll(std::chrono::duration_cast<std::chrono::nanoseconds>(
          std::chrono::duration<double>(options.timeoutSeconds)));
  if (ending != Conversation::Ending::kAnswered) {
    return tool.fail(conversation.sentence(ending));
  }
  if (*reply) {
    return tool.fail("the service refused the message: " + (*reply)->description + " (" +
                     (*reply)->domain + " " + std::to_string((*reply)->code) + ")");
  }
  tool.out << (options.json ? "{\"accepted\":true}\n"
                            : "The service accepted the message.\n")
           << std::flush;
  return Tool::kDone;
}

}  // namespace ostrel
