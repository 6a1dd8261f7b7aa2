#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <utility>

#include "platform/linux/Limits.h"
#include "platform/linux/RequestBudget.h"
#include "platform/linux/Share.h"

namespace ostrel {

/// What all users of the service may have together.
struct ServiceAccount {
  Share sessions;
  Share keptBytes;
};

/// What one user's clients have under way and keep. Outlives the user's connections
/// as long as a session's list or a request of theirs is left. Any thread.
class UserAccount {
 public:
  struct Limits {
    std::size_t queuedBytes;
    std::size_t sessions;
    std::size_t keptBytes;
    std::size_t unreadBytes = limits::kUnreadReplyBytesOfUser;
  };

  UserAccount(std::uint32_t user, const Limits& limits,
              std::shared_ptr<ServiceAccount> service)
      : user_(user),
        queued_(limits.queuedBytes),
        mostUnreadBytes_(limits.unreadBytes),
        service_(std::move(service)),
        sessions_(limits.sessions),
        keptBytes_(limits.keptBytes) {}

  std::uint32_t user() const { return user_; }

  /// Bytes of requests that are accepted and not yet carried out.
  RequestBudget& queued() { return queued_; }

  /// One more session. False: there are as many as the user or the service may have.
  bool takeSession() noexcept { return takeBoth(sessions_, service_->sessions, 1); }
  void giveSessions(std::size_t count) noexcept {
    giveBoth(sessions_, service_->sessions, count);
  }

  /// Bytes that sessions keep in their lists.
  bool keep(std::size_t bytes) noexcept {
    return takeBoth(keptBytes_, service_->keptBytes, bytes);
  }
  void discard(std::size_t bytes) noexcept {
    giveBoth(keptBytes_, service_->keptBytes, bytes);
  }

  /// Reply bytes wait for their readers that did not, or the other way round.
  void changeUnread(std::size_t before, std::size_t now) noexcept {
    unreadBytes_ += now - before;
  }
  bool hasManyUnread() const { return unreadBytes_ > mostUnreadBytes_; }

  std::size_t sessions() const { return sessions_.used(); }
  std::size_t sessionsOfAll() const { return service_->sessions.used(); }
  std::size_t keptBytes() const { return keptBytes_.used(); }

 private:
  static bool takeBoth(Share& own, Share& all, std::size_t amount) noexcept {
    if (!own.take(amount)) return false;
    if (all.take(amount)) return true;
    own.give(amount);
    return false;
  }
  static void giveBoth(Share& own, Share& all, std::size_t amount) noexcept {
    own.give(amount);
    all.give(amount);
  }

  const std::uint32_t user_;
  RequestBudget queued_;
  const std::size_t mostUnreadBytes_;
  std::atomic<std::size_t> unreadBytes_{0};
  const std::shared_ptr<ServiceAccount> service_;
  // On a line of the cache of their own: sessions' threads write them, and the thread
  // that reads looks at the others with each message.
  alignas(64) Share sessions_;
  Share keptBytes_;
};

}  // namespace ostrel
