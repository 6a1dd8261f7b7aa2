#include "platform/fake/RecordingKernelTrace.h"

#include <cstdio>
#include <utility>

namespace ostrel {

RecordingKernelTrace::RecordingKernelTrace(SharedEventLog events)
    : events_(std::move(events)) {}

void RecordingKernelTrace::trace(TraceCode code) {
  char text[32];
  std::snprintf(text, sizeof text, "trace 0x%08x", static_cast<unsigned>(code));
  events_->add(text);
  const std::lock_guard lock(mutex_);
  codes_.push_back(code);
}

std::vector<TraceCode> RecordingKernelTrace::codes() const {
  const std::lock_guard lock(mutex_);
  return codes_;
}

}  // namespace ostrel
