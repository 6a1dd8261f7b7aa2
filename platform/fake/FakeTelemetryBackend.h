#pragma once

#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/TelemetryBackend.h"
#include "platform/fake/EventLog.h"

namespace ostrel {

struct FakeTelemetryMessage {
  std::uint16_t category;
  std::uint16_t type;
  Dictionary payload;
};

/// How the fake answers `startConfiguration`.
struct FakeDiscovery {
  enum class When {
    kHeld,    // When the test calls `answerDiscovery`, or never.
    kInline,  // Before `startConfiguration` returns.
  };
  When when = When::kInline;
  /// None: no backends. Used by an inline answer.
  std::optional<Array> backends;
  /// 2 breaks the promise of one answer.
  int times = 1;

  static FakeDiscovery held() { return {When::kHeld, std::nullopt, /*times=*/1}; }
  static FakeDiscovery none() { return {When::kInline, std::nullopt, /*times=*/1}; }
  static FakeDiscovery emptyList() { return {When::kInline, Array(), /*times=*/1}; }
  /// Answers at once with the list ["embedded"].
  static FakeDiscovery found();
  static FakeDiscovery foundTwice();
};

/// How the fake answers `flush`.
struct FakeFlush {
  bool isHeld = false;               // Until the test calls `answerFlush`.
  std::optional<ErrorObject> error;  // Of an answer at once.
};

/// One session of the fake, seen by the test. It outlives the handle.
class FakeTelemetrySession {
 public:
  /// Counts from 1 in the order of making.
  int number() const { return number_; }
  const Dictionary& sessionInfo() const { return sessionInfo_; }
  const Dictionary& userInfo() const { return userInfo_; }
  const std::vector<std::string>& frameworksToCheck() const { return frameworks_; }

  std::vector<FakeTelemetryMessage> messages() const;
  std::size_t flushCount() const;
  /// Whether the last handle is gone.
  bool isReleased() const;
  /// Whether `startConfiguration` was called and a held answer is due.
  bool isDiscovering() const;

  /// Gives a held answer on the calling thread. As the backend promises, a
  /// released session gets none: this is then nothing. May be called again.
  void answerDiscovery(std::optional<Array> backends);
  /// As `answerDiscovery`, but also after the release: a backend that breaks
  /// its promise.
  void answerDiscoveryDespiteRelease(std::optional<Array> backends);
  /// Drops the completion, answered or not, and all that it holds.
  void forgetDiscovery();
  /// Whether a held flush is due.
  bool hasHeldFlush() const;
  /// Completes the oldest held flush on the calling thread; there must be one.
  void answerFlush(std::optional<ErrorObject> error);

 private:
  friend class FakeTelemetryBackend;
  friend class FakeTelemetrySessionHandle;

  int number_ = 0;
  Dictionary sessionInfo_;
  Dictionary userInfo_;
  std::vector<std::string> frameworks_;

  mutable std::mutex mutex_;
  std::vector<FakeTelemetryMessage> messages_;
  TelemetrySession::BackendsCallback discovery_;
  std::deque<TelemetrySession::FlushCallback> flushes_;
  std::size_t flushCount_ = 0;
  bool isReleased_ = false;
};

/// A backend that keeps what it is given. Finds the backend "embedded" at once
/// and takes every message, unless told otherwise. Any thread.
///
/// Events, N being the session's number: "backend.makeHierarchyToken",
/// "backend.createSession N", "backend.startConfiguration N",
/// "backend.sendMessage N CATEGORY TYPE", "backend.flush N",
/// "backend.release N", "backend.sendOneMessage CATEGORY TYPE". Their arguments are the
/// dictionaries, in the order of the call.
class FakeTelemetryBackend final : public TelemetryBackend {
 public:
  struct SingleMessage {
    Dictionary sessionInfo;
    Dictionary userInfo;
    std::uint16_t category;
    std::uint16_t type;
    Dictionary payload;
  };

  explicit FakeTelemetryBackend(SharedEventLog events);

  /// "token-1", "token-2" and so on; below a parent "PARENT/token-N".
  HierarchyToken makeHierarchyToken(const std::optional<HierarchyToken>& parent) override;
  std::shared_ptr<TelemetrySession> createSession(
      const Dictionary& sessionInfo, const Dictionary& userInfo,
      const std::vector<std::string>& frameworksToCheck) override;
  Success sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo,
                         std::uint16_t category, std::uint16_t type,
                         const Dictionary& payload) override;

  /// For every session configured from now on.
  void setDiscovery(FakeDiscovery discovery);
  void setFlush(FakeFlush flush);
  /// The results of the next sends of sessions, in turn; then success.
  void scriptSend(Success result);
  /// The same for `sendOneMessage`.
  void scriptSendOne(Success result);
  /// Called in each session send, before it returns, on the sender's thread.
  void setOnSend(std::function<void(const FakeTelemetryMessage&)> action);

  std::size_t sessionCount() const;
  /// `number` counts from 1; ends the program when there is no such session.
  std::shared_ptr<FakeTelemetrySession> session(std::size_t number) const;
  std::shared_ptr<FakeTelemetrySession> lastSession() const;
  std::vector<SingleMessage> singleMessages() const;

  /// Drops held completions uncalled.
  void releaseCallbacks();

 private:
  friend class FakeTelemetrySessionHandle;
  struct Shared;

  const std::shared_ptr<Shared> shared_;
};

}  // namespace ostrel
