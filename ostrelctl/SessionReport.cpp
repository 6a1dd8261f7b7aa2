#include "ostrelctl/SessionReport.h"

#include <array>
#include <cctype>
#include <cstdio>
#include <string_view>

#include "Statistics/OstrelReportingUtility.h"

namespace ostrel {
namespace {

// The codes of the summary and of the driver statistics as they are stored.
constexpr std::int64_t kSummaryCategory = 0xFFFF;
constexpr std::int64_t kSummaryType = 0xFFFF;
constexpr std::int64_t kDriverCategory = 9;
constexpr std::int64_t kDriverType = 0;

bool isSummary(const RecordedMessage& message) {
  return message.category == kSummaryCategory && message.type == kSummaryType &&
         message.payload.object() != nullptr &&
         find(*message.payload.object(), "Ostrel_Session_Summary_Event") != nullptr;
}

bool isDriverStatistics(const RecordedMessage& message) {
  return message.category == kDriverCategory && message.type == kDriverType &&
         message.payload.object() != nullptr;
}

std::string compactText(const JSONNode& node) {
  std::string text;
  appendJSON(text, node, JSONSpacing::kCompact);
  return text;
}

/// A text as it is, anything else as JSON.
std::string plainText(const JSONNode& node) {
  return node.string() != nullptr ? *node.string() : compactText(node);
}

/// `name` without "_" and the number at its end; empty when it has none.
std::string withoutNumber(const std::string& name) {
  std::size_t end = name.size();
  while (end > 0 && std::isdigit(static_cast<unsigned char>(name[end - 1])) != 0) --end;
  if (end == name.size() || end < 2 || name[end - 1] != '_') return {};
  return name.substr(0, end - 1);
}

std::vector<std::string> split(const std::string& text) {
  std::vector<std::string> parts(1);
  for (const char character : text) {
    if (character == ',') {
      parts.emplace_back();
    } else {
      parts.back() += character;
    }
  }
  return parts;
}

void addOrientations(const JSONObject& summary, const std::string& mode,
                     std::vector<SessionReport::Orientation>& orientations) {
  const JSONNode* names = find(summary, mode + "_orientation");
  const JSONNode* times = find(summary, mode + "_orientation_time");
  if (names == nullptr || names->string() == nullptr) return;
  const auto allNames = split(*names->string());
  const auto allTimes = split(times != nullptr ? plainText(*times) : std::string());
  for (std::size_t i = 0; i < allNames.size(); ++i) {
    orientations.push_back({mode, allNames[i], i < allTimes.size() ? allTimes[i] : ""});
  }
}

JSONNode timeNode(std::optional<StoreTime> time) {
  return time ? JSONNode{*time} : JSONNode{};
}

std::vector<Page::Cells> cellsOf(const JSONObject& object) {
  std::vector<Page::Cells> rows;
  for (const JSONMember& member : object) {
    rows.push_back({member.key, plainText(member.node)});
  }
  return rows;
}

}  // namespace

std::string storedName(std::int64_t category, std::int64_t type) {
  return CategoryName(MessageCategory{static_cast<std::uint32_t>(category)}) + "_" +
         std::string(MessageTypeName(MessageType{static_cast<std::uint16_t>(type)}));
}

std::string serviceNameOf(const JSONNode& userInfo) {
  constexpr std::string_view kSuffix = "_session";
  if (userInfo.object() == nullptr) return {};
  const JSONNode* node = find(*userInfo.object(), "kTelvarUserInfoServiceName");
  if (node == nullptr) return {};
  std::string name = plainText(*node);
  if (name.ends_with(kSuffix)) name.resize(name.size() - kSuffix.size());
  return name;
}

MessageIdentifiers::MessageIdentifiers(const std::optional<JSONObject>& summary) {
  if (!summary) return;
  for (const JSONMember& member : *summary) {
    summaryTexts_.emplace(member.key, plainText(member.node));
  }
}

std::string MessageIdentifiers::next(std::int64_t category, std::int64_t type,
                                     const JSONNode& payload) {
  const std::string stored = storedName(category, type);
  const auto value = valueFrom(payload);
  const std::string text = value.value ? description(*value.value) : std::string();
  // Of the names that end in the stored one and whose next number the summary
  // has, the one with this very payload; else the first.
  std::string chosen;
  for (const auto& [identifier, summaryText] : summaryTexts_) {
    const std::string name = withoutNumber(identifier);
    if (name != stored && !name.ends_with("_" + stored)) continue;
    if (identifier != name + "_" + std::to_string(counts_[name] + 1)) continue;
    if (chosen.empty()) chosen = name;
    if (summaryText == text) {
      chosen = name;
      break;
    }
  }
  if (chosen.empty()) chosen = stored;
  return chosen + "_" + std::to_string(++counts_[chosen]);
}

SessionReport::SessionReport(RecordedSession recordedSession,
                             std::vector<RecordedMessage> recorded)
    : session(std::move(recordedSession)) {
  for (const RecordedMessage& message : recorded) {
    if (isSummary(message)) summary = *message.payload.object();
    if (isDriverStatistics(message)) {
      driverStatistics.push_back(*message.payload.object());
    }
  }
  MessageIdentifiers identifiers(summary);
  for (RecordedMessage& message : recorded) {
    if (isSummary(message)) continue;
    std::string identifier =
        identifiers.next(message.category, message.type, message.payload);
    messages.push_back({std::move(identifier), std::move(message)});
  }
  if (summary) {
    addOrientations(*summary, "device", orientations);
    addOrientations(*summary, "ui", orientations);
  }
}

void SessionReport::writeTo(Page& page) const {
  page.heading("Session " + std::to_string(session.id));
  std::vector<Page::Cells> facts = {{"Reporter", std::to_string(session.reporterID)},
                                    {"Service", serviceNameOf(session.userInfo)}};
  const auto addTime = [&facts](const std::string& name, std::optional<StoreTime> time,
                                const std::string& otherwise) {
    facts.push_back({name, time ? localTime(*time) : otherwise});
  };
  addTime("Started", session.startedAt, "");
  addTime("Ended", session.endedAt, "not yet");
  addTime("Flushed", session.flushedAt, session.endedAt ? "never" : "not yet");
  if (session.endedAt) {
    facts.push_back({"Duration", durationText(session.startedAt, session.endedAt)});
  }
  facts.push_back({"Token", session.hierarchyToken});
  page.table({}, facts, 2);

  if (const JSONObject* info = session.userInfo.object()) {
    page.heading("User info");
    page.table({}, cellsOf(*info), 2);
  }

  page.heading("Messages (" + std::to_string(messages.size()) + ")");
  std::vector<Page::Cells> rows;
  for (const Message& message : messages) {
    rows.push_back({std::string("+").append(
                        durationText(session.startedAt, message.recorded.createdAt)),
                    message.identifier, compactText(message.recorded.payload)});
  }
  page.table({}, rows, 2);

  if (!driverStatistics.empty()) {
    page.heading("Driver statistics");
    for (const JSONObject& statistics : driverStatistics) {
      page.table({}, cellsOf(statistics), 2);
    }
  }
  if (!orientations.empty()) {
    page.heading("Orientation");
    rows.clear();
    for (const Orientation& change : orientations) {
      rows.push_back({change.seconds + " s", change.mode, change.name});
    }
    page.table({}, rows, 2);
  }
  page.heading("Summary");
  if (summary) {
    page.table({}, cellsOf(*summary), 2);
  } else {
    page.line(session.endedAt ? "none" : "not yet", 2);
  }
}

std::string SessionReport::json() const {
  JSONArray messageNodes;
  for (const Message& message : messages) {
    JSONObject object = messageObject(message.recorded);
    object.insert(object.begin() + 1, {"identifier", {message.identifier}});
    messageNodes.push_back({std::move(object)});
  }
  JSONArray statisticsNodes;
  for (const JSONObject& statistics : driverStatistics) {
    statisticsNodes.push_back({statistics});
  }
  JSONArray orientationNodes;
  for (const Orientation& change : orientations) {
    const auto seconds = parseJSON(change.seconds);
    orientationNodes.push_back(
        {JSONObject{{"mode", {change.mode}},
                    {"orientation", {change.name}},
                    {"seconds", seconds.value.value_or(JSONNode{})}}});
  }
  return compactText(
      {JSONObject{{"session", {sessionObject(session)}},
                  {"messages", {std::move(messageNodes)}},
                  {"driver_statistics", {std::move(statisticsNodes)}},
                  {"orientation", {std::move(orientationNodes)}},
                  {"summary", summary ? JSONNode{*summary} : JSONNode{}}}});
}

JSONObject sessionObject(const RecordedSession& session) {
  return {{"id", {session.id}},
          {"reporter_id", {session.reporterID}},
          {"service", {serviceNameOf(session.userInfo)}},
          {"hierarchy_token", {session.hierarchyToken}},
          {"session_info", session.sessionInfo},
          {"user_info", session.userInfo},
          {"started_at", timeNode(session.startedAt)},
          {"flushed_at", timeNode(session.flushedAt)},
          {"ended_at", timeNode(session.endedAt)},
          {"messages", {session.messageCount}}};
}

JSONObject messageObject(const RecordedMessage& message) {
  return {
      {"id", {message.id}},
      {"telemetry_session_id",
       message.sessionID ? JSONNode{*message.sessionID} : JSONNode{}},
      {"reporter_id", message.reporterID ? JSONNode{*message.reporterID} : JSONNode{}},
      {"category", {message.category}},
      {"type", {message.type}},
      {"payload", message.payload},
      {"created_at", {message.createdAt}}};
}

std::string durationText(std::optional<StoreTime> from, std::optional<StoreTime> to) {
  if (!from || !to) return {};
  std::array<char, 32> text;
  std::snprintf(text.data(), text.size(), "%.3f s",
                static_cast<double>(*to - *from) / 1e6);
  return text.data();
}

}  // namespace ostrel
