#include "ostrelctl/ToolClock.h"

#include <thread>

namespace ostrel {
namespace {

class RealToolClock final : public ToolClock {
 public:
  void sleep(std::chrono::nanoseconds duration) override {
    std::this_thread::sleep_for(duration);
  }
  void wait(std::unique_lock<std::mutex>& lock, std::condition_variable& changed,
            std::chrono::nanoseconds longest,
            const std::function<bool()>& done) override {
    changed.wait_for(lock, longest, done);
  }
};

}  // namespace

ToolClock& realToolClock() {
  static RealToolClock clock;
  return clock;
}

}  // namespace ostrel
