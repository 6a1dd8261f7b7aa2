#pragma once

#include <chrono>
#include <deque>
#include <map>
#include <optional>
#include <variant>
#include <vector>

#include "ostrel/Reply.h"
#include "platform/linux/wire/Frame.h"

namespace ostrel::reporting {

/// What is to be called with a reply, by the kind of its value.
using Handler =
    std::variant<std::monostate, OnReply<bool>::Handler, OnReply<ServiceType>::Handler,
                 OnReply<void>::Handler, OnReply<ReporterValidity>::Handler,
                 OnReply<ReporterIDs>::Handler>;

/// Calls `handler` with an end that carries no value; drops what it throws.
void callHandler(const Handler& handler, Status status) noexcept;

/// Calls `handler` with the service's value. False, without a call, when the
/// value is of another kind.
bool callHandler(const Handler& handler, wire::ReplyValue& value) noexcept;

/// The requests that wait for their replies. Not safe for threads.
class PendingRequests {
 public:
  using TimePoint = std::chrono::steady_clock::time_point;

  /// Whether a request has one reply at most, or may have more.
  enum class Replies { kOne, kTwo, kMany };

  wire::RequestNumber nextNumber() const { return nextNumber_; }

  /// Adds the request `nextNumber()`. `deadline` may be `TimePoint::max()`.
  void add(wire::Operation operation, Handler&& handler, Replies replies,
           TimePoint deadline);

  struct Answered {
    /// None for a number that was never given. A request that is over and no longer
    /// known counts as `kFarewell`.
    std::optional<wire::Operation> operation;
    Handler handler;       // What to call with the reply.
    bool isFirst = false;  // The handler has not been called yet.
  };

  /// Finds the request `number`, to which there is a reply; it is over with its last
  /// one. `answered` is as new.
  void takeForReply(wire::RequestNumber number, Answered& answered);

  /// At the first moment when a deadline may have passed.
  TimePoint nextDeadline() const { return nextDeadline_; }

  /// Ends the requests whose time is over. Those that may be replied again are
  /// still known.
  std::vector<Handler> takeExpired(TimePoint now);

  /// Forgets all requests; what is returned has not ended yet.
  std::vector<Handler> takeAll();

 private:
  struct Entry {
    wire::Operation operation = wire::Operation::kFarewell;
    Handler handler;
    TimePoint deadline;
    unsigned repliesLeft = 0;  // 0: over.
    bool hasEnded = false;     // Its handler has been called.
  };

  Entry* find(wire::RequestNumber number);
  void trim();

  // Requests with one reply and a deadline stand in a row; the others, which
  // may stay long, by number.
  wire::RequestNumber nextNumber_ = 1;
  wire::RequestNumber firstNumber_ = 1;
  std::deque<Entry> row_;
  std::map<wire::RequestNumber, Entry> longLived_;
  TimePoint nextDeadline_ = TimePoint::max();
};

}  // namespace ostrel::reporting
