#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <utility>

#include "platform/IPCListener.h"
#include "platform/Value.h"
#include "platform/linux/FileDescriptor.h"
#include "platform/linux/Limits.h"
#include "platform/linux/MisuseLog.h"
#include "platform/linux/PeerChannel.h"
#include "platform/linux/ReporterIDSet.h"
#include "platform/linux/SessionOwners.h"
#include "platform/linux/wire/Frame.h"

namespace ostrel {

/// What one listener allows; the service's own values, fewer in tests.
struct ListenerLimits {
  std::size_t connections = limits::kConnections;
  std::size_t connectionsOfUser = limits::kConnectionsOfUser;
  std::size_t frameBytes = limits::kFrameBytes;
  std::size_t reporterIDs = limits::kReporterIDs;
  wire::PayloadLimits payload{limits::kNesting, limits::kNodes, limits::kKeyBytes};
  std::size_t queuedBytes = limits::kQueuedBytes;
  std::size_t reservedQueuedBytes = limits::kReservedQueuedBytes;
  std::size_t mostReservedBytes = limits::kMostReservedBytes;
  UserAccount::Limits ofUser{limits::kQueuedBytesOfUser, limits::kSessionsOfUser,
                             limits::kKeptBytesOfUser};
  MemoryUse ofAll = MemoryOfAll::kMost;
  std::size_t sessions = limits::kSessions;
  std::size_t keptBytes = limits::kKeptBytes;
  std::size_t unreadReplyBytes = limits::kUnreadReplyBytes;
  std::size_t unreadReplyBytesToPause = limits::kUnreadReplyBytesToPause;
  std::chrono::milliseconds unreadPatience = limits::kUnreadPatience;
  std::uint64_t turnWork = limits::kTurnWork;
};

/// Who is at the other end of a socket, by the kernel.
struct PeerIdentity {
  ProcessID pid = 0;
  std::uint32_t user = 0;
};

/// One client's connection as the listener's loop sees it. On the loop's thread
/// only; what other threads reach is its `PeerChannel`.
///
/// Reading decides when it ends: what a client sent before it went away is carried
/// out, however full the service was when it went.
class PeerConnection final : public IPCConnection {
 public:
  using ID = LoopWaker::ConnectionID;
  using Clock = std::chrono::steady_clock;

  enum class Ending {
    kNone,
    kFarewell,     // The client ended well.
    kVanished,     // It went away without a word.
    kBrokenRules,  // It is told why and cut off.
    kRefused,      // It is told why: the service cannot or will not serve it.
  };

  PeerConnection(ID id, FileDescriptor socket, PeerIdentity peer,
                 std::shared_ptr<PeerChannel> channel, const ListenerLimits& limits,
                 MisuseLog& misuse, SessionOwners& owners);

  ProcessID processIdentifier() const override { return peer_.pid; }
  std::string description() const override;
  void setExportedObject(std::shared_ptr<OstrelReportingServiceProtocol> object) override;
  std::shared_ptr<OstrelReportingServiceProtocol> exportedObject() const override;
  void setInterruptionHandler(std::function<void()> handler) override;
  void setInvalidationHandler(std::function<void()> handler) override;
  void resume() override { isResumed_ = true; }

  ID id() const { return id_; }
  int socket() const { return socket_.get(); }
  const PeerIdentity& peer() const { return peer_; }
  bool isResumed() const { return isResumed_; }

  /// Goes on with what was read before, or takes what the socket holds, once through
  /// `buffer`; and carries out the requests that are whole, until the turn's work is
  /// done. Returns that work, as `limits::kTurnWork` counts it.
  std::uint64_t takeTurn(std::span<std::uint8_t> buffer);
  /// Whether the next turn has something to do that is here already.
  bool isUnfinished() const { return isUnfinished_ && ending_ == Ending::kNone; }
  /// Looks whether there is room again for requests of a client that is held back.
  void goOn();
  /// Writes replies as far as the client takes them.
  void write(Clock::time_point now);
  /// Cuts off a client that has read nothing for too long.
  void checkPatience(Clock::time_point now);

  /// Whether the socket is to be read: the client has room for more requests.
  bool wantsToRead() const { return ending_ == Ending::kNone && !isHeldBack_; }
  bool wantsToWrite() const { return hasUnread_ && !isDeaf_; }
  bool isHeldBack() const { return isHeldBack_; }
  /// What of a frame is there that is not whole, and since when it waits. What is held
  /// back waits for the service, not for the client, and does not count.
  std::size_t halfFrameBytes() const {
    return isHeldBack_ || isUnfinished_ ? 0 : pending_.size();
  }
  Clock::time_point pendingSince() const { return pendingSince_; }
  /// Replies that the client did not take when they were written, where they are many:
  /// more than it may have when its user's clients leave too much unread.
  std::size_t untakenBytes() const;
  /// When it last read a reply.
  Clock::time_point lastRead() const { return lastRead_; }
  /// When `checkPatience` has something to say; none while the client reads.
  bool isImpatient() const { return hasUnread_; }
  Clock::time_point patienceEnds() const { return lastRead_ + limits_.unreadPatience; }

  /// The client's sessions.
  std::size_t sessions() const { return sessions_.size(); }
  /// Tells whose they are, once that is kept.
  void enterSessions();

  /// How often the client used sessions of other users' clients, and the first time of
  /// these.
  struct Uses {
    std::uint64_t count = 0;
    MisuseLog::UseOfOthers first;
  };
  /// Since the last call.
  Uses takeUsesOfOthers() { return std::exchange(usesOfOthers_, {}); }

  Ending ending() const { return ending_; }
  std::string_view endingReason() const { return reason_; }

  /// Ends it with a reason that the client is told as far as it listens.
  void breakOff(Ending ending, std::string_view reason);
  /// Closes the socket and calls the handlers. The last call. What is returned is what
  /// the client leaves behind: its sessions, perhaps many, which go with it.
  std::shared_ptr<void> invalidate();

 private:
  void read(std::span<std::uint8_t> buffer);
  ssize_t receive(std::span<std::uint8_t> room);
  void noteRefusedMerge();
  std::size_t process(std::span<const std::uint8_t> bytes);
  bool isTurnOver() const { return work_ >= limits_.turnWork; }
  void processPending();
  void chargeInput();
  std::size_t announce(std::span<const std::uint8_t> frames);
  std::size_t costOf(const wire::Request& request, std::size_t bytes) const;
  std::size_t carryOut(ValueBuffer& input, std::span<const std::uint8_t> item);
  bool countSession(const wire::Request& request);
  void noteUseOfOthers(const wire::Request& request);
  void noteUseOfOthers(ReporterID id, std::string_view deed);
  void checkNextFrame(std::span<const std::uint8_t> bytes);
  std::size_t unreadBytesToPause() const;
  bool holdBackIfFull();
  std::size_t missingBytes() const;

  const ID id_;
  FileDescriptor socket_;
  const PeerIdentity peer_;
  const std::shared_ptr<PeerChannel> channel_;
  const ListenerLimits& limits_;
  MisuseLog& misuse_;
  SessionOwners& owners_;
  const SessionOwners::Owner self_;
  ReporterIDSet sessions_;
  Uses usesOfOthers_;

  std::shared_ptr<OstrelReportingServiceProtocol> object_;
  std::function<void()> interrupted_;
  std::function<void()> invalidated_;

  std::string pending_;  // Read and not yet carried out; begins with a frame.
  Clock::time_point pendingSince_{};
  Clock::time_point lastRead_{};  // When the client last read a reply.
  std::string reason_;
  Ending ending_ = Ending::kNone;
  bool isResumed_ = false;
  ReporterID lastAnnounced_ = kNoReporter;
  ValueBuffer* input_ = nullptr;  // While its requests are carried out.
  std::size_t uncharged_ = 0;     // To it.
  std::uint64_t work_ = 0;        // Of this turn.
  std::size_t readBytes_;         // As much as a turn gets done, as far as is known.
  bool isUnfinished_ = false;     // Frames that are whole are pending.
  bool isHeldBack_ = false;
  bool hasUnread_ = false;
  bool isDeaf_ = false;      // It will not read any more.
  bool needsProbe_ = false;  // The last request's ticket may be kept for long.
};

}  // namespace ostrel
