#include "Statistics/OstrelReportingUtility.h"

#include <cstdint>
#include <mutex>
#include <optional>

#include "platform/DeviceInfo.h"

namespace ostrel {
namespace {

constexpr std::uint32_t kDomainMask = 0xFFFF0000;
constexpr std::uint32_t kKindMask = 0x0000FFFF;
constexpr std::uint32_t kAllOnes = 0xFFFFFFFF;

// Empty for a domain without a name.
std::string_view domainName(std::uint32_t domain) {
  switch (domain) {
    case 0x08000000:
      return "Session";
    case 0x10000000:
      return "DSP";
    case 0x20000000:
      return "HAL";
    case 0x40000000:
      return "Routing";
    case 0x80000000:
      return "Toolbox";
    default:
      return {};
  }
}

std::string_view kindName(std::uint32_t kind) {
  static constexpr std::string_view kNames[] = {
      "Undefined",   "Generic",       "Record",      "Playback", "PlaybackAndRecord",
      "Setup",       "ClientRequest", "RouteChange", "Error",    "Chanreporting",
      "Performance", "Volume"};
  return kNames[kind < std::size(kNames) ? kind : 0];
}

struct InternalBuild {
  std::mutex mutex;
  std::optional<bool> answer;
};

InternalBuild& internalBuild() {
  static InternalBuild& instance = *new InternalBuild;
  return instance;
}

}  // namespace

std::string_view ServiceTypeName(ServiceType serviceType) {
  static constexpr std::string_view kNames[] = {
      "generic",          "vocea",         "telephony",
      "haptics",          "alarms",        "standalone",
      "soundautoconfig",  "longformaudio", "nonlongformaudio",
      "audiodeviceusage", "alerts",        "test"};
  const auto code = static_cast<std::uint16_t>(serviceType);
  return code < std::size(kNames) ? kNames[code] : "unknown";
}

std::string CategoryName(MessageCategory category) {
  std::string name;
  appendCategoryName(name, category);
  return name;
}

void appendCategoryName(std::string& out, MessageCategory category) {
  const auto code = static_cast<std::uint32_t>(category);
  // Kept: the category of all ones counts as a kind without a domain.
  // [KeepsAllOnesCategoryWithoutDomain]
  if (code > kKindMask && code != kAllOnes) {
    out += domainName(code & kDomainMask);
    // Kept: a category's domain without a name still leaves its "_".
    // [KeepsLeadingUnderscoreForUnnamedDomain]
    out += '_';
  }
  out += kindName(code & kKindMask);
}

std::string_view MessageTypeName(MessageType type) {
  static constexpr std::string_view kNames[] = {"Generic", "Start", "Stop",
                                                "Setup",   "Error", "IssueDetector"};
  const auto code = static_cast<std::uint16_t>(type);
  if (code < std::size(kNames)) return kNames[code];
  return code == 0xFFFF ? "Unknown" : "Undefined";
}

Value HostApplicationID(const Dictionary& userInfo) {
  std::optional<Value> id = userInfo.get("HostApplicationDisplayID");
  return id ? *std::move(id) : Value("Unknown");
}

bool IsInternalBuild(const OstrelReportingPlatform& platform) {
  InternalBuild& state = internalBuild();
  const std::lock_guard lock(state.mutex);
  if (!state.answer) {
    const std::optional<Value> answer = platform.deviceInfo->answer("InternalBuild");
    state.answer = answer && answer->view().number().value_or(0) != 0;
  }
  return *state.answer;
}

void forgetIsInternalBuildForTesting() {
  InternalBuild& state = internalBuild();
  const std::lock_guard lock(state.mutex);
  state.answer.reset();
}

// The wait's continuation bears the wait's name: its lines do in the log.

static void OstrelReportingUtilityWait(std::shared_ptr<const BackendWait> wait,
                                       Condition::Wake wake) {
  if (wake == Condition::Wake::kTimedOut) {
    OSTREL_LOG_ERROR(wait->scope, "%@", "failed to find backend");
    wait->done(/*found=*/false);
    return;
  }
  OSTREL_LOG_DEFAULT(wait->scope, "continuing");
  OstrelReportingUtilityWait(std::move(wait));
}

void OstrelReportingUtilityWait(std::shared_ptr<const BackendWait> wait) {
  Condition& condition = *wait->condition;
  condition.lock();
  if (wait->found()) {
    condition.unlock();
    wait->done(/*found=*/true);
    return;
  }
  OSTREL_LOG_DEFAULT(wait->scope, "%@", "waiting for telvard to find backends");
  wait->queue.suspend();
  condition.wait(BackendWaitTimeout, [wait](Condition::Wake wake) {
    wait->queue.resume([wait, wake] { OstrelReportingUtilityWait(wait, wake); });
  });
  condition.unlock();
}

}  // namespace ostrel
