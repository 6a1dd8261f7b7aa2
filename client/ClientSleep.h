#pragma once

#include <chrono>
#include <utility>

#include "client/ClientSocket.h"
#include "platform/Outcome.h"

namespace ostrel::reporting {

/// How the client's thread waits for its socket, for other threads and for a time.
///
/// All three are told to the kernel once, and a time that has been told already is not
/// told again: a wait that ends with a reply is one short system call. `poll` with a
/// timeout takes a fifth of a microsecond more for each.
class ClientSleep {
 public:
  using Clock = std::chrono::steady_clock;

  /// Fails when the process is out of descriptors; there are three.
  static Outcome<ClientSleep> make();

  /// Watches `socket` from now on. False: there is no memory.
  bool watch(int socket);
  /// Before the socket is closed.
  void forget(int socket);

  /// Ends a wait of the client's thread, or its next one at once. Any thread.
  void wake() { wake_.wake(); }

  /// When a wait until `time` would end at the latest.
  Clock::time_point endOfWait(Clock::time_point time) const;

  /// Waits until `time`, until there is something in `socket` or, with `wantsToWrite`,
  /// room in it, or until it is woken; now and then for less. `socket` may be -1. The
  /// client's thread.
  void wait(Clock::time_point time, int socket, bool wantsToWrite);

  /// In a child of the process, whose parent goes on.
  void close();

 private:
  ClientSleep(OwnedDescriptor poll, WakeEvent wake, OwnedDescriptor timer)
      : poll_(std::move(poll)), wake_(std::move(wake)), timer_(std::move(timer)) {}

  void setTimer(Clock::time_point time);
  void setEvents(int socket, bool wantsToWrite);

  OwnedDescriptor poll_;
  WakeEvent wake_;
  OwnedDescriptor timer_;
  Clock::time_point timerEnd_ = Clock::time_point::max();
  bool waitsForRoom_ = false;
};

}  // namespace ostrel::reporting
