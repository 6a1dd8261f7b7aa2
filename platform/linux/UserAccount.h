#pragma once

#include <algorithm>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <utility>

#include "platform/ValueBuffer.h"
#include "platform/linux/FairLine.h"
#include "platform/linux/Limits.h"
#include "platform/linux/MemoryOfAll.h"
#include "platform/linux/RequestBudget.h"
#include "platform/linux/Share.h"

namespace ostrel {

/// What all users of the service may have together.
struct ServiceAccount {
  Share sessions;
  // Sessions' threads write it, and the thread that reads looks at the others with each
  // request.
  alignas(64) Share keptBytes;
  alignas(64) MemoryOfAll memory = MemoryOfAll();
};

/// Bears the user infos of sessions, which live as long as these. Any thread.
class UserInfos final : public PayloadAccount,
                        public std::enable_shared_from_this<UserInfos> {
 public:
  explicit UserInfos(std::size_t mostBytes) : mostBytes_(mostBytes) {}

  void charge(std::size_t bytes) noexcept override { bytes_ += bytes; }
  void relieve(std::size_t bytes) noexcept override { bytes_ -= bytes; }
  /// They are no entries of lists.
  bool keep(std::size_t) noexcept override { return true; }
  void discard(std::size_t) noexcept override {}
  /// For the copy that a telemetry session gets.
  std::shared_ptr<PayloadAccount> accountOfMerged() noexcept override {
    return shared_from_this();
  }

  bool hasRoomFor(std::size_t bytes) const noexcept {
    const std::size_t used = bytes_.load();
    return bytes <= mostBytes_ && used <= mostBytes_ - bytes;
  }
  std::size_t bytes() const { return bytes_.load(); }

 private:
  const std::size_t mostBytes_;
  std::atomic<std::size_t> bytes_{0};
};

class UserAccount;

/// Bears what sessions' lists keep for a user's clients, which may be gone. Any thread.
class KeptLists final : public PayloadAccount {
 public:
  explicit KeptLists(UserAccount& user) : user_(user) {}

  std::int64_t user() const noexcept override;
  void charge(std::size_t) noexcept override {}
  void relieve(std::size_t) noexcept override {}
  bool keep(std::size_t bytes) noexcept override;
  void discard(std::size_t bytes) noexcept override;

 private:
  UserAccount& user_;
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
    std::size_t userInfoBytes = limits::kUserInfoBytesOfUser;
    std::size_t halfFrameBytes = limits::kHalfFrameBytesOfUser;
    std::size_t memory = limits::kMemoryBytesOfUser;
    std::size_t reservedQueuedBytes = limits::kReservedQueuedBytesOfUser;
    std::size_t sessionsInNeed = limits::kSessionsInNeed;
    std::size_t memoryBesideSessions = limits::kMemoryBytesBesideSessions;
  };

  /// `number` is the user's; of nobody in tests.
  UserAccount(const Limits& limits, std::shared_ptr<ServiceAccount> service,
              std::int64_t number = PayloadAccount::kNobody)
      : number_(number),
        memoryLimits_{limits.queuedBytes, limits.unreadBytes, limits.halfFrameBytes,
                      limits.userInfoBytes, limits.memory},
        reservedQueuedBytes_(limits.reservedQueuedBytes),
        sessionsInNeed_(limits.sessionsInNeed),
        memoryBesideSessions_(limits.memoryBesideSessions),
        queued_(limits.queuedBytes),
        userInfos_(std::make_shared<UserInfos>(limits.userInfoBytes)),
        service_(std::move(service)),
        sessions_(limits.sessions),
        keptBytes_(limits.keptBytes) {}

  std::int64_t number() const { return number_; }

  /// Bytes of requests that are accepted and not yet carried out.
  RequestBudget& queued() { return queued_; }

  /// How many processes have anything of that, and what of it each of them may have when
  /// the others have it all.
  void addBusyProcess() noexcept { ++busyProcesses_; }
  void removeBusyProcess() noexcept { --busyProcesses_; }
  std::size_t reservedQueuedBytes() const {
    return reservedQueuedBytes_ / std::max<std::size_t>(busyProcesses_, 1);
  }

  /// How many connections have a large request under way.
  void addLargeRequest() noexcept { ++largeRequests_; }
  void removeLargeRequest() noexcept { --largeRequests_; }
  bool hasLargeRequest() const { return largeRequests_ != 0; }

  /// One more session. False: there are as many as the user or the service may have, or
  /// as the user may have where its clients have much else in memory.
  bool takeSession() noexcept {
    if (sessions_.used() >= sessionsInNeed_ &&
        memoryBesideSessions() > memoryBesideSessions_) {
      return false;
    }
    return takeBoth(sessions_, service_->sessions, 1);
  }
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

  /// The one that does so for `user` when its connections are gone.
  static std::shared_ptr<PayloadAccount> accountOfKept(
      const std::shared_ptr<UserAccount>& user) {
    return {user, &user->keptLists_};
  }

  /// Reply bytes wait for their readers that did not, or the other way round.
  void changeUnread(std::size_t before, std::size_t now) noexcept {
    unreadBytes_ += now - before;
  }
  bool hasManyUnread() const {
    const std::size_t unread = unreadBytes_;
    return unread != 0 && unread > most(MemoryKind::kUnread);
  }

  /// Whether its clients may leave so much unread though they have more than their share.
  bool mayLeaveUntaken(std::size_t bytes) const {
    return bytes - bytes / 2 <= most(MemoryKind::kUnread);
  }

  /// Bytes of frames that are not whole, likewise.
  void changeHalfFrames(std::size_t before, std::size_t now) noexcept {
    halfFrameBytes_ += now - before;
  }
  std::size_t halfFrameBytes() const { return halfFrameBytes_; }
  bool hasManyHalfFrames() const {
    return halfFrameBytes_ > most(MemoryKind::kHalfFrames);
  }

  /// Whether a user info may grow by so much.
  bool hasRoomForInfo(std::size_t bytes) const {
    return userInfos_->hasRoomFor(bytes) &&
           userInfos_->bytes() + bytes <= most(MemoryKind::kUserInfos);
  }

  /// What all that takes in memory, roughly, and whether that is too much: then each
  /// kind has only a part of its share until it is not.
  std::size_t memory() const {
    return memoryBesideSessions() + sessions_.used() * limits::kSessionBytes;
  }
  bool isCrowded() const {
    constexpr auto kAll = static_cast<std::size_t>(MemoryKind::kAll);
    return memory() >
           std::min(memoryLimits_[kAll], service_->memory.mostOfUser(MemoryKind::kAll));
  }
  MemoryUse memoryUse() const {
    return {queued_.used(), unreadBytes_, halfFrameBytes_, userInfos_->bytes(), memory()};
  }

  /// Brings the share of what is queued in line with that. True: somebody who waits for
  /// it is to be told.
  bool adapt() noexcept { return queued_.limitTo(most(MemoryKind::kQueued)); }

  /// Whether anything of the user's is left: nobody but who asks holds the account, so
  /// that nothing can be added either.
  bool isIdle() const {
    return queued_.used() == 0 && unreadBytes_ == 0 && halfFrameBytes_ == 0 &&
           busyProcesses_ == 0 && largeRequests_ == 0 && sessions_.used() == 0 &&
           keptBytes_.used() == 0 && userInfos_.use_count() == 1;
  }

  /// Who bears the user infos of sessions.
  std::shared_ptr<PayloadAccount> accountOfInfos() const { return userInfos_; }

  std::size_t sessions() const { return sessions_.used(); }
  std::size_t sessionsOfAll() const { return service_->sessions.used(); }
  std::size_t keptBytes() const { return keptBytes_.used(); }

 private:
  std::size_t memoryBesideSessions() const {
    return queued_.used() + unreadBytes_ + halfFrameBytes_ + userInfos_->bytes();
  }

  // Of its shares, in the order of the kinds. Whoever sends a large frame slowly is not
  // to be taken for one who hoards them.
  static constexpr std::array<std::size_t, kMemoryKinds> kPartsWhenCrowded = {4, 8, 2, 8,
                                                                              1};

  // What it may have of a kind now.
  std::size_t most(MemoryKind kind) const {
    const auto index = static_cast<std::size_t>(kind);
    const std::size_t own = isCrowded() ? memoryLimits_[index] / kPartsWhenCrowded[index]
                                        : memoryLimits_[index];
    return std::min(own, service_->memory.mostOfUser(kind));
  }

  static bool takeBoth(Share& own, Share& all, std::size_t amount) noexcept {
    if (!own.take(amount)) return false;
    if (all.take(amount)) return true;
    // Whoever has little need not know that others have it all.
    if (own.used() <= all.most() / limits::kUsersInReserve) {
      all.takeAnyway(amount);
      return true;
    }
    own.give(amount);
    return false;
  }
  static void giveBoth(Share& own, Share& all, std::size_t amount) noexcept {
    own.give(amount);
    all.give(amount);
  }

  const std::int64_t number_;
  const MemoryUse memoryLimits_;
  const std::size_t reservedQueuedBytes_;
  const std::size_t sessionsInNeed_;
  const std::size_t memoryBesideSessions_;
  RequestBudget queued_;
  std::atomic<std::size_t> busyProcesses_{0};
  std::atomic<std::size_t> largeRequests_{0};
  std::atomic<std::size_t> unreadBytes_{0};
  std::atomic<std::size_t> halfFrameBytes_{0};
  const std::shared_ptr<UserInfos> userInfos_;
  KeptLists keptLists_{*this};
  const std::shared_ptr<ServiceAccount> service_;
  Share sessions_;
  // On a line of the cache of its own: sessions' threads write it, and the thread that
  // reads looks at the others with each message.
  alignas(64) Share keptBytes_;
};

inline std::int64_t KeptLists::user() const noexcept { return user_.number(); }
inline bool KeptLists::keep(std::size_t bytes) noexcept { return user_.keep(bytes); }
inline void KeptLists::discard(std::size_t bytes) noexcept { user_.discard(bytes); }

/// What the connections of one process have in common: many of them have no more of what
/// is reserved than one, and no more turns where they ask for little. Any thread, unless
/// it says otherwise.
class ProcessAccount {
 public:
  explicit ProcessAccount(std::shared_ptr<UserAccount> user) : user_(std::move(user)) {}

  /// One more or less of its connections has requests under way.
  void addBusyConnection() noexcept {
    if (busyConnections_++ == 0) user_->addBusyProcess();
  }
  void removeBusyConnection() noexcept {
    if (--busyConnections_ == 0) user_->removeBusyProcess();
  }

  /// What each of these may have under way when the user's others have all.
  std::size_t reservedQueuedBytes(std::size_t least, std::size_t most) const {
    return std::clamp(
        user_->reservedQueuedBytes() / std::max<std::size_t>(busyConnections_, 1), least,
        most);
  }

  /// Of its connections' frames that are not whole.
  void changeHalfFrames(std::size_t before, std::size_t now) noexcept {
    halfFrameBytes_ += now - before;
    user_->changeHalfFrames(before, now);
  }
  std::size_t halfFrameBytes() const { return halfFrameBytes_; }

  /// Of its connections in the listener's line. The listener's thread.
  FairLine::Group& group() { return group_; }

 private:
  const std::shared_ptr<UserAccount> user_;
  FairLine::Group group_;
  std::atomic<std::size_t> busyConnections_{0};
  std::atomic<std::size_t> halfFrameBytes_{0};
};

}  // namespace ostrel
