#pragma once

#include <mutex>
#include <optional>

#include "platform/JSONSerialization.h"
#include "platform/fake/EventLog.h"

namespace ostrel {

/// Writes the elements' descriptions, one a line, between lines of "[" and "]":
/// enough to see what was serialised, and no JSON. Fails as the real one does
/// on what JSON cannot say. Adds "json.prettyPrintedArray" to the events.
class FakeJSONSerialization final : public JSONSerialization {
 public:
  explicit FakeJSONSerialization(SharedEventLog events);

  Outcome<TextSource> prettyPrintedArray(ElementSource elements) override;

  /// Calls from now on give this; none ends that.
  void setResult(std::optional<Outcome<TextSource>> result);

 private:
  const SharedEventLog events_;
  std::mutex mutex_;
  std::optional<Outcome<TextSource>> result_;
};

}  // namespace ostrel
