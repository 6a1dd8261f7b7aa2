#pragma once

#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "platform/OrientationService.h"
#include "platform/fake/EventLog.h"

namespace ostrel {

/// Turns when the test says so.
///
/// Device codes: 0 "undefined", 1 "normal", 2 "bottom-up", 3 "left-up",
/// 4 "right-up". Interface codes: 10 "normal", 11 "90", 12 "180", 13 "270",
/// 14 "flipped". Others: "unknown". Events, ID being the observer's:
/// "orientation.registerDevice ID", "orientation.registerInterface ID",
/// "orientation.unregisterDevice ID", "orientation.unregisterInterface ID".
class FakeOrientationService final : public OrientationService {
 public:
  explicit FakeOrientationService(SharedEventLog events);

  void registerDeviceOrientationObserver(const std::string& id,
                                         Callback callback) override;
  void registerInterfaceOrientationObserver(const std::string& id,
                                            Callback callback) override;
  void unregisterDeviceOrientationObserver(const std::string& id) override;
  void unregisterInterfaceOrientationObserver(const std::string& id) override;
  std::string orientationName(OrientationCode code) const override;

  /// Calls every observer of the kind on the calling thread, by id.
  void turnDevice(OrientationCode code);
  void turnInterface(OrientationCode code);

  /// The ids that are registered, in order.
  std::vector<std::string> deviceObservers() const;
  std::vector<std::string> interfaceObservers() const;

  /// The callback registered under `id`, to be called as a service does whose
  /// last call is still under way when unregistering returns; empty when none.
  Callback deviceCallback(const std::string& id) const;
  Callback interfaceCallback(const std::string& id) const;

  void releaseCallbacks();

 private:
  using Observers = std::map<std::string, Callback>;

  void turn(const Observers& observers, OrientationCode code);

  const SharedEventLog events_;
  mutable std::mutex mutex_;
  Observers device_;
  Observers interface_;
};

}  // namespace ostrel
