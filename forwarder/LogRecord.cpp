#include "forwarder/LogRecord.h"

#include <limits>
#include <nlohmann/json.hpp>

#include "Statistics/OstrelReportingUtility.h"

namespace ostrel {
namespace {

// Members stand in the order in which they are set.
using JSON = nlohmann::ordered_json;

constexpr int kSeverityInfo = 9;
constexpr std::int64_t kSummaryCode = 0xFFFF;  // Category and type.

std::string text(const JSON& json) {
  return json.dump(/*indent=*/-1, /*indent_char=*/' ', /*ensure_ascii=*/false,
                   JSON::error_handler_t::replace);
}

JSON anyValue(const JSONNode& node);

JSON withMember(std::string_view name, JSON value) {
  JSON object = JSON::object();
  object[std::string(name)] = std::move(value);
  return object;
}

JSON keyValue(std::string_view key, JSON value) {
  JSON pair = withMember("key", key);
  pair["value"] = std::move(value);
  return pair;
}

JSON valueOf(std::int64_t value) { return withMember("intValue", std::to_string(value)); }

JSON valueOf(std::string_view value) { return withMember("stringValue", value); }

JSON listOf(const JSONObject& object) {
  JSON values = JSON::array();
  for (const JSONMember& member : object) {
    values.push_back(keyValue(member.key, anyValue(member.node)));
  }
  return withMember("values", std::move(values));
}

JSON listOf(const JSONArray& array) {
  JSON values = JSON::array();
  for (const JSONNode& element : array) values.push_back(anyValue(element));
  return withMember("values", std::move(values));
}

struct AnyValueOf {
  JSON operator()(std::nullptr_t) const { return JSON::object(); }
  JSON operator()(bool value) const { return withMember("boolValue", value); }
  JSON operator()(std::int64_t value) const { return valueOf(value); }
  // Beyond the range of an integer here; text keeps it exact.
  JSON operator()(std::uint64_t value) const { return valueOf(std::to_string(value)); }
  JSON operator()(double value) const { return withMember("doubleValue", value); }
  JSON operator()(const std::string& value) const {
    return valueOf(std::string_view(value));
  }
  JSON operator()(const JSONArray& value) const {
    return withMember("arrayValue", listOf(value));
  }
  JSON operator()(const JSONObject& value) const {
    return withMember("kvlistValue", listOf(value));
  }
};

JSON anyValue(const JSONNode& node) { return std::visit(AnyValueOf(), node.value); }

bool isSummary(const Report& report) {
  return report.category == kSummaryCode && report.type == kSummaryCode &&
         report.payload.object() != nullptr &&
         find(*report.payload.object(), "Ostrel_Session_Summary_Event") != nullptr;
}

std::string eventName(const Report& report) {
  if (isSummary(report)) return "com.orbisk.ostrel.SessionSummary";
  return messageNames(static_cast<MessageCategory>(report.category),
                      static_cast<MessageType>(report.type))
      .event;
}

/// "0", which stands for an unknown time, where nanoseconds since 1970 cannot say it.
std::string nanoseconds(std::int64_t microseconds) {
  constexpr std::int64_t kMost = std::numeric_limits<std::int64_t>::max() / 1000;
  const bool isSayable = microseconds >= 0 && microseconds <= kMost;
  return std::to_string(isSayable ? microseconds * 1000 : 0);
}

JSON attributes(const Report& report, std::string_view store) {
  JSON all = JSON::array();
  all.push_back(keyValue("log.record.uid", valueOf(recordID(report, store))));
  all.push_back(keyValue("ostrel.category", valueOf(report.category)));
  all.push_back(keyValue("ostrel.type", valueOf(report.type)));
  if (report.sessionID) {
    all.push_back(keyValue("ostrel.session.id", valueOf(*report.sessionID)));
  }
  if (report.reporterID) {
    all.push_back(keyValue("ostrel.reporter.id", valueOf(*report.reporterID)));
  }
  if (const JSONObject* info = report.userInfo.object()) {
    for (const JSONMember& member : *info) {
      all.push_back(keyValue("ostrel.user_info." + member.key, anyValue(member.node)));
    }
  }
  return all;
}

}  // namespace

std::optional<TraceContext> traceContext(std::string_view traceparent) {
  constexpr std::string_view kShape =
      "00-xxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxx-xxxxxxxxxxxxxxxx-xx";
  constexpr std::string_view kDigits = "0123456789abcdef";
  if (traceparent.size() != kShape.size()) return std::nullopt;
  for (std::size_t i = 0; i < kShape.size(); ++i) {
    const bool isDigit = kDigits.find(traceparent[i]) != std::string_view::npos;
    if (kShape[i] == 'x' ? !isDigit : traceparent[i] != kShape[i]) return std::nullopt;
  }
  TraceContext context;
  context.traceID = traceparent.substr(3, 32);
  context.spanID = traceparent.substr(36, 16);
  context.flags = static_cast<int>(16 * kDigits.find(traceparent[53]) +
                                   kDigits.find(traceparent[54]));
  // All zeros are no ID.
  if (context.traceID.find_first_not_of('0') == std::string::npos ||
      context.spanID.find_first_not_of('0') == std::string::npos) {
    return std::nullopt;
  }
  return context;
}

std::string recordID(const Report& report, std::string_view store) {
  return std::string(store) + '-' + std::to_string(report.id) + '-' +
         std::to_string(report.createdAt);
}

std::string logRecordJSON(const Report& report, std::string_view store) {
  JSON record;
  record["timeUnixNano"] = nanoseconds(report.createdAt);
  record["observedTimeUnixNano"] = nanoseconds(report.createdAt);
  record["severityNumber"] = kSeverityInfo;
  record["severityText"] = "INFO";
  record["eventName"] = eventName(report);
  record["body"] = anyValue(report.payload);
  record["attributes"] = attributes(report, store);
  if (const auto context = traceContext(report.hierarchyToken)) {
    record["flags"] = context->flags;
    record["traceId"] = context->traceID;
    record["spanId"] = context->spanID;
  }
  return text(record);
}

std::string logsRequestJSON(const NamesAndValues& resource, std::string_view version,
                            const std::vector<std::string>& records) {
  JSON attributes = JSON::array();
  for (const auto& [name, value] : resource) {
    attributes.push_back(keyValue(name, valueOf(std::string_view(value))));
  }
  JSON scope = withMember("name", "ostrelforwarder");
  scope["version"] = version;
  std::string request = R"({"resourceLogs":[{"resource":{"attributes":)" +
                        text(attributes) + R"(},"scopeLogs":[{"scope":)" + text(scope) +
                        R"(,"logRecords":[)";
  for (std::size_t i = 0; i < records.size(); ++i) {
    if (i != 0) request += ',';
    request += records[i];
  }
  return request + "]}]}]}";
}

}  // namespace ostrel
