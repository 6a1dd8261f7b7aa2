#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

namespace ostrel {

class OstrelReportingServiceProtocol;

/// A process id as the kernel numbers it. 0 or below: not known here, such as
/// the id of a peer in another namespace.
using ProcessID = std::int32_t;

/// One client's connection. The handlers are set before `resume` and run on the
/// listener's thread.
class IPCConnection {
 public:
  virtual ~IPCConnection() = default;

  /// The client's process id when it connected.
  virtual ProcessID processIdentifier() const = 0;

  /// One line that names the connection in the log.
  virtual std::string description() const = 0;

  /// The object whose operations the client's requests call, on the listener's
  /// thread and in the order in which they arrived. The connection owns it
  /// until after its invalidation.
  virtual void setExportedObject(
      std::shared_ptr<OstrelReportingServiceProtocol> object) = 0;
  virtual std::shared_ptr<OstrelReportingServiceProtocol> exportedObject() const = 0;

  /// Called at most once, when the client vanished or broke the protocol;
  /// never when it ended well.
  virtual void setInterruptionHandler(std::function<void()> handler) = 0;

  /// Called exactly once, at every end of the connection, after the
  /// interruption handler if that runs.
  virtual void setInvalidationHandler(std::function<void()> handler) = 0;

  /// Begins to deliver requests.
  virtual void resume() = 0;
};

class IPCListener;

class IPCListenerDelegate {
 public:
  virtual ~IPCListenerDelegate() = default;

  /// A client connected. The delegate sets the connection up and resumes it.
  /// False refuses it.
  virtual bool listenerShouldAcceptNewConnection(
      IPCListener& listener, const std::shared_ptr<IPCConnection>& newConnection) = 0;
};

class IPCListener {
 public:
  virtual ~IPCListener() = default;

  /// The delegate must outlive the listener's `resume`.
  virtual void setDelegate(IPCListenerDelegate* delegate) = 0;

  /// Serves clients on the calling thread; returns only when the process is
  /// asked to end.
  virtual void resume() = 0;
};

}  // namespace ostrel
