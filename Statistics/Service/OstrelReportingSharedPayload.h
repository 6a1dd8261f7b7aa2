#pragma once

#include <mutex>

#include "Statistics/Service/OstrelReportingSessionSummary.h"
#include "platform/Value.h"

namespace ostrel {

/// What `SanitisedPayload` makes of one message, for all sessions that it goes to. It is
/// made for the first session that needs it; what others need meanwhile they wait for.
///
/// A message of 256 KiB with a blank in a key, to 1,024 sessions, is so copied once, and
/// charged once to its client; a copy for each of them would be 256 MiB.
class OstrelReportingSharedPayload {
 public:
  /// `message` is the same at every call. Any thread.
  Dictionary of(const Dictionary& message) {
    std::call_once(made_, [&] { payload_ = SanitisedPayload(message); });
    return payload_;
  }

 private:
  std::once_flag made_;
  Dictionary payload_;
};

}  // namespace ostrel
