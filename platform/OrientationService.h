#pragma once

#include <cstdint>
#include <functional>
#include <string>

namespace ostrel {

/// How the device is held, and how the user interface is turned. Registering
/// and unregistering never block; no result is given. What holds when an
/// observer registers is not a change.
class OrientationService {
 public:
  using OrientationCode = std::int32_t;
  /// Called on the service's own thread at every change until unregistered; one
  /// call may still be under way when unregistering returns.
  using Callback = std::function<void(OrientationCode)>;

  virtual ~OrientationService() = default;

  /// A second registration of one kind under one id replaces the first.
  virtual void registerDeviceOrientationObserver(const std::string& id,
                                                 Callback callback) = 0;
  virtual void registerInterfaceOrientationObserver(const std::string& id,
                                                    Callback callback) = 0;
  virtual void unregisterDeviceOrientationObserver(const std::string& id) = 0;
  virtual void unregisterInterfaceOrientationObserver(const std::string& id) = 0;

  /// Never empty: a code that is not known has a name too.
  virtual std::string orientationName(OrientationCode code) const = 0;
};

}  // namespace ostrel
