#include "platform/linux/PeerChannel.h"

#include <sys/socket.h>

#include <cerrno>
#include <utility>

#include "platform/linux/Limits.h"

namespace ostrel {
namespace {

// What a client's first reply with IDs is taken to cost.
constexpr std::size_t kAssumedIDsReplyBytes = 16 * 1024;

// An empty buffer of this capacity is kept for the next replies.
constexpr std::size_t kKeptCapacity = 512;

// No more than a fourth of what waits is written already.
constexpr std::size_t kMostWrittenPart = 4;

}  // namespace

PeerChannel::PeerChannel(LoopWaker::ConnectionID id, std::shared_ptr<LoopWaker> waker,
                         std::shared_ptr<UserAccount> user, const Limits& limits,
                         std::shared_ptr<ProcessAccount> process)
    : id_(id),
      waker_(std::move(waker)),
      user_(std::move(user)),
      process_(process ? std::move(process) : std::make_shared<ProcessAccount>(user_)),
      unreadReplyBytes_(limits.unreadReplyBytes),
      reservedQueuedBytes_(limits.reservedQueuedBytes),
      mostReservedBytes_(limits.mostReservedBytes),
      own_(limits.queuedBytes),
      idsReplyBytes_(kAssumedIDsReplyBytes) {}

PeerChannel::~PeerChannel() {
  user_->changeUnread(unread_, /*now=*/0);
  // Whatever could tell that a request ran is gone.
  if (const std::size_t left = own_.used(); left != 0) relieve(left);
}

void PeerChannel::reply(wire::RequestNumber number, const wire::ReplyValue& value) {
  const std::lock_guard lock(mutex_);
  if (isClosed_ || hasTooManyUnread_) return;
  const std::size_t unread = out_.size() - written_;
  const std::size_t before = out_.size();
  wire::appendReply(out_, number, value);
  const std::size_t added = out_.size() - before;
  if (std::holds_alternative<ReporterIDs>(value)) idsReplyBytes_ = added;
  if (unread != 0 && unread + added > mostUnreadBytes()) {
    out_.resize(before);
    hasTooManyUnread_ = true;
  }
  updateUnread();
  if (!std::exchange(isAnnounced_, true)) waker_->needsAttention(id_);
}

void PeerChannel::charge(std::size_t bytes) noexcept {
  if (own_.take(bytes)) process_->addBusyConnection();
  user_->queued().take(bytes);
}

bool PeerChannel::mayMerge(const Merged& then) noexcept {
  if (then.entries <= limits::kUserInfoEntries && then.bytes <= limits::kUserInfoBytes &&
      user_->hasRoomForInfo(then.growth)) {
    return true;
  }
  hasRefusedMerge_ = true;
  return false;
}

void PeerChannel::relieve(std::size_t bytes) noexcept {
  const RequestBudget::Given own = own_.give(bytes);
  if (own.isLast) process_->removeBusyConnection();
  const bool hasLargeEnded = own.isLast && hasLarge_.load() && hasLarge_.exchange(false);
  if (hasLargeEnded) user_->removeLargeRequest();
  const bool hasUserEased = user_->queued().give(bytes).tellsWaiter;
  const bool hasReserve =
      awaitsReserve_.load() && !isBeyondReserve() && awaitsReserve_.exchange(false);
  if (own.tellsWaiter || hasUserEased || hasReserve || hasLargeEnded) {
    waker_->budgetEased();
  }
}

std::uint64_t PeerChannel::chargeRequest(std::size_t bytes) {
  charge(bytes);
  return chargedMark_ += bytes;
}

void PeerChannel::requestsRan(std::uint64_t mark) noexcept {
  std::uint64_t ran = ranMark_.load(std::memory_order_relaxed);
  while (ran < mark && !ranMark_.compare_exchange_weak(ran, mark)) {
  }
  if (ran < mark) relieve(mark - ran);
}

// It is under way while anything of the connection's is.
void PeerChannel::noteLarge() noexcept {
  if (hasLarge_.exchange(true)) return;
  user_->addLargeRequest();
  if (own_.used() == 0 && hasLarge_.exchange(false)) user_->removeLargeRequest();
}

bool PeerChannel::awaitBudget() {
  const bool isOwnFull = own_.isExceeded() && own_.await();
  // Its end is told of by the waker, which is asked after this.
  if (mustWaitForLarge() && user_->queued().isExceeded()) return true;
  if (!isBeyondReserve() || !user_->queued().isExceeded()) return isOwnFull;
  awaitsReserve_ = true;
  // Whoever gives after this sees it; whoever gave before is seen here.
  const bool isUserFull = user_->queued().await() && isBeyondReserve();
  return isOwnFull || isUserFull;
}

bool PeerChannel::hasTooManyUnread() const {
  const std::lock_guard lock(mutex_);
  return hasTooManyUnread_;
}

void PeerChannel::updateUnread() {
  const std::size_t now = out_.size() - written_;
  user_->changeUnread(unread_.exchange(now), now);
}

bool PeerChannel::flush(int socket) {
  const std::lock_guard lock(mutex_);
  isAnnounced_ = false;
  while (written_ < out_.size()) {
    const ssize_t count = ::send(socket, out_.data() + written_, out_.size() - written_,
                                 MSG_NOSIGNAL | MSG_DONTWAIT);
    if (count < 0) {
      if (errno == EINTR) continue;
      if (errno == EAGAIN || errno == ENOBUFS || errno == ENOMEM) break;
      return false;
    }
    written_ += static_cast<std::size_t>(count);
  }
  if (written_ == out_.size()) {
    out_.clear();
    written_ = 0;
    if (out_.capacity() > kKeptCapacity) out_.shrink_to_fit();
  } else if (written_ > out_.size() / kMostWrittenPart) {
    std::string(out_, written_).swap(out_);  // Without the room of what was written.
    written_ = 0;
  }
  updateUnread();
  return true;
}

void PeerChannel::close(std::string_view reason) {
  const std::lock_guard lock(mutex_);
  if (!std::exchange(isClosed_, true)) wire::appendClosing(out_, reason);
  updateUnread();
}

void PeerChannel::close() {
  const std::lock_guard lock(mutex_);
  isClosed_ = true;
  written_ = 0;
  std::string().swap(out_);
  updateUnread();
}

}  // namespace ostrel
