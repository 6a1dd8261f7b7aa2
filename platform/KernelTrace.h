#pragma once

#include <cstdint>

namespace ostrel {

/// The trace points of the service, each with four zero arguments.
enum class TraceCode : std::uint32_t {
  kCreate = 0x21042814,
  kStart = 0x21042818,
  kStop = 0x2104281C,
  kDestroy = 0x21042820,
  kSend = 0x21042824,
  kSessionCreated = 0x21042828,
  kSessionStart = 0x2104282C,
  kSessionStop = 0x21042830,
  kSessionTeardown = 0x21042834,
  kMessageDelivery = 0x21042838,
};

class KernelTrace {
 public:
  virtual ~KernelTrace() = default;

  /// Never blocks; nothing when nobody traces. Any thread.
  virtual void trace(TraceCode code) = 0;
};

}  // namespace ostrel
