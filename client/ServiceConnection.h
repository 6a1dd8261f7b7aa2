#pragma once

#include <functional>
#include <memory>
#include <string>

#include "Statistics/Service/OstrelReportingServiceProtocol.h"
#include "platform/Outcome.h"

namespace ostrel {

/// The socket that clients use: `$OSTREL_REPORTING_SOCKET`, else the runtime
/// directory's "reporting.sock" (`$RUNTIME_DIRECTORY`, "/run/ostrel" for root,
/// `$XDG_RUNTIME_DIR` + "/ostrel").
std::string serviceSocketPath();

/// One connection to the service, and the proxy of its protocol over it. It
/// never reconnects. Operations may be called from any thread and never wait
/// for the service; replies and the closed handler run on the connection's own
/// thread, one at a time. A reply is kept until the connection ends, since a
/// request may be answered more than once.
class ServiceConnection : public OstrelReportingServiceProtocol {
 public:
  /// Connects, or says why not in a sentence with the socket's path.
  static Outcome<std::shared_ptr<ServiceConnection>> connect(
      const std::string& socketPath);

  /// Called once when the service ends the connection, with its reason, or
  /// when it vanishes; not after `close` or `abort`. Set before any request.
  virtual void setClosedHandler(std::function<void(std::string reason)>) = 0;

  /// Sends what is queued and says farewell; no reply comes after it returns.
  /// Waits for the service to read at most a few seconds.
  virtual void close() = 0;

  /// Drops the connection without a farewell; no reply comes after it returns.
  virtual void abort() = 0;
};

}  // namespace ostrel
