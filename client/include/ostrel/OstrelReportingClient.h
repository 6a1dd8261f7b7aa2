// The client library of the reporting service.
//
//     ostrel::reporting::Client client;
//     const ReporterID session{4711};
//     client.createReportingSession(session);
//     client.setServiceType(ServiceType{1}, session);
//     client.startReportingSessionForID(session);
//     client.sendMessage({{"route", "Speaker"}}, Category{0x40000007},
//                        MessageType{0}, {{session}});
//
// Nothing here waits for the service, throws, or raises a signal in its host;
// only memory that runs out is thrown as `std::bad_alloc`.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "ostrel/AudioSender.h"
#include "ostrel/Message.h"
#include "ostrel/Reply.h"

namespace ostrel::reporting {

struct Options {
  /// Empty: `$OSTREL_REPORTING_SOCKET`, else "reporting.sock" in
  /// `$RUNTIME_DIRECTORY`, "/run/ostrel" (root) or `$XDG_RUNTIME_DIR`/ostrel.
  std::string socketPath;

  /// For requests that name no time of their own; 0 waits for ever.
  std::chrono::milliseconds replyTimeout{10'000};

  /// Bytes of requests that may wait for the service, while it is not there too.
  std::size_t queueBytes = 8 * 1024 * 1024;

  /// After a loss, makes this client's sessions anew before anything else is
  /// sent: create, type, configuration, and start where they were started.
  /// Nobody hears the replies to that.
  bool restoreSessions = false;

  /// The longest that `close` and the destructor take to hand over what waits.
  std::chrono::milliseconds closeTimeout{1'000};

  /// Called on the client's thread when the service is reached and when it is
  /// lost, with the reason. Attempts to reach it are made after 10 ms, then
  /// twice as long each time, up to 5 s.
  std::function<void(bool isConnected, const std::string& reason)> onConnection;
};

struct Counts {
  std::uint64_t droppedRequests = 0;  // Not queued, or lost with the service.
  std::uint64_t timedOutRequests = 0;
  std::uint64_t connections = 0;
};

/// A client of the reporting service. Reaches it in the background, and again
/// whenever it went away. All operations may be called from any thread and
/// return at once; requests of one thread are served in their order.
///
/// In a child made by fork the client does nothing and leaves the parent's
/// connection alone; a child makes a client of its own.
class OSTREL_PUBLIC Client {
 public:
  Client();
  explicit Client(Options options);
  /// `close`.
  ~Client();
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  /// Makes a session of this client's, in place of an earlier one of its own
  /// under the same ID. Replies true.
  Submission createReportingSession(ReporterID reporterID, OnReply<bool> reply = {});

  /// Replies true, whether or not there is such a session; never for ID 0.
  Submission setServiceType(ServiceType serviceType, ReporterID reporterID,
                            OnReply<bool> reply = {});

  /// Replies the type of anybody's session, or `kServiceTypeUnknown`.
  Submission getServiceNameForReporterID(ReporterID reporterID,
                                         OnReply<ServiceType> reply);

  /// Merges the entries into what the session tells the backend. Replies true.
  Submission setConfiguration(const Message& configuration, ReporterID reporterID,
                              OnReply<bool> reply = {});

  /// Starts anybody's session. Replies true when the session stops, each time
  /// it does; false at once when there is no such session; never when it is
  /// started already, nor for ID 0.
  Submission startReportingSessionForID(ReporterID reporterID, OnReply<bool> reply = {});

  /// Sends a message to the sessions named. None (not an empty list) sends it
  /// to all started sessions, or out by itself when there are none. The reply
  /// says that the service took it, or refused it while reporting is off.
  Submission sendMessage(const Message& message, Category category, MessageType type,
                         const std::optional<ReporterIDs>& reporterIDs,
                         OnReply<void> reply = {});

  /// Stops anybody's session. Replies true; never for ID 0.
  Submission stopReportingSessionForID(ReporterID reporterID, OnReply<bool> reply = {});

  /// Stops and drops a session of this client's. Replies true; never for ID 0.
  Submission destroyReportingSession(ReporterID reporterID, OnReply<bool> reply = {});

  /// Replies what is known of anybody's session.
  Submission reporterIDValid(ReporterID reporterID, OnReply<ReporterValidity> reply);

  /// Replies the IDs of all sessions of all clients.
  Submission getAllReporters(OnReply<ReporterIDs> reply);

  /// Ends the service process at once; never replied.
  Submission killService(OnReply<bool> reply = {});

  /// A sender for one audio thread, armed, with room for `ringBytes` of
  /// messages (rounded up to a power of two), looked into every `period`, 1 ms
  /// at least.
  AudioSender makeAudioSender(std::size_t ringBytes, std::chrono::microseconds period);

  /// Waits until the kernel has taken everything that was queued before, rings
  /// included. False when it has not in `timeout`, and on the client's own
  /// thread.
  bool flush(std::chrono::milliseconds timeout);

  /// Hands over what waits, says farewell and ends all open requests, within
  /// `Options::closeTimeout`; later calls return `kClosed`. No handler is called
  /// after it returns. One that is running then is waited for, 100 ms beyond
  /// that time at most, unless it is the one that `close` is called from.
  void close();

  bool isConnected() const;
  Counts counts() const;

 private:
  std::shared_ptr<ClientCore> core_;
};

}  // namespace ostrel::reporting
