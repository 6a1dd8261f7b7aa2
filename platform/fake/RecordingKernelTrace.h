#pragma once

#include <mutex>
#include <vector>

#include "platform/KernelTrace.h"
#include "platform/fake/EventLog.h"

namespace ostrel {

/// Adds "trace 0x21042828" to the events for each trace point.
class RecordingKernelTrace final : public KernelTrace {
 public:
  explicit RecordingKernelTrace(SharedEventLog events);

  void trace(TraceCode code) override;

  std::vector<TraceCode> codes() const;

 private:
  const SharedEventLog events_;
  mutable std::mutex mutex_;
  std::vector<TraceCode> codes_;
};

}  // namespace ostrel
