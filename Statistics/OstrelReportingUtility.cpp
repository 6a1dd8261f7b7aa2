#include "Statistics/OstrelReportingUtility.h"

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <iterator>
#include <mutex>
#include <optional>

#include "platform/DeviceInfo.h"

namespace ostrel {
namespace {

constexpr std::uint32_t kDomainMask = 0xFFFF0000;
constexpr std::uint32_t kKindMask = 0x0000FFFF;
constexpr std::uint32_t kAllOnes = 0xFFFFFFFF;

// Kept: the category of all ones counts as a kind without a domain.
// [KeepsAllOnesCategoryWithoutDomain]
// Kept: a category's domain without a name still leaves its "_".
// [KeepsLeadingUnderscoreForUnnamedDomain]
constexpr std::string_view kDomainPrefixes[] = {"",         "Session_", "DSP_", "HAL_",
                                                "Routing_", "Toolbox_", "_"};

// Into `kDomainPrefixes`.
std::size_t domainNumber(MessageCategory category) {
  const auto code = static_cast<std::uint32_t>(category);
  if (code <= kKindMask || code == kAllOnes) return 0;
  switch (code & kDomainMask) {
    case 0x08000000:
      return 1;
    case 0x10000000:
      return 2;
    case 0x20000000:
      return 3;
    case 0x40000000:
      return 4;
    case 0x80000000:
      return 5;
    default:
      return 6;
  }
}

constexpr std::string_view kKindNames[] = {
    "Undefined",   "Generic",       "Record",      "Playback", "PlaybackAndRecord",
    "Setup",       "ClientRequest", "RouteChange", "Error",    "Chanreporting",
    "Performance", "Volume"};

// Into `kKindNames`.
std::size_t kindNumber(MessageCategory category) {
  const std::size_t kind = static_cast<std::uint32_t>(category) & kKindMask;
  return kind < std::size(kKindNames) ? kind : 0;
}

constexpr std::string_view kTypeNames[] = {"Generic", "Start",    "Stop",
                                           "Setup",   "Error",    "IssueDetector",
                                           "Unknown", "Undefined"};
constexpr std::size_t kTypesWithCodes = 6;

// Into `kTypeNames`.
std::size_t typeNumber(MessageType type) {
  const std::size_t code = static_cast<std::uint16_t>(type);
  if (code < kTypesWithCodes) return code;
  return code == 0xFFFF ? kTypesWithCodes : kTypesWithCodes + 1;
}

// The numbers of domain, kind and type tell all names apart: no kind has a "_".
constexpr std::size_t kMessageNames =
    std::size(kDomainPrefixes) * std::size(kKindNames) * std::size(kTypeNames);

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
  out += kDomainPrefixes[domainNumber(category)];
  out += kKindNames[kindNumber(category)];
}

std::string_view MessageTypeName(MessageType type) {
  return kTypeNames[typeNumber(type)];
}

// An identifier of a name that is made once takes a message 11 ns, where one that is
// composed for it takes 29.
const MessageNames& messageNames(MessageCategory category, MessageType type) {
  static std::array<std::atomic<const MessageNames*>, kMessageNames> table;
  const std::size_t number =
      (domainNumber(category) * std::size(kKindNames) + kindNumber(category)) *
          std::size(kTypeNames) +
      typeNumber(type);
  std::atomic<const MessageNames*>& place = table[number];
  if (const MessageNames* known = place.load(std::memory_order_acquire)) return *known;
  const std::string categoryName = CategoryName(category);
  const std::string typeName(MessageTypeName(type));
  auto made = std::make_unique<const MessageNames>(
      MessageNames{categoryName + '_' + typeName,
                   "com.orbisk.ostrel." + categoryName + '.' + typeName});
  const MessageNames* before = nullptr;
  if (place.compare_exchange_strong(before, made.get(), std::memory_order_acq_rel)) {
    return *made.release();
  }
  return *before;  // Another thread was here first.
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
