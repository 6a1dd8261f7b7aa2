#pragma once

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>

#include "platform/Value.h"
#include "platform/linux/Limits.h"
#include "platform/linux/LoopWaker.h"
#include "platform/linux/RequestBudget.h"
#include "platform/linux/UserAccount.h"
#include "platform/linux/wire/Frame.h"

namespace ostrel {

/// The part of a connection that other threads reach, and that may outlive it: the
/// replies that are to be written, and the account of what its requests cost until
/// they are carried out. Everything here may be called from any thread unless it says
/// that it is the loop's.
class PeerChannel final : public PayloadAccount {
 public:
  struct Limits {
    std::size_t queuedBytes;
    std::size_t unreadReplyBytes;
    /// What the connection may have under way whatever its user has: at least, and where
    /// its user has few.
    std::size_t reservedQueuedBytes = 0;
    std::size_t mostReservedBytes = 0;
  };

  /// Without `process` it is the only connection of its process.
  PeerChannel(LoopWaker::ConnectionID id, std::shared_ptr<LoopWaker> waker,
              std::shared_ptr<UserAccount> user, const Limits& limits,
              std::shared_ptr<ProcessAccount> process = nullptr);
  ~PeerChannel() override;

  /// Queues a reply; the loop writes it soon. Nothing once the connection has ended
  /// or has too many unread.
  void reply(wire::RequestNumber number, const wire::ReplyValue& value);

  std::int64_t user() const noexcept override { return user_->number(); }
  void charge(std::size_t bytes) noexcept override;
  void relieve(std::size_t bytes) noexcept override;
  bool keep(std::size_t bytes) noexcept override { return user_->keep(bytes); }
  void discard(std::size_t bytes) noexcept override { user_->discard(bytes); }
  std::shared_ptr<PayloadAccount> accountOfKept() noexcept override {
    return UserAccount::accountOfKept(user_);
  }
  bool mayMerge(const Merged& then) noexcept override;
  std::shared_ptr<PayloadAccount> accountOfMerged() noexcept override {
    return user_->accountOfInfos();
  }
  /// Whether `mayMerge` said no since the last call.
  bool takeRefusedMerge() noexcept {
    return hasRefusedMerge_.load(std::memory_order_relaxed) &&
           hasRefusedMerge_.exchange(false);
  }

  /// The loop's: one more session of the client's user. False: it has as many as it
  /// may have, or the service has.
  bool takeSession() noexcept { return user_->takeSession(); }
  void giveSessions(std::size_t count) noexcept { user_->giveSessions(count); }
  /// Of all users.
  std::size_t sessionsOfAll() const { return user_->sessionsOfAll(); }

  /// The loop's: whether a request of this cost has to wait for another of the user's. A
  /// large one, beyond `mostReservedBytes`, does where the user has too much under way;
  /// then the connection is over its budget until that one is done.
  bool mustWaitForLarge(std::size_t cost) noexcept {
    isLarge_ = cost > mostReservedBytes_;
    return mustWaitForLarge() && user_->queued().isExceeded();
  }
  /// The loop's: a large request is under way, and charged.
  void noteLarge() noexcept;

  /// The loop's: a request without a payload of its own costs `bytes` until a
  /// request up to the mark returned, or a later one, has run.
  std::uint64_t chargeRequest(std::size_t bytes);
  /// All requests up to `mark` have run, since requests run in their order.
  void requestsRan(std::uint64_t mark) noexcept;

  // The loop's. `uncharged`: what is to be charged soon.
  bool isOverBudget(std::size_t uncharged = 0) const {
    return own_.isExceededWith(uncharged) ||
           ((isBeyondReserve(uncharged) || mustWaitForLarge()) &&
            user_->queued().isExceededWith(uncharged));
  }
  /// Whether the user's clients have all under way that they may.
  bool isUserOverBudget() const { return user_->queued().isExceeded(); }
  /// Asks for `LoopWaker::budgetEased` once there is room; false: there is already.
  bool awaitBudget();
  /// How much may wait now: less while much waits for the user's other clients.
  std::size_t mostUnreadBytes() const {
    return user_->hasManyUnread()
               ? std::min(limits::kUnreadReplyBytesInNeed, unreadReplyBytes_)
               : unreadReplyBytes_;
  }
  /// What is waiting for its reader.
  std::size_t unreadBytes() const { return unread_.load(std::memory_order_relaxed); }
  /// Whether more waits than the client may leave unread.
  bool hasTooManyUnread() const;
  /// Writes what waits to the socket as far as that takes it. False when the peer
  /// cannot be written to any more.
  bool flush(int socket);
  /// Adds a last frame. Nothing can be added after it.
  void close(std::string_view reason);
  void close();

  /// The size of the client's last reply with IDs: what the next will cost.
  std::size_t idsReplyBytes() const { return idsReplyBytes_.load(); }

 private:
  bool isBeyondReserve(std::size_t uncharged = 0) const {
    const std::size_t used = own_.used() + uncharged;
    return used > reservedQueuedBytes_ &&
           used > process_->reservedQueuedBytes(reservedQueuedBytes_, mostReservedBytes_);
  }
  bool mustWaitForLarge() const { return isLarge_ && user_->hasLargeRequest(); }
  void updateUnread();

  const LoopWaker::ConnectionID id_;
  const std::shared_ptr<LoopWaker> waker_;
  const std::shared_ptr<UserAccount> user_;
  const std::shared_ptr<ProcessAccount> process_;
  const std::size_t unreadReplyBytes_;
  const std::size_t reservedQueuedBytes_;
  const std::size_t mostReservedBytes_;

  std::atomic<bool> hasRefusedMerge_{false};
  RequestBudget own_;
  std::atomic<bool> awaitsReserve_{false};
  bool isLarge_ = false;  // The loop's: of the request that comes next, or came last.
  std::atomic<bool> hasLarge_{false};
  std::uint64_t chargedMark_ = 0;  // The loop's.
  std::atomic<std::uint64_t> ranMark_{0};
  std::atomic<std::size_t> idsReplyBytes_;
  // Of `out_`; written under the lock, asked for before each request without it.
  std::atomic<std::size_t> unread_{0};

  mutable std::mutex mutex_;
  // Guarded by `mutex_`.
  std::string out_;
  std::size_t written_ = 0;  // Of `out_`.
  bool isAnnounced_ = false;
  bool hasTooManyUnread_ = false;
  bool isClosed_ = false;
};

}  // namespace ostrel
