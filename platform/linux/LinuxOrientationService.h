#pragma once

#include <memory>
#include <string>

#include "platform/OrientationService.h"
#include "platform/linux/OrientationWatch.h"

namespace ostrel {

/// The device's orientation by its sensors, the interface's by its compositor.
/// Names are those of the source; the codes of the two do not overlap. Each has a
/// thread only while it is observed.
class LinuxOrientationService final : public OrientationService {
 public:
  /// `firstBackOff` is the wait before a source that failed is tried again; it
  /// grows up to `BackOff::kLongest`.
  explicit LinuxOrientationService(
      std::chrono::milliseconds firstBackOff = BackOff::kFirst);

  void registerDeviceOrientationObserver(const std::string& id,
                                         Callback callback) override;
  void registerInterfaceOrientationObserver(const std::string& id,
                                            Callback callback) override;
  void unregisterDeviceOrientationObserver(const std::string& id) override;
  void unregisterInterfaceOrientationObserver(const std::string& id) override;
  std::string orientationName(OrientationCode code) const override;

 private:
  OrientationWatch device_;
  OrientationWatch interface_;
};

}  // namespace ostrel
