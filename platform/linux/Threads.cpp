#include "platform/linux/Threads.h"

#include <pthread.h>
#include <signal.h>
#include <sys/resource.h>
#include <unistd.h>

#include <utility>

namespace ostrel {
namespace {

constexpr std::size_t kMostNameBytes = 15;

/// Holds all signals back, so that a thread made meanwhile never takes one.
class BlockedSignals {
 public:
  BlockedSignals() {
    sigset_t all;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &before_);
  }
  ~BlockedSignals() { pthread_sigmask(SIG_SETMASK, &before_, nullptr); }
  BlockedSignals(const BlockedSignals&) = delete;
  BlockedSignals& operator=(const BlockedSignals&) = delete;

 private:
  sigset_t before_;
};

}  // namespace

// On Linux a priority belongs to a thread, not to its process.
bool setNiceness(int niceness) {
  return setpriority(PRIO_PROCESS, static_cast<id_t>(gettid()), niceness) == 0;
}

std::thread startThread(const std::string& name, int niceness,
                        std::function<void()> body) {
  const BlockedSignals blocked;
  return std::thread(
      [name = name.substr(0, kMostNameBytes), niceness, body = std::move(body)] {
        pthread_setname_np(pthread_self(), name.c_str());
        setNiceness(niceness);
        body();
      });
}

}  // namespace ostrel
