// How requests end, and who hears of it.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <type_traits>
#include <utility>

#include "ostrel/Message.h"

namespace ostrel::reporting {

/// How a request ended.
enum class Status {
  kReplied = 0,
  kRefused = 1,         // The service answered with an error.
  kTimedOut = 2,        // No reply within the request's time.
  kConnectionLost = 3,  // The service went away; it may have heard the request.
  kClosed = 4,          // The client was closed first.
};

/// What became of a call. A request that is not queued is never answered; it is
/// counted in `Counts::droppedRequests`.
enum class Submission {
  kQueued = 0,
  kQueueFull = 1,  // `Options::queueBytes` wait already.
  kInvalid = 2,    // The service would refuse it: see `Collection::isValid`.
  kClosed = 3,     // Closed, or in a child made by fork.
};

/// What the service said of itself: where the code belongs, the code, and a
/// sentence for people.
struct ServiceError {
  std::string domain;
  std::int64_t code = 0;
  std::string description;
};

struct ReplyStatus {
  Status status = Status::kReplied;
  ServiceError error{};  // When refused.
  explicit operator bool() const { return status == Status::kReplied; }
};

/// The answer to a request. The value counts when the status is `kReplied`.
template <typename T>
struct Reply : ReplyStatus {
  T value{};
};
template <>
struct Reply<void> : ReplyStatus {};

/// What is to happen with the answer: a function that takes `const Reply<T>&`,
/// or nothing, which asks the service for no answer.
///
/// Handlers run on the client's own thread, one at a time; they may call the
/// client, should not wait, and what they throw is dropped. Every request with a
/// handler ends exactly once, at the latest when its time is over, on a loss of
/// the service, or in `close`. Two requests may be answered again after that,
/// until the connection is lost: a start (at each stop of the session, in time
/// or not) and a question for the type of ID 0 (twice).
template <typename T>
class OnReply {
 public:
  using Handler = std::function<void(const Reply<T>&)>;

  OnReply() = default;
  /// Waits `Options::replyTimeout`.
  template <typename F,
            std::enable_if_t<std::is_invocable_v<F&, const Reply<T>&>, int> = 0>
  OnReply(F toCall) : handler(std::move(toCall)) {}
  /// Waits `timeout`; 0 waits for ever.
  OnReply(Handler toCall, std::chrono::milliseconds toWait)
      : handler(std::move(toCall)), timeout(toWait) {}

  Handler handler;
  std::optional<std::chrono::milliseconds> timeout;
};

/// The entry of the service that a session has: 0 and `kServiceTypeUnknown` when
/// there is none.
struct ReporterValidity {
  ReporterID reporterID{0};
  ServiceType serviceType = kServiceTypeUnknown;
};

}  // namespace ostrel::reporting
