#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "ostrelctl/JSONNode.h"
#include "platform/Outcome.h"

namespace ostrel {

/// One message as the store holds it, with what is known of its session.
struct Report {
  std::int64_t id = 0;
  /// The session's row; none for a message without one.
  std::optional<std::int64_t> sessionID;
  std::optional<std::int64_t> reporterID;
  std::int64_t category = 0;
  std::int64_t type = 0;
  JSONNode payload;
  JSONNode userInfo;
  std::string hierarchyToken;  // Empty for none.
  std::int64_t createdAt = 0;  // Microseconds since 1970.
};

/// Messages that follow each other in a store.
struct ReportBatch {
  /// What tells this store from any other, through all its life. Empty: there is no
  /// store yet.
  std::string store;
  std::int64_t newestID = 0;    // Of the store; 0 when it holds no message.
  std::vector<Report> reports;  // By ascending ID.
};

/// How much is read at once.
struct BatchSize {
  std::size_t reports = 1;
  std::size_t bytes = 1;  // Of texts; one report is read however large it is.
};

/// Where reports come from. One thread.
class ReportSource {
 public:
  virtual ~ReportSource() = default;

  /// The reports after `id`. The error is a sentence for people.
  virtual Outcome<ReportBatch> reportsAfter(std::int64_t id, BatchSize most) = 0;
};

}  // namespace ostrel
