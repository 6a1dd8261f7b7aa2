// The two sides of the comparison, steered alike.
#pragma once

#include <array>
#include <cstddef>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "tests/model/Action.h"
#include "tests/model/Surroundings.h"

namespace ostrel {

/// A service with its surroundings and up to four clients. Every call that the service
/// makes and every reply that it gives stands in the events, in order, with arguments.
class Side {
 public:
  virtual ~Side() = default;

  /// Runs the action on the calling thread; nothing when it has no object, such as a
  /// request of a client that is not connected.
  void apply(const Action& action);

  /// What happened since, without the questions about the device.
  std::vector<std::string> takeEvents();
  /// The queues that can run a step; queues are numbered by their making.
  virtual std::vector<std::size_t> readyQueues() const = 0;
  virtual std::size_t backgroundCount() const = 0;
  std::size_t timerCount() const { return around.clock->timerCount(); }
  /// The session logs written, by path.
  std::map<std::string, std::string> files() const { return around.fileSystem->files(); }

  /// Ends every connection and lets go of what the surroundings still hold.
  void closeConnections();
  void releaseHeld();

 protected:
  Side(Surroundings surroundings, const Setup& setup);

  virtual void runStep(std::size_t queue, std::size_t position) = 0;
  virtual void postDefaults(bool isOwnToken) = 0;
  virtual void wakeSpuriously() = 0;
  virtual void setVerbose(const std::string& scope, bool isOn) = 0;
  void makeVerbose(const Setup& setup);

  Surroundings around;

 private:
  void connect(std::size_t slot, std::int64_t process);
  void endConnection(std::size_t slot, ActionKind how);
  void request(OstrelReportingServiceProtocol& client, const Action& action);
  void runChosenStep(std::size_t choice, std::size_t position);
  void steerBackend(const Action& action);
  void steerOthers(const Action& action);
  void steerDrivers(const Action& action);
  std::shared_ptr<FakeTelemetrySession> telemetrySession(std::int64_t fromLast) const;

  std::array<std::shared_ptr<FakeIPCConnection>, 4> connections_;
  int requests_ = 0;  // Replies are told by the request's number.
};

/// The service on the platform of fakes.
std::unique_ptr<Side> makeCoreSide(const Setup& setup);
std::unique_ptr<Side> makeReferenceSide(const Setup& setup);

}  // namespace ostrel
