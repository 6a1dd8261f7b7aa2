#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "ostrelctl/Page.h"
#include "ostrelctl/StoreReader.h"

namespace ostrel {

/// Names the messages of one session as the service numbered them, such as
/// "Routing_RouteChange_Start_2".
///
/// The store holds the low half of a category, without its domain. The summary
/// of the session has the full identifiers as its keys; where it is there, the
/// domain comes from it.
class MessageIdentifiers {
 public:
  /// `summary` is none while the session has not ended.
  explicit MessageIdentifiers(const std::optional<JSONObject>& summary);

  /// Of the session's next message, in the order in which they were recorded.
  std::string next(std::int64_t category, std::int64_t type, const JSONNode& payload);

 private:
  std::map<std::string, std::string> summaryTexts_;  // By identifier.
  std::map<std::string, int> counts_;                // By identifier without its number.
};

/// "RouteChange_Start": the names that stored codes give.
std::string storedName(std::int64_t category, std::int64_t type);

/// The service's name as a session's user info has it, such as "telephony".
std::string serviceNameOf(const JSONNode& userInfo);

/// What one session recorded, taken apart for a reader.
struct SessionReport {
  struct Message {
    std::string identifier;
    RecordedMessage recorded;
  };
  struct Orientation {
    std::string mode;  // "device" or "ui".
    std::string name;
    std::string seconds;  // Since the start.
  };

  SessionReport(RecordedSession recordedSession, std::vector<RecordedMessage> recorded);

  RecordedSession session;
  std::vector<Message> messages;  // The summary left out.
  std::optional<JSONObject> summary;
  std::vector<JSONObject> driverStatistics;
  std::vector<Orientation> orientations;  // By mode, then in order.

  void writeTo(Page& page) const;
  std::string json() const;
};

/// The members of a session in JSON, as its columns are called.
JSONObject sessionObject(const RecordedSession& session);
/// The same for a message.
JSONObject messageObject(const RecordedMessage& message);

/// "12.250 s", or "" when either time is missing.
std::string durationText(std::optional<StoreTime> from, std::optional<StoreTime> to);

}  // namespace ostrel
