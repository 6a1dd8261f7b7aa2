#include "platform/linux/UsdtKernelTrace.h"

#include <sys/sdt.h>

#include <cstdint>

namespace ostrel {

// Never inlined, so that there is one place to attach to.
[[gnu::noinline]] void UsdtKernelTrace::trace(TraceCode code) {
  DTRACE_PROBE5(ostrel, kernel_trace, static_cast<std::uint32_t>(code), 0, 0, 0, 0);
}

}  // namespace ostrel
