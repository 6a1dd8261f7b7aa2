// The vocabulary of the service: the names of its codes, and a few look-ups that
// every part shares. Of these only the wait for backends logs, and none fails.
#pragma once

#include <array>
#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "Statistics/OstrelReportingTypes.h"
#include "platform/Condition.h"
#include "platform/Logging.h"
#include "platform/OstrelReportingPlatform.h"
#include "platform/Value.h"
#include "platform/WorkQueue.h"

namespace ostrel {

/// The name of a service type, such as "telephony"; "unknown" for a code
/// without a name. Any thread.
std::string_view ServiceTypeName(ServiceType serviceType);

/// The name of a category: its domain, "_" and its kind, such as
/// "Routing_RouteChange", or the kind alone where there is no domain. Any
/// thread.
std::string CategoryName(MessageCategory category);

/// As `CategoryName`, at the end of `out`: for names made of several parts.
void appendCategoryName(std::string& out, MessageCategory category);

/// The name of a message type, such as "Start"; "Undefined" for a code without
/// a name. Any thread.
std::string_view MessageTypeName(MessageType type);

/// What the service calls messages with the same codes. Codes with equal names share
/// one.
struct MessageNames {
  std::string identifier;  // "Routing_RouteChange_Start"; messages are numbered by it.
  std::string event;       // "com.orbisk.ostrel.Routing_RouteChange.Start".
};

/// The names of a message with these codes; made when they are first asked for, and
/// kept as long as the process lives. There are fewer than 700. Any thread.
const MessageNames& messageNames(MessageCategory category, MessageType type);

/// What stands under "HostApplicationDisplayID", of whatever kind it is;
/// "Unknown" when nothing does. Any thread.
Value HostApplicationID(const Dictionary& userInfo);

/// Whether this is an internal build of the device. The first call of the
/// process asks `DeviceInfo`; all others get its answer. No answer, or one that
/// is not a number or a boolean, counts as not internal. Any thread; concurrent
/// first callers wait.
bool IsInternalBuild(const OstrelReportingPlatform& platform);

/// Makes the next `IsInternalBuild` ask again. For tests.
void forgetIsInternalBuildForTesting();

/// The payload keys whose values are never compared when two messages are held
/// to be duplicates: three time stamps, and the two keys that steer the
/// throttle itself.
inline constexpr std::array<std::string_view, 5> ThrottleExcludedKeys = {
    "systemuptime_sec", "processuptime_ms", "ostrelreporting_timestamp",
    "_comparison_field_blacklist", "_throttle_seconds"};

/// How long one wait for the backends of a telemetry session lasts.
inline constexpr std::chrono::nanoseconds BackendWaitTimeout =
    std::chrono::duration_cast<std::chrono::nanoseconds>(
        std::chrono::duration<double>(double{9.0F}));

/// A wait for the backends of a telemetry session. `queue` stays alive through
/// `done`.
struct BackendWait {
  const LogScope& scope;
  WorkQueue& queue;
  std::shared_ptr<Condition> condition;
  std::function<bool()> found;     // Asked with the condition's lock held.
  std::function<void(bool)> done;  // Called on the queue.
};

/// Holds the queue back, without holding a thread, until `found` is true or a
/// wait of `BackendWaitTimeout` ends in vain; then calls `done` with which of
/// the two it was. Calls it at once when `found` is true already. Whoever makes
/// `found` true signals the condition; a wake that finds it false waits anew.
/// Called on the queue.
void OstrelReportingUtilityWait(std::shared_ptr<const BackendWait> wait);

}  // namespace ostrel
