#include "platform/linux/LinuxOrientationService.h"

#include <iterator>
#include <utility>

#include "platform/linux/SensorProxyOrientation.h"
#include "platform/linux/WaylandInterfaceOrientation.h"

namespace ostrel {

LinuxOrientationService::LinuxOrientationService(std::chrono::milliseconds firstBackOff)
    : device_("orientation", std::make_unique<SensorProxyOrientation>(firstBackOff)),
      interface_("interface",
                 std::make_unique<WaylandInterfaceOrientation>(firstBackOff)) {}

void LinuxOrientationService::registerDeviceOrientationObserver(const std::string& id,
                                                                Callback callback) {
  device_.add(id, std::move(callback));
}

void LinuxOrientationService::registerInterfaceOrientationObserver(const std::string& id,
                                                                   Callback callback) {
  interface_.add(id, std::move(callback));
}

void LinuxOrientationService::unregisterDeviceOrientationObserver(const std::string& id) {
  device_.remove(id);
}

void LinuxOrientationService::unregisterInterfaceOrientationObserver(
    const std::string& id) {
  interface_.remove(id);
}

std::string LinuxOrientationService::orientationName(OrientationCode code) const {
  constexpr auto kSensorCodes =
      static_cast<OrientationCode>(std::size(SensorProxyOrientation::kNames));
  constexpr auto kTransforms =
      static_cast<OrientationCode>(std::size(WaylandInterfaceOrientation::kNames));
  constexpr auto kFirst = WaylandInterfaceOrientation::kFirstCode;
  if (code >= 0 && code < kSensorCodes) return SensorProxyOrientation::kNames[code];
  if (code >= kFirst && code < kFirst + kTransforms) {
    return WaylandInterfaceOrientation::kNames[code - kFirst];
  }
  return "unknown";
}

}  // namespace ostrel
