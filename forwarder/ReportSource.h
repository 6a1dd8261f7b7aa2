#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "ostrelctl/StoreReader.h"
#include "platform/Outcome.h"

namespace ostrel {

/// One message as the store holds it, with what is known of its session.
struct Report : RecordedMessage {
  JSONNode userInfo;
  std::string hierarchyToken;  // Empty for none.
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
