#pragma once

#include <chrono>
#include <cstdint>
#include <string>
#include <thread>
#include <vector>

#include "benchmarks/wholepath/ServiceProcess.h"
#include "ostrel/OstrelReportingClient.h"

namespace ostrel::bench {

/// A client of the public library under load: where its queue is full it waits and
/// tries again, so that nothing is dropped.
class ServiceClient {
 public:
  explicit ServiceClient(const std::string& socketPath);

  reporting::Client& client() { return client_; }

  /// Calls `submission` until the request is queued.
  template <typename Submit>
  void submit(const Submit& submission) {
    using reporting::Submission;
    Submission result = submission();
    while (result == Submission::kQueueFull) {
      std::this_thread::sleep_for(kQueuePause);
      result = submission();
    }
    if (result != Submission::kQueued) fail("a request was refused by the library");
  }

  /// Makes, types and starts sessions `first`, `first` + 1, ...
  void startSessions(std::int64_t first, std::int64_t count);

  /// Queues `count` example messages to the one session, or to each in turn of
  /// `sessions` sessions from `first` on.
  void send(std::uint64_t count, std::int64_t first, std::int64_t sessions = 1);

  /// Waits until the service has served all requests of this client so far; what
  /// they put on sessions' queues may still be under way.
  void waitUntilServed();

 private:
  static constexpr std::chrono::microseconds kQueuePause{100};

  reporting::Message payload_;
  reporting::Client client_;
};

/// Sends to a counting service and waits until it delivered everything. Messages a
/// second, and processor nanoseconds a message of both processes.
struct DeliveryResult {
  double messagesPerSecond = 0;
  double processorNanoseconds = 0;
};
DeliveryResult deliver(ServiceProcess& service, std::uint64_t messages,
                       const std::function<void()>& send);

}  // namespace ostrel::bench
