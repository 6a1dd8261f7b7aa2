#include "tests/model/ReferenceContext.h"

#include <array>
#include <chrono>
#include <utility>

namespace ostrel::reference {

std::size_t Queues::make() {
  queues_.emplace_back();
  return queues_.size() - 1;
}

void Queues::add(std::size_t queue, Step step) {
  queues_[queue].steps.push_back(std::move(step));
}

void Queues::release(std::size_t queue, Step first) {
  queues_[queue].isHeld = false;
  queues_[queue].steps.push_front(std::move(first));
}

std::vector<std::size_t> Queues::ready() const {
  std::vector<std::size_t> numbers;
  for (std::size_t i = 0; i < queues_.size(); ++i) {
    if (!queues_[i].isHeld && !queues_[i].steps.empty()) numbers.push_back(i);
  }
  return numbers;
}

void Queues::run(std::size_t queue, std::size_t position) {
  std::deque<Step>& steps = queues_[queue].steps;
  const auto at = steps.begin() + static_cast<std::ptrdiff_t>(position);
  const Step step = std::move(*at);
  steps.erase(at);
  step();
}

void Queues::clear() {
  for (Queue& queue : queues_) {
    const std::deque<Step> dropped = std::exchange(queue.steps, {});
  }
}

void BackendWait::begin(ManualClock& clock, std::function<void(bool isTimeout)> next) {
  waiter = std::move(next);
  timer = clock.scheduleAt(clock.monotonicNow() + std::chrono::seconds(9),
                           [this, &clock] { wake(clock, /*isTimeout=*/true); });
}

void BackendWait::wake(ManualClock& clock, bool isTimeout) {
  if (!waiter) return;
  clock.cancel(timer);
  const auto woken = std::exchange(waiter, nullptr);
  woken(isTimeout);
}

bool Context::isInternalBuild() {
  if (!isInternalBuild_) {
    const auto answer = around.deviceInfo->answer("InternalBuild");
    isInternalBuild_ = answer && answer->view().number().value_or(0) != 0;
  }
  return *isInternalBuild_;
}

void Context::write(LogLevel level, std::string_view scope,
                    const std::string& text) const {
  const char* name = "debug";
  if (level == LogLevel::kError) name = "error";
  if (level == LogLevel::kDefault) name = "default";
  if (level == LogLevel::kInfo) name = "info";
  around.events->add(std::string("log ") + name + ' ' + std::string(scope) + ' ' + text);
}

Value hostApplicationID(const Dictionary& userInfo) {
  return userInfo.get("HostApplicationDisplayID").value_or(Value("Unknown"));
}

std::string serviceTypeName(ServiceType type) {
  static const std::array<const char*, 12> kNames = {
      "generic",          "vocea",         "telephony",
      "haptics",          "alarms",        "standalone",
      "soundautoconfig",  "longformaudio", "nonlongformaudio",
      "audiodeviceusage", "alerts",        "test"};
  const auto code = static_cast<std::size_t>(type);
  return code < kNames.size() ? kNames[code] : "unknown";
}

std::string categoryName(MessageCategory category) {
  static const std::array<const char*, 12> kKinds = {
      "Undefined",   "Generic",       "Record",      "Playback", "PlaybackAndRecord",
      "Setup",       "ClientRequest", "RouteChange", "Error",    "Chanreporting",
      "Performance", "Volume"};
  const auto code = static_cast<std::uint32_t>(category);
  std::string name;
  if (code >= 0x10000 && code != 0xFFFFFFFF) {
    switch (code & 0xFFFF0000) {
      case 0x08000000:
        name = "Session";
        break;
      case 0x10000000:
        name = "DSP";
        break;
      case 0x20000000:
        name = "HAL";
        break;
      case 0x40000000:
        name = "Routing";
        break;
      case 0x80000000:
        name = "Toolbox";
        break;
      default:
        break;
    }
    name += '_';
  }
  const std::uint32_t kind = code & 0xFFFF;
  return name + (kind < kKinds.size() ? kKinds[kind] : "Undefined");
}

std::string messageTypeName(MessageType type) {
  static const std::array<const char*, 6> kNames = {"Generic", "Start", "Stop",
                                                    "Setup",   "Error", "IssueDetector"};
  const auto code = static_cast<std::size_t>(type);
  if (code == 0xFFFF) return "Unknown";
  return code < kNames.size() ? kNames[code] : "Undefined";
}

}  // namespace ostrel::reference
