#pragma once

#include <csignal>

#include "platform/linux/FileDescriptor.h"

namespace ostrel {

/// Turns SIGTERM and SIGINT into a readable descriptor, whichever thread they reach,
/// for as long as this lives. At most one at a time.
class TerminationSignals {
 public:
  TerminationSignals();
  ~TerminationSignals();
  TerminationSignals(const TerminationSignals&) = delete;
  TerminationSignals& operator=(const TerminationSignals&) = delete;

  /// Readable, and stays so, once a signal came.
  int descriptor() const { return event_.get(); }

  /// As if a signal had come. Any thread.
  void raise();

 private:
  FileDescriptor event_;
  struct sigaction oldTerm_ {};
  struct sigaction oldInterrupt_ {};
};

}  // namespace ostrel
