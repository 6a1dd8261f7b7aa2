#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Outcome.h"
#include "platform/Value.h"

namespace ostrel {

// Keys of session info and user info.
inline constexpr std::string_view kTelvarSessionInfoClientType =
    "kTelvarSessionInfoClientType";
inline constexpr std::string_view kTelvarSessionInfoClientVersion =
    "kTelvarSessionInfoClientVersion";
inline constexpr std::string_view kTelvarSessionInfoSessionID =
    "kTelvarSessionInfoSessionID";
inline constexpr std::string_view kTelvarSessionInfoBatchEvent =
    "kTelvarSessionInfoBatchEvent";
inline constexpr std::string_view kTelvarSessionInfoHierarchyToken =
    "kTelvarSessionInfoHierarchyToken";
inline constexpr std::string_view kTelvarUserInfoClientName = "kTelvarUserInfoClientName";
inline constexpr std::string_view kTelvarUserInfoServiceName =
    "kTelvarUserInfoServiceName";

/// Places a session in a tree of sessions: a W3C `traceparent` text.
using HierarchyToken = std::string;

/// One live session of the backend. Releasing the last reference ends it. All
/// operations from any thread; none blocks on the disk or the network.
class TelemetrySession {
 public:
  /// The backends that were found, or none when there are none. An empty list
  /// is a list.
  using BackendsCallback = std::function<void(std::optional<Array> backends)>;
  using FlushCallback = std::function<void(std::optional<ErrorObject> error)>;

  virtual ~TelemetrySession() = default;

  /// Looks for backends and calls `completion` at most once, on any thread,
  /// possibly before this returns, and never after the session was released.
  virtual void startConfiguration(BackendsCallback completion) = 0;

  virtual Success sendMessage(std::uint16_t category, std::uint16_t type,
                              const Dictionary& payload) = 0;

  /// Makes everything that was sent durable, then calls `completion` once on
  /// any thread. The caller may release the session at once.
  virtual void flush(FlushCallback completion) = 0;

  /// One line that names the session in the log.
  virtual std::string description() const = 0;
};

class TelemetryBackend {
 public:
  virtual ~TelemetryBackend() = default;

  /// A new token below `parent`; no parent makes a root.
  virtual HierarchyToken makeHierarchyToken(
      const std::optional<HierarchyToken>& parent) = 0;

  /// Never none. `frameworksToCheck` is empty in this service.
  virtual std::shared_ptr<TelemetrySession> createSession(
      const Dictionary& sessionInfo, const Dictionary& userInfo,
      const std::vector<std::string>& frameworksToCheck) = 0;

  /// Sends one message that belongs to no session.
  virtual Success sendOneMessage(const Dictionary& sessionInfo,
                                 const Dictionary& userInfo, std::uint16_t category,
                                 std::uint16_t type, const Dictionary& payload) = 0;
};

}  // namespace ostrel
