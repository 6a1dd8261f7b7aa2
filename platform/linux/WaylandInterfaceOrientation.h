#pragma once

#include <chrono>
#include <string>

#include "platform/linux/OrientationWatch.h"

namespace ostrel {

/// How the user interface is turned: the transform of the compositor's first
/// output. Connects again, with growing waits, when the compositor goes away.
class WaylandInterfaceOrientation final : public OrientationSource {
 public:
  /// The code of a transform is `kFirstCode` and the transform's number; the names
  /// are in the order of the numbers.
  static constexpr Code kFirstCode = 16;
  static constexpr const char* kNames[] = {"normal",      "90",         "180",
                                           "270",         "flipped",    "flipped-90",
                                           "flipped-180", "flipped-270"};

  explicit WaylandInterfaceOrientation(std::chrono::milliseconds firstBackOff)
      : firstBackOff_(firstBackOff) {}

  /// Whether `$WAYLAND_DISPLAY` names a compositor: a socket in
  /// `$XDG_RUNTIME_DIR`, or by its full path.
  bool isConfigured() const override;

  void run(int stopDescriptor, const Report& report) override;

 private:
  const std::chrono::milliseconds firstBackOff_;
};

}  // namespace ostrel
