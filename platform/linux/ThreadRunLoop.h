#pragma once

#include "platform/RunLoop.h"

namespace ostrel {

/// Run loops on threads of their own, on the monotonic clock. A thread is never
/// joined: one whose body does not return ends with the process.
class ThreadRunLoopFactory final : public RunLoopFactory {
 public:
  void startThread(std::string_view name, std::function<void(RunLoop&)> body) override;
  std::shared_ptr<RunLoopTimer> makeTimer(std::chrono::nanoseconds delay,
                                          Task action) override;
  void sleep(std::chrono::nanoseconds duration) override;
};

}  // namespace ostrel
