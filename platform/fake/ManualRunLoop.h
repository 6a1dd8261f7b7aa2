#pragma once

#include <memory>

#include "platform/RunLoop.h"
#include "platform/fake/ManualClock.h"

namespace ostrel {

/// Run loops on manual time. Each body runs on a thread of its own, but only
/// while the test's thread stands inside `ManualClock::advance`, and one thread
/// at a time: the same test runs the same way every time.
///
/// A thread that was started begins at the next `advance`, of 0 too. `sleep` on
/// a thread that the factory did not start advances the clock.
class ManualRunLoopFactory final : public RunLoopFactory {
 public:
  explicit ManualRunLoopFactory(std::shared_ptr<ManualClock> clock);
  ~ManualRunLoopFactory() override;

  /// Ends all threads where they wait, by unwinding them. A test whose threads
  /// keep this factory calls it before it ends.
  void endThreads();

  void startThread(std::string_view name, std::function<void(RunLoop&)> body) override;
  std::shared_ptr<RunLoopTimer> makeTimer(std::chrono::nanoseconds delay,
                                          Task action) override;
  void sleep(std::chrono::nanoseconds duration) override;

 private:
  class Turns;
  class Timer;
  class Loop;

  const std::shared_ptr<ManualClock> clock_;
  const std::shared_ptr<Turns> turns_;
};

}  // namespace ostrel
