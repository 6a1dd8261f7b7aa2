#pragma once

#include "platform/KernelTrace.h"

namespace ostrel {

/// The statically defined probe "ostrel:kernel_trace" with five arguments, the
/// code and four zeros: one no-operation instruction until a tracer attaches.
class UsdtKernelTrace final : public KernelTrace {
 public:
  void trace(TraceCode code) override;
};

}  // namespace ostrel
