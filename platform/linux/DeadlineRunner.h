#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>

namespace ostrel {

/// Runs calls that may hang on helper threads, so that the caller waits for a
/// bounded time only. A call that overruns keeps its helper until it returns;
/// what it uses must not end with the caller.
class DeadlineRunner {
 public:
  /// How long a helper waits for the next call before it ends.
  static constexpr std::chrono::seconds kIdleTime{1};

  /// At most `mostThreads` helpers at a time, started when they are needed.
  explicit DeadlineRunner(std::size_t mostThreads);
  DeadlineRunner(const DeadlineRunner&) = delete;
  DeadlineRunner& operator=(const DeadlineRunner&) = delete;
  /// Leaves helpers that still hang to themselves.
  ~DeadlineRunner();

  enum class Result {
    kDone,
    kOverrun,  // It still runs.
    kNotRun    // Every helper hangs or none can be started. It never will.
  };

  /// Runs `call`, which must not throw, and waits for it at most `timeout`. Any
  /// thread.
  Result run(std::function<void()> call, std::chrono::nanoseconds timeout);

  /// Calls that still run beyond their time.
  std::size_t overrunning() const;

 private:
  struct State;

  const std::shared_ptr<State> state_;
};

}  // namespace ostrel
