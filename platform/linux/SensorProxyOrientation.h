#pragma once

#include <chrono>
#include <string>

#include "platform/linux/OrientationWatch.h"

namespace ostrel {

/// How the device is held, by "net.hadess.SensorProxy" on the system bus. The
/// accelerometer is claimed while this runs, again whenever the sensor service
/// comes back, and with growing waits while it refuses.
class SensorProxyOrientation final : public OrientationSource {
 public:
  /// The codes, in the order of `kNames`. "undefined" says that the sensor has not
  /// been read yet: it is reported before all others only.
  static constexpr Code kUndefined = 0;
  static constexpr const char* kNames[] = {"undefined", "normal", "bottom-up", "left-up",
                                           "right-up"};

  /// For each call, and for the bus to let this process in.
  static constexpr std::chrono::seconds kMostWait{2};

  explicit SensorProxyOrientation(std::chrono::milliseconds firstBackOff)
      : firstBackOff_(firstBackOff) {}

  bool isConfigured() const override { return true; }

  /// The bus is at `$DBUS_SYSTEM_BUS_ADDRESS` or the system's usual place.
  void run(int stopDescriptor, const Report& report) override;

 private:
  const std::chrono::milliseconds firstBackOff_;
};

}  // namespace ostrel
