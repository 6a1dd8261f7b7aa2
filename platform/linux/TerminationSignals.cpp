#include "platform/linux/TerminationSignals.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdint>

namespace ostrel {
namespace {

std::atomic<int> signalledEvent{-1};

void signalEvent(int descriptor) {
  const std::uint64_t one = 1;
  // It can only fail when the event is as readable as it gets.
  [[maybe_unused]] const ssize_t written = ::write(descriptor, &one, sizeof one);
}

extern "C" void takeTerminationSignal(int /*number*/) {
  const int error = errno;
  const int descriptor = signalledEvent.load();
  if (descriptor >= 0) signalEvent(descriptor);
  errno = error;
}

}  // namespace

TerminationSignals::TerminationSignals()
    : event_(::eventfd(/*initval=*/0, EFD_CLOEXEC | EFD_NONBLOCK)) {
  signalledEvent = event_.get();
  struct sigaction action {};
  action.sa_handler = takeTerminationSignal;
  action.sa_flags = SA_RESTART;
  ::sigaction(SIGTERM, &action, &oldTerm_);
  ::sigaction(SIGINT, &action, &oldInterrupt_);
}

TerminationSignals::~TerminationSignals() {
  ::sigaction(SIGTERM, &oldTerm_, nullptr);
  ::sigaction(SIGINT, &oldInterrupt_, nullptr);
  signalledEvent = -1;
}

void TerminationSignals::raise() { signalEvent(event_.get()); }

}  // namespace ostrel
