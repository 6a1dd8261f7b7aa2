#pragma once

#include <sys/epoll.h>

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/IPCListener.h"
#include "platform/Outcome.h"
#include "platform/WorkQueue.h"
#include "platform/linux/FairLine.h"
#include "platform/linux/FileDescriptor.h"
#include "platform/linux/HeapKeeper.h"
#include "platform/linux/LoopWaker.h"
#include "platform/linux/PeerConnection.h"
#include "platform/linux/PeerRegistry.h"
#include "platform/linux/ServiceSocket.h"
#include "platform/linux/SessionOwners.h"
#include "platform/linux/TerminationSignals.h"
#include "platform/linux/UserAccount.h"

namespace ostrel {

/// What a listener takes from its surroundings; none of it has to be given.
struct ListenerOptions {
  ListenerLimits limits;
  /// Who is told of clients that are cut short.
  std::shared_ptr<MisuseLog> misuse;
  /// Where the sessions of a client that left many are given up: whoever had 100,000
  /// must not hold up the others by its end. None: where it is.
  ConcurrentQueue* disposal = nullptr;
  /// Who is told of each round of requests.
  std::shared_ptr<HeapKeeper> heap;
  /// Who is at the other end; empty: whom the kernel says.
  std::function<PeerIdentity(int socket)> identityOf;
  /// What turns and waits are measured by; empty: steady time.
  std::function<PeerConnection::Clock::time_point()> now = {};
};

/// Serves clients on a Unix stream socket, all of them on the one thread that calls
/// `resume`. Frames and their rules are in `docs/protocol.md`.
///
/// A client that breaks the rules is told why and cut off. One that has more under
/// way than it may is not read until half of it is done; nothing that it sent is
/// lost, and no other client waits for it. One that does not read its replies is
/// cut off at a limit.
class UnixSocketIPCListener final : public IPCListener {
 public:
  /// The socket that systemd passed, else one of our own at `path`. An error is a
  /// sentence for people. `peers` learns who connects.
  static Outcome<std::unique_ptr<UnixSocketIPCListener>> open(
      const std::string& path, std::shared_ptr<PeerRegistry> peers,
      ListenerOptions options = {});
  ~UnixSocketIPCListener() override;

  void setDelegate(IPCListenerDelegate* delegate) override { delegate_ = delegate; }

  /// Says to systemd that the service is ready, and serves until SIGTERM, SIGINT or
  /// `stop`; then ends every connection.
  void resume() override;

  /// Lets `resume` return. Any thread.
  void stop() { signals_.raise(); }

  /// Users that have connections, or anything left under way or kept. Any thread.
  std::size_t users() const { return usersKnown_; }

 private:
  using Clock = PeerConnection::Clock;
  struct Watched;
  struct User {
    std::size_t connections = 0;
    bool isListedLeaving = false;  // In `leaving_`.
    std::size_t untakenBytes = 0;  // Of all its connections.
    std::shared_ptr<UserAccount> account;
    /// Those of processes that have gone are left out now and then.
    std::unordered_map<ProcessID, std::weak_ptr<ProcessAccount>> processes;

    std::shared_ptr<ProcessAccount> processAccount(ProcessID pid);
  };

  UnixSocketIPCListener(ServiceSocket socket, std::shared_ptr<PeerRegistry> peers,
                        ListenerOptions options);

  void look();
  void shareMemoryOut();
  void takeTurns();
  /// Each returns the work that it took.
  std::uint64_t takeTurn(PeerConnection::ID id);
  std::uint64_t acceptSome();
  void accept(FileDescriptor socket);
  bool watchOwnDescriptors();
  void keepOwners();
  bool isWithinLimits(const PeerIdentity& peer, int socket);
  void handleEvent(std::uint64_t id, std::uint32_t events);
  void handleWork();
  void giveUpEstates();
  User& knownUser(std::uint32_t number);
  void noteLeaving(std::uint32_t number);
  void forgetUsers();
  bool mayForget(std::uint32_t number);
  void noteDeadline(Clock::time_point deadline);
  void handleDeadlines(Clock::time_point now);
  int millisecondsToWait() const;

  /// Brings the loop in line with what a connection wants now, or ends it.
  void settle(PeerConnection& connection);
  void watch(PeerConnection& connection);
  void end(PeerConnection& connection);
  void cutOff(PeerConnection& connection);
  void countHalfFrame(PeerConnection& connection);
  bool cutOffOldestHalf(std::uint32_t user);
  bool cutOffHalfOfWhoHasMost();
  void countUntaken(PeerConnection& connection);
  bool cutOffLongestUntaken(std::uint32_t user);
  /// Which of two half frames is given up first.
  static bool goesBefore(const Watched& one, const Watched& other);

  const ListenerLimits limits_;
  const ServiceSocket socket_;
  const std::shared_ptr<PeerRegistry> peers_;
  const std::shared_ptr<MisuseLog> misuse_;
  ConcurrentQueue* const disposal_;
  const std::shared_ptr<HeapKeeper> heap_;  // Or none.
  const std::function<PeerIdentity(int)> identityOf_;
  const std::function<Clock::time_point()> now_;
  const std::shared_ptr<LoopWaker> waker_ = std::make_shared<LoopWaker>();
  TerminationSignals signals_;
  const FileDescriptor epoll_;
  IPCListenerDelegate* delegate_ = nullptr;

  struct Watched {
    std::shared_ptr<PeerConnection> connection;
    std::shared_ptr<ProcessAccount> process;
    std::size_t halfFrameBytes = 0;  // As its user's count has it.
    std::size_t untakenBytes = 0;    // Likewise.
    std::uint32_t events = 0;        // As epoll knows them; 0: not in it.
    bool isListedHeldBack = false;   // In `heldBack_`.
    bool isListedImpatient = false;  // In `impatient_`.
    FairLine::Place place;
  };
  // Before the connections, which it names.
  SessionOwners owners_;
  std::optional<std::uint32_t> firstUser_;
  std::unordered_map<PeerConnection::ID, Watched> connections_;
  const std::shared_ptr<ServiceAccount> service_;
  std::map<std::uint32_t, User> users_;
  std::atomic<std::size_t> usersKnown_{0};
  std::vector<std::uint32_t> leaving_;  // Users whose last connection has ended.
  std::vector<PeerConnection::ID> heldBack_;
  std::vector<PeerConnection::ID> impatient_;
  PeerConnection::ID nextID_;
  FairLine line_;  // Of connections, and of the socket that accepts them.
  FairLine::Place placeOfSocket_;
  // Of clients that have gone, and of those among them that had many sessions.
  std::vector<std::shared_ptr<void>> estates_;
  std::vector<std::shared_ptr<void>> largeEstates_;
  Clock::duration turnsBetweenLooks_ = limits::kTurnsBetweenLooks;
  LoopWaker::Work work_;
  std::vector<epoll_event> events_;
  std::vector<std::uint8_t> buffer_;
  // None, or not after, the first time at which `handleDeadlines` has something to do.
  std::optional<Clock::time_point> firstDeadline_;
  Clock::time_point acceptAgainAt_{};  // Set while accepting is backed off.
  bool isBackedOff_ = false;
  bool isStopping_ = false;
};

}  // namespace ostrel
