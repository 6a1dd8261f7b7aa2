#include "platform/fake/FakeIPCListener.h"

#include <utility>

#include "platform/fake/FakeUse.h"

namespace ostrel {

FakeIPCConnection::FakeIPCConnection(ProcessID pid, SharedEventLog events)
    : pid_(pid), events_(std::move(events)) {}

std::string FakeIPCConnection::description() const {
  return "connection from pid " + std::to_string(pid_);
}

void FakeIPCConnection::setExportedObject(
    std::shared_ptr<OstrelReportingServiceProtocol> object) {
  const std::lock_guard lock(mutex_);
  checkFakeUse(!isResumed_, "a connection is set up before it is resumed");
  std::swap(object_, object);
}

std::shared_ptr<OstrelReportingServiceProtocol> FakeIPCConnection::exportedObject()
    const {
  const std::lock_guard lock(mutex_);
  return object_;
}

void FakeIPCConnection::setInterruptionHandler(std::function<void()> handler) {
  const std::lock_guard lock(mutex_);
  checkFakeUse(!isResumed_, "a connection is set up before it is resumed");
  onInterruption_.swap(handler);
}

void FakeIPCConnection::setInvalidationHandler(std::function<void()> handler) {
  const std::lock_guard lock(mutex_);
  checkFakeUse(!isResumed_, "a connection is set up before it is resumed");
  onInvalidation_.swap(handler);
}

void FakeIPCConnection::resume() {
  events_->add("connection.resume " + std::to_string(pid_));
  const std::lock_guard lock(mutex_);
  checkFakeUse(!isResumed_, "a connection is resumed once");
  checkFakeUse(object_ != nullptr, "a connection exports an object");
  isResumed_ = true;
}

bool FakeIPCConnection::isResumed() const {
  const std::lock_guard lock(mutex_);
  return isResumed_;
}

void FakeIPCConnection::interrupt() {
  onlyInterrupt();
  invalidate();
}

void FakeIPCConnection::onlyInterrupt() {
  events_->add("connection.interrupted " + std::to_string(pid_));
  std::function<void()> handler;
  {
    const std::lock_guard lock(mutex_);
    checkFakeUse(!isInvalidated_, "an interruption comes before the invalidation");
    handler.swap(onInterruption_);
  }
  if (handler) handler();
}

void FakeIPCConnection::invalidate() {
  events_->add("connection.invalidated " + std::to_string(pid_));
  std::function<void()> handler;
  {
    const std::lock_guard lock(mutex_);
    checkFakeUse(!isInvalidated_, "a connection ends once");
    isInvalidated_ = true;
    handler.swap(onInvalidation_);
  }
  if (handler) handler();
  releaseCallbacks();
}

void FakeIPCConnection::releaseCallbacks() {
  std::shared_ptr<OstrelReportingServiceProtocol> object;  // End without the lock.
  std::function<void()> onInterruption;
  std::function<void()> onInvalidation;
  const std::lock_guard lock(mutex_);
  object.swap(object_);
  onInterruption.swap(onInterruption_);
  onInvalidation.swap(onInvalidation_);
}

FakeIPCListener::FakeIPCListener(SharedEventLog events) : events_(std::move(events)) {}

void FakeIPCListener::setDelegate(IPCListenerDelegate* delegate) {
  const std::lock_guard lock(mutex_);
  delegate_ = delegate;
}

void FakeIPCListener::resume() {
  events_->add("listener.resume");
  const std::lock_guard lock(mutex_);
  checkFakeUse(delegate_ != nullptr, "a listener has a delegate when it is resumed");
  isResumed_ = true;
}

IPCListenerDelegate* FakeIPCListener::delegate() const {
  const std::lock_guard lock(mutex_);
  return delegate_;
}

bool FakeIPCListener::isResumed() const {
  const std::lock_guard lock(mutex_);
  return isResumed_;
}

std::shared_ptr<FakeIPCConnection> FakeIPCListener::accept(ProcessID pid) {
  IPCListenerDelegate* const asked = delegate();
  checkFakeUse(asked != nullptr, "a listener has a delegate when clients connect");
  const auto connection = std::make_shared<FakeIPCConnection>(pid, events_);
  {
    const std::lock_guard lock(mutex_);
    connections_.push_back(connection);
  }
  if (!asked->listenerShouldAcceptNewConnection(*this, connection)) return nullptr;
  return connection;
}

void FakeIPCListener::releaseCallbacks() {
  std::vector<std::weak_ptr<FakeIPCConnection>> connections;
  {
    const std::lock_guard lock(mutex_);
    connections = connections_;
  }
  for (const auto& weak : connections) {
    if (const auto connection = weak.lock()) connection->releaseCallbacks();
  }
}

}  // namespace ostrel
