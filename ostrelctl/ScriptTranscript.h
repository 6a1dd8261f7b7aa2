#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <map>
#include <mutex>
#include <ostream>
#include <string>

#include "ostrelctl/ToolClock.h"

namespace ostrel {

/// What a script printed, and which of its requests are still to be answered.
/// Every operation may be called from any thread; every line is flushed.
class ScriptTranscript {
 public:
  /// One opening of a connection.
  using ConnectionNumber = std::uint64_t;

  /// `out` and `clock` outlive the transcript.
  ScriptTranscript(std::ostream& out, ToolClock& clock) : out_(out), clock_(clock) {}

  void connectionOpened(ConnectionNumber connection);
  /// The script ended the connection: its requests no longer hold a wait.
  void connectionEnded(ConnectionNumber connection);
  /// The service ended it: the same, and a line.
  void connectionClosed(ConnectionNumber connection, const std::string& client,
                        const std::string& reason);
  bool isOpen(ConnectionNumber connection) const;

  /// `line` is about to be sent. Comes before its first answer.
  void requestSent(std::uint64_t line, const std::string& client,
                   const std::string& operation, ConnectionNumber connection);
  /// Prints the reply that `member` holds. A request may be answered again.
  void requestAnswered(std::uint64_t line, const std::string& client,
                       const std::string& operation, const std::string& member);

  /// Until no request of an open connection lacks its first answer.
  void wait(std::chrono::nanoseconds longest);

  /// Prints the requests that got no reply, in the order of their lines.
  void printUnanswered();

 private:
  struct Unanswered {
    std::string client;
    std::string operation;
    ConnectionNumber connection;
  };

  void print(const std::string& line);
  void end(ConnectionNumber connection);

  std::ostream& out_;  // Written with the lock held.
  ToolClock& clock_;

  mutable std::mutex mutex_;  // Protects all that follows.
  std::condition_variable changed_;
  std::map<std::uint64_t, Unanswered> unanswered_;  // By line.
  // Of open connections: how many of their requests lack an answer.
  std::map<ConnectionNumber, std::size_t> open_;
};

}  // namespace ostrel
