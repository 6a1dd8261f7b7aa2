// One thread, one epoll. The requests that one look at the sockets brings are served
// on this thread too before it waits again, and their replies written: a round trip
// takes no other thread. A connection is in the epoll only while it has something
// to wait for: a client that is held back is taken out, so that its hanging up does
// not spin the loop, and comes back when its requests have been carried out.
#include "platform/linux/UnixSocketIPCListener.h"

#include <sys/epoll.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <utility>

#include "platform/Logging.h"
#include "platform/linux/ProcProcessInfo.h"
#include "platform/linux/SystemdService.h"
#include "platform/linux/ThreadPoolWorkQueues.h"

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace ostrel {
namespace {

constexpr std::uint64_t kSocketEvent = 0;
constexpr std::uint64_t kWakerEvent = 1;
constexpr std::uint64_t kSignalEvent = 2;
constexpr PeerConnection::ID kFirstConnection = 3;

// Many frames a system call; what is held back of it stays small.
constexpr std::size_t kReadBytes = 64 * 1024;
constexpr int kMostEvents = 64;

constexpr int kMostAccepted = 64;

bool watchDescriptor(int epoll, int descriptor, std::uint64_t id) {
  epoll_event event{};
  event.events = EPOLLIN;
  event.data.u64 = id;
  return ::epoll_ctl(epoll, EPOLL_CTL_ADD, descriptor, &event) == 0;
}

PeerIdentity identityOf(int socket) {
  ucred credentials{};
  socklen_t size = sizeof credentials;
  if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &size) != 0) return {};
  return {credentials.pid, credentials.uid};
}

// The process that connected, even if its id has become another's since.
FileDescriptor processOf(int socket, ProcessID pid) {
  int descriptor = -1;
  socklen_t size = sizeof descriptor;
  if (::getsockopt(socket, SOL_SOCKET, SO_PEERPIDFD, &descriptor, &size) == 0) {
    return FileDescriptor(descriptor);
  }
  return pid > 0 ? openProcess(pid) : FileDescriptor();
}

void sendClosing(int socket, std::string_view reason) {
  std::string frame;
  wire::appendClosing(frame, reason);
  [[maybe_unused]] const ssize_t sent =
      ::send(socket, frame.data(), frame.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
}

}  // namespace

Outcome<std::unique_ptr<UnixSocketIPCListener>> UnixSocketIPCListener::open(
    const std::string& path, std::shared_ptr<PeerRegistry> peers, ListenerLimits limits,
    std::shared_ptr<MisuseLog> misuse) {
  auto socket = ServiceSocket::open(path);
  if (!socket.value) return {std::nullopt, std::move(socket.error)};
  auto listener = std::unique_ptr<UnixSocketIPCListener>(new UnixSocketIPCListener(
      *std::move(socket.value), std::move(peers), limits,
      misuse ? std::move(misuse) : std::make_shared<MisuseLog>()));
  if (!listener->watchOwnDescriptors()) {
    return {std::nullopt,
            ErrorObject{std::string(kPOSIXErrorDomain), ENOMEM,
                        "no descriptors or no memory are left to wait for clients"}};
  }
  return {std::move(listener), std::nullopt};
}

UnixSocketIPCListener::UnixSocketIPCListener(ServiceSocket socket,
                                             std::shared_ptr<PeerRegistry> peers,
                                             ListenerLimits limits,
                                             std::shared_ptr<MisuseLog> misuse)
    : limits_(limits),
      socket_(std::move(socket)),
      peers_(std::move(peers)),
      misuse_(std::move(misuse)),
      epoll_(::epoll_create1(EPOLL_CLOEXEC)),
      service_(new ServiceAccount{Share(limits.sessions), Share(limits.keptBytes)}),
      nextID_(kFirstConnection) {}

bool UnixSocketIPCListener::watchOwnDescriptors() {
  return watchDescriptor(epoll_.get(), socket_.descriptor(), kSocketEvent) &&
         watchDescriptor(epoll_.get(), waker_->descriptor(), kWakerEvent) &&
         watchDescriptor(epoll_.get(), signals_.descriptor(), kSignalEvent);
}

UnixSocketIPCListener::~UnixSocketIPCListener() = default;

void UnixSocketIPCListener::resume() {
  buffer_.resize(kReadBytes);
  notifySystemd("READY=1");
  std::array<epoll_event, kMostEvents> events;
  while (!isStopping_) {
    const bool mayWait = waker_->beginWait();
    const int count = ::epoll_wait(epoll_.get(), events.data(), kMostEvents,
                                   mayWait ? millisecondsToWait() : 0);
    waker_->endWait();
    if (heap_ && count > 0) heap_->noteWork();
    {
      const ThreadPoolWorkQueues::Batch requests;
      for (int i = 0; i < count; ++i) {
        const epoll_event& event = events[static_cast<std::size_t>(i)];
        handleEvent(event.data.u64, event.events);
      }
      if (hasDeadlines()) handleDeadlines(Clock::now());
    }
    // The requests have been served, and many replies are there.
    const ThreadPoolWorkQueues::Batch requests;
    handleWork();
  }
  notifySystemd("STOPPING=1");
  while (!connections_.empty()) {
    const auto connection = connections_.begin()->second.connection;
    sendClosing(connection->socket(), "the service ends");
    end(*connection);
  }
}

void UnixSocketIPCListener::handleEvent(std::uint64_t id, std::uint32_t events) {
  switch (id) {
    case kSocketEvent:
      acceptAll();
      return;
    case kWakerEvent:
      waker_->clear();
      return;
    case kSignalEvent:
      isStopping_ = true;
      return;
    default:
      break;
  }
  const auto found = connections_.find(id);
  if (found == connections_.end()) return;
  const auto connection = found->second.connection;
  if ((events & EPOLLOUT) != 0) connection->write(Clock::now());
  if ((events & ~EPOLLOUT) != 0 && connection->wantsToRead()) connection->read(buffer_);
  settle(*connection);
}

// What other threads asked for since the last wait.
void UnixSocketIPCListener::handleWork() {
  waker_->take(work_);
  for (const PeerConnection::ID id : work_.connections) {
    const auto found = connections_.find(id);
    if (found == connections_.end()) continue;
    const auto connection = found->second.connection;
    connection->write(Clock::now());
    settle(*connection);
  }
  if (!work_.hasBudgetEased) return;
  std::vector<PeerConnection::ID> waiting;
  std::swap(waiting, heldBack_);
  for (const PeerConnection::ID id : waiting) {
    const auto found = connections_.find(id);
    if (found == connections_.end()) continue;
    const auto connection = found->second.connection;
    connection->continueReading();
    settle(*connection);
  }
}

void UnixSocketIPCListener::settle(PeerConnection& connection) {
  // Replies that were read make room again for a client that was merely slow.
  if (connection.isHeldBack()) connection.continueReading();
  if (connection.ending() != PeerConnection::Ending::kNone) {
    if (connection.ending() == PeerConnection::Ending::kBrokenRules) {
      cutOff(connection);
    } else {
      end(connection);
    }
    return;
  }
  const auto addOnce = [&](std::vector<PeerConnection::ID>& list) {
    if (std::find(list.begin(), list.end(), connection.id()) == list.end()) {
      list.push_back(connection.id());
    }
  };
  if (connection.isHeldBack()) addOnce(heldBack_);
  if (connection.isImpatient()) addOnce(impatient_);
  watch(connection);
  countHalfFrame(connection);
}

void UnixSocketIPCListener::cutOff(PeerConnection& connection) {
  misuse_->note(connection.peer().user, MisuseLog::Kind::kCutOff,
                connection.endingReason(), Clock::now());
  end(connection);
}

// A client that begins frames and does not end them takes memory for as long as it likes:
// where a user has too many such, those that began first go.
void UnixSocketIPCListener::countHalfFrame(PeerConnection& connection) {
  const auto watched = connections_.find(connection.id());
  if (watched == connections_.end()) return;
  User& user = users_[connection.peer().user];
  user.halfFrameBytes += connection.halfFrameBytes() - watched->second.halfFrameBytes;
  watched->second.halfFrameBytes = connection.halfFrameBytes();
  if (user.halfFrameBytes <= limits_.halfFrameBytesOfUser) return;
  std::shared_ptr<PeerConnection> oldest;
  for (const auto& [id, each] : connections_) {
    const PeerConnection& candidate = *each.connection;
    if (candidate.halfFrameBytes() == 0) continue;
    if (candidate.peer().user != connection.peer().user) continue;
    if (!oldest || candidate.pendingSince() < oldest->pendingSince()) {
      oldest = each.connection;
    }
  }
  if (!oldest) return;
  oldest->breakOff(PeerConnection::Ending::kBrokenRules, "too many frames are not whole");
  cutOff(*oldest);
}

void UnixSocketIPCListener::watch(PeerConnection& connection) {
  Watched& watched = connections_.at(connection.id());
  epoll_event event{};
  if (connection.wantsToRead()) event.events |= EPOLLIN;
  if (connection.wantsToWrite()) event.events |= EPOLLOUT;
  event.data.u64 = connection.id();
  if (event.events == watched.events) return;
  const int operation = watched.events == 0 ? EPOLL_CTL_ADD
                        : event.events == 0 ? EPOLL_CTL_DEL
                                            : EPOLL_CTL_MOD;
  if (::epoll_ctl(epoll_.get(), operation, connection.socket(), &event) != 0) {
    OSTREL_LOG_ERROR(processLogScope, "a connection cannot be watched: error %i", errno);
    connection.breakOff(PeerConnection::Ending::kBrokenRules, "the service is full");
    end(connection);
    return;
  }
  watched.events = event.events;
}

void UnixSocketIPCListener::end(PeerConnection& connection) {
  const auto found = connections_.find(connection.id());
  if (found == connections_.end()) return;
  const std::shared_ptr<PeerConnection> ended = std::move(found->second.connection);
  const std::size_t halfFrameBytes = found->second.halfFrameBytes;
  connections_.erase(found);
  peers_->peerDisconnected(ended->peer().pid, ended->id());
  const auto user = users_.find(ended->peer().user);
  if (user != users_.end()) {
    --user->second.connections;
    user->second.halfFrameBytes -= halfFrameBytes;
  }
  ended->invalidate();
}

void UnixSocketIPCListener::acceptAll() {
  for (int i = 0; i < kMostAccepted; ++i) {
    FileDescriptor socket(
        ::accept4(socket_.descriptor(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
    if (socket) {
      accept(std::move(socket));
      continue;
    }
    if (errno == EINTR || errno == ECONNABORTED) continue;
    if (errno == EAGAIN) return;
    // No descriptors or memory: those who wait are accepted later.
    OSTREL_LOG_ERROR(processLogScope, "no connection can be accepted now: error %i",
                     errno);
    ::epoll_ctl(epoll_.get(), EPOLL_CTL_DEL, socket_.descriptor(), nullptr);
    isBackedOff_ = true;
    acceptAgainAt_ = Clock::now() + limits::kAcceptBackOff;
    return;
  }
}

void UnixSocketIPCListener::accept(FileDescriptor socket) {
  const PeerIdentity peer = identityOf(socket.get());
  if (!isWithinLimits(peer, socket.get())) return;
  User& user = users_[peer.user];
  if (!user.account) {
    user.account = std::make_shared<UserAccount>(peer.user, limits_.ofUser, service_);
  }
  const PeerConnection::ID id = nextID_++;
  peers_->peerConnected(peer.pid, id, processOf(socket.get(), peer.pid));
  auto channel = std::make_shared<PeerChannel>(
      id, waker_, user.account,
      PeerChannel::Limits{limits_.queuedBytes, limits_.unreadReplyBytes,
                          limits_.reservedQueuedBytes});
  auto connection = std::make_shared<PeerConnection>(
      id, std::move(socket), peer, std::move(channel), limits_, *misuse_);
  connections_[id] = {connection};
  ++user.connections;
  const bool isAccepted = delegate_ != nullptr &&
                          delegate_->listenerShouldAcceptNewConnection(*this, connection);
  if (!isAccepted || !connection->isResumed()) {
    connection->breakOff(PeerConnection::Ending::kFarewell, "the service refused");
    end(*connection);
    return;
  }
  watch(*connection);
}

bool UnixSocketIPCListener::isWithinLimits(const PeerIdentity& peer, int socket) {
  const auto user = users_.find(peer.user);
  const std::size_t ofUser = user != users_.end() ? user->second.connections : 0;
  if (connections_.size() < limits_.connections && ofUser < limits_.connectionsOfUser) {
    return true;
  }
  misuse_->note(peer.user, MisuseLog::Kind::kConnectionRefused, "there are too many",
                Clock::now());
  sendClosing(socket, "there are too many connections");
  return false;
}

void UnixSocketIPCListener::handleDeadlines(Clock::time_point now) {
  if (isBackedOff_ && now >= acceptAgainAt_) {
    isBackedOff_ = !watchDescriptor(epoll_.get(), socket_.descriptor(), kSocketEvent);
    acceptAgainAt_ = now + limits::kAcceptBackOff;
  }
  if (impatient_.empty()) return;
  std::vector<PeerConnection::ID> waiting;
  std::swap(waiting, impatient_);
  for (const PeerConnection::ID id : waiting) {
    const auto found = connections_.find(id);
    if (found == connections_.end()) continue;
    const auto connection = found->second.connection;
    connection->checkPatience(now);
    settle(*connection);
  }
}

// -1, without end, unless somebody's time runs.
int UnixSocketIPCListener::millisecondsToWait() const {
  if (!hasDeadlines()) return -1;
  Clock::time_point first = Clock::time_point::max();
  if (isBackedOff_) first = acceptAgainAt_;
  for (const PeerConnection::ID id : impatient_) {
    const auto found = connections_.find(id);
    if (found == connections_.end()) continue;
    first = std::min(first, found->second.connection->patienceEnds());
  }
  if (first == Clock::time_point::max()) return -1;
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(first - Clock::now());
  return static_cast<int>(std::max<std::int64_t>(left.count(), 0));
}

}  // namespace ostrel
