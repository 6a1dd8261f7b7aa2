#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/IPCListener.h"
#include "platform/fake/EventLog.h"

namespace ostrel {

/// A connection whose client is the test: it calls the operations of the
/// exported object and ends the connection. Events, PID being the client's:
/// "connection.resume PID", "connection.interrupted PID" and
/// "connection.invalidated PID", the latter two before the handler runs.
class FakeIPCConnection final : public IPCConnection {
 public:
  FakeIPCConnection(ProcessID pid, SharedEventLog events);

  ProcessID processIdentifier() const override { return pid_; }
  std::string description() const override;
  void setExportedObject(std::shared_ptr<OstrelReportingServiceProtocol> object) override;
  std::shared_ptr<OstrelReportingServiceProtocol> exportedObject() const override;
  void setInterruptionHandler(std::function<void()> handler) override;
  void setInvalidationHandler(std::function<void()> handler) override;
  void resume() override;

  bool isResumed() const;

  /// The client vanished: both handlers run here and now. The exported object
  /// is released after them.
  void interrupt();
  /// The client ended well.
  void invalidate();
  /// Runs the interruption handler alone: for tests of an odd order.
  void onlyInterrupt();

  void releaseCallbacks();

 private:
  const ProcessID pid_;
  const SharedEventLog events_;
  mutable std::mutex mutex_;
  std::shared_ptr<OstrelReportingServiceProtocol> object_;
  std::function<void()> onInterruption_;
  std::function<void()> onInvalidation_;
  bool isResumed_ = false;
  bool isInvalidated_ = false;
};

/// A listener whose clients connect when the test says so. Adds
/// "listener.resume" to the events; `resume` returns at once.
class FakeIPCListener final : public IPCListener {
 public:
  explicit FakeIPCListener(SharedEventLog events);

  void setDelegate(IPCListenerDelegate* delegate) override;
  void resume() override;

  IPCListenerDelegate* delegate() const;
  bool isResumed() const;

  /// A client with that id connects; the delegate, which must be set, is asked
  /// on the calling thread. None when it refuses.
  std::shared_ptr<FakeIPCConnection> accept(ProcessID pid);

  void releaseCallbacks();

 private:
  const SharedEventLog events_;
  mutable std::mutex mutex_;
  IPCListenerDelegate* delegate_ = nullptr;  // Outlives `resume`.
  bool isResumed_ = false;
  std::vector<std::weak_ptr<FakeIPCConnection>> connections_;
};

}  // namespace ostrel
