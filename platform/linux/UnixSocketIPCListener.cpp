// One thread, one epoll. Whoever is readable at a look stands in line for a turn. What
// the turns of a while bring is served on this thread too before it looks again, and
// the replies written: a round trip takes no other thread, and a client that asks little
// waits for little however much the others ask. A connection is in the epoll only while
// it has something to wait for: a client that is held back is taken out, so that its
// hanging up does not spin the loop, and comes back when its requests have been carried
// out.
#include "platform/linux/UnixSocketIPCListener.h"

#include <poll.h>
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
#include "platform/linux/Threads.h"

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace ostrel {
namespace {

using Batch = ThreadPoolWorkQueues::Batch;

constexpr std::uint64_t kSocketEvent = 0;
constexpr std::uint64_t kWakerEvent = 1;
constexpr std::uint64_t kSignalEvent = 2;
constexpr PeerConnection::ID kFirstConnection = 3;

// Many frames a system call; what is held back of it stays small.
constexpr std::size_t kReadBytes = 64 * 1024;
constexpr int kMostEvents = 1024;

// In nanoseconds, as `limits::kTurnWork`: what accepting and ending one were seen to
// take.
constexpr std::uint64_t kWorkOfAccepting = 25'000;
constexpr std::uint64_t kWorkOfEnding = 40'000;
constexpr std::uint64_t kWorkOfSessionsEnd = 2000;

// A look that finds many takes longer, and comes less often.
constexpr std::chrono::microseconds kTurnsOfEvent{1};

// The accounts of a user's processes are looked through when there are so many more than
// connections.
constexpr std::size_t kProcessesKept = 64;

// Few are given up at once: what waits for a thread of lower priority keeps its memory.
constexpr std::size_t kManySessions = 500;

bool watchDescriptor(int epoll, int descriptor, std::uint64_t id) {
  epoll_event event{};
  event.events = EPOLLIN;
  event.data.u64 = id;
  return ::epoll_ctl(epoll, EPOLL_CTL_ADD, descriptor, &event) == 0;
}

PeerIdentity kernelsIdentityOf(int socket) {
  ucred credentials{};
  socklen_t size = sizeof credentials;
  if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &size) != 0) return {};
  return {credentials.pid, credentials.uid};
}

bool hasHungUp(int socket) {
  pollfd waited{socket, 0, 0};
  return ::poll(&waited, 1, /*timeout=*/0) != 0;
}

// The process that connected, even if its id has become another's since; none when that
// cannot be had.
FileDescriptor processOf(int socket, ProcessID pid) {
  int descriptor = -1;
  socklen_t size = sizeof descriptor;
  if (::getsockopt(socket, SOL_SOCKET, SO_PEERPIDFD, &descriptor, &size) == 0) {
    return FileDescriptor(descriptor);
  }
  // Its process has gone, or there are no descriptors.
  if (errno != ENOPROTOOPT || pid <= 0) return {};
  // Kernels before 6.5 tell the id alone. Whose end is still open had it just now, unless
  // the client left it to another process and ended.
  FileDescriptor process = openProcess(pid);
  return hasHungUp(socket) ? FileDescriptor() : std::move(process);
}

void sendClosing(int socket, std::string_view reason) {
  std::string frame;
  wire::appendClosing(frame, reason);
  [[maybe_unused]] const ssize_t sent =
      ::send(socket, frame.data(), frame.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
}

}  // namespace

Outcome<std::unique_ptr<UnixSocketIPCListener>> UnixSocketIPCListener::open(
    const std::string& path, std::shared_ptr<PeerRegistry> peers,
    ListenerOptions options) {
  auto socket = ServiceSocket::open(path);
  if (!socket.value) return {std::nullopt, std::move(socket.error)};
  auto listener = std::unique_ptr<UnixSocketIPCListener>(new UnixSocketIPCListener(
      *std::move(socket.value), std::move(peers), std::move(options)));
  if (!listener->watchOwnDescriptors()) {
    return {std::nullopt,
            ErrorObject{std::string(kPOSIXErrorDomain), ENOMEM,
                        "no descriptors or no memory are left to wait for clients"}};
  }
  return {std::move(listener), std::nullopt};
}

UnixSocketIPCListener::UnixSocketIPCListener(ServiceSocket socket,
                                             std::shared_ptr<PeerRegistry> peers,
                                             ListenerOptions options)
    : limits_(options.limits),
      socket_(std::move(socket)),
      peers_(std::move(peers)),
      misuse_(options.misuse ? std::move(options.misuse) : std::make_shared<MisuseLog>()),
      disposal_(options.disposal),
      heap_(std::move(options.heap)),
      identityOf_(options.identityOf ? std::move(options.identityOf) : kernelsIdentityOf),
      now_(options.now ? std::move(options.now) : Clock::now),
      epoll_(::epoll_create1(EPOLL_CLOEXEC)),
      service_(new ServiceAccount{Share(limits_.sessions), Share(limits_.keptBytes),
                                  MemoryOfAll(limits_.ofAll)}),
      nextID_(kFirstConnection) {}

bool UnixSocketIPCListener::watchOwnDescriptors() {
  return watchDescriptor(epoll_.get(), socket_.descriptor(), kSocketEvent) &&
         watchDescriptor(epoll_.get(), waker_->descriptor(), kWakerEvent) &&
         watchDescriptor(epoll_.get(), signals_.descriptor(), kSignalEvent);
}

UnixSocketIPCListener::~UnixSocketIPCListener() = default;

void UnixSocketIPCListener::resume() {
  buffer_.resize(kReadBytes);
  setNiceness(kInteractiveNiceness);  // What this thread serves is of that class.
  events_.resize(kMostEvents);
  notifySystemd("READY=1");
  while (!isStopping_) {
    look();
    takeTurns();
  }
  notifySystemd("STOPPING=1");
  while (!connections_.empty()) {
    const auto connection = connections_.begin()->second.connection;
    sendClosing(connection->socket(), "the service ends");
    end(*connection);
  }
  giveUpEstates();
}

void UnixSocketIPCListener::look() {
  const bool mayWait = line_.empty() && waker_->beginWait();
  const int count = ::epoll_wait(epoll_.get(), events_.data(), kMostEvents,
                                 mayWait ? millisecondsToWait() : 0);
  waker_->endWait();
  const Clock::time_point now = now_();
  line_.setTime(static_cast<std::uint64_t>(
      std::chrono::nanoseconds(now.time_since_epoch()).count()));
  shareMemoryOut();
  if (heap_ && count > 0) heap_->noteWork(now);
  turnsBetweenLooks_ = limits::kTurnsBetweenLooks + std::max(count, 0) * kTurnsOfEvent;
  const Batch requests;
  for (int i = 0; i < count; ++i) {
    const epoll_event& event = events_[static_cast<std::size_t>(i)];
    handleEvent(event.data.u64, event.events);
  }
  if (firstDeadline_) handleDeadlines(now_());
}

// From now until the next look.
void UnixSocketIPCListener::shareMemoryOut() {
  do {
    MemoryUse used{};
    for (const auto& [id, user] : users_) {
      const MemoryUse ofUser = user.account->memoryUse();
      for (std::size_t i = 0; i < kMemoryKinds; ++i) used[i] += ofUser[i];
    }
    service_->memory.set(used);
  } while (cutOffHalfOfWhoHasMost());
  for (const auto& [id, user] : users_) {
    if (user.account->adapt()) waker_->budgetEased();
  }
}

// Of those that have too many.
bool UnixSocketIPCListener::cutOffHalfOfWhoHasMost() {
  std::optional<std::uint32_t> worst;
  std::size_t most = 0;
  for (const auto& [id, user] : users_) {
    const std::size_t bytes = user.account->halfFrameBytes();
    if (bytes <= most || !user.account->hasManyHalfFrames()) continue;
    worst = id;
    most = bytes;
  }
  return worst && cutOffOldestHalf(*worst);
}

// Those that are cheap have their requests served together, which wakes the threads of
// sessions once.
void UnixSocketIPCListener::takeTurns() {
  std::optional<Clock::time_point> end;
  for (;;) {
    {
      // Nobody who asks for little waits for what others ask for in the same batch.
      const bool isLight = line_.isNextLight();
      const Batch requests(isLight ? Batch::Kind::kUrgent : Batch::Kind::kUsual);
      std::uint64_t work = 0;
      while (line_.isNextLight() == isLight) {
        const auto next = line_.take();
        if (!next) break;
        work += takeTurn(*next);
        if (work >= limits_.turnWork || line_.empty()) break;
        // Where the estimate is wrong.
        const Clock::time_point now = now_();
        if (!end) end = now + turnsBetweenLooks_;
        if (now >= *end) break;
      }
    }
    {
      // The requests have been served, and their replies are there.
      const Batch requests;
      handleWork();
    }
    giveUpEstates();
    if (line_.empty() || isStopping_) return;
    const Clock::time_point now = now_();
    if (!end) end = now + turnsBetweenLooks_;
    if (now >= *end) return;
  }
}

std::uint64_t UnixSocketIPCListener::takeTurn(std::uint64_t id) {
  if (id == kSocketEvent) {
    line_.leave(placeOfSocket_);
    const std::uint64_t work = acceptSome();
    line_.use(placeOfSocket_, work);
    return work;
  }
  const auto found = connections_.find(id);
  if (found == connections_.end()) return 0;
  line_.leave(found->second.place);
  const auto connection = found->second.connection;
  std::uint64_t work = connection->takeTurn(buffer_);
  if (const auto uses = connection->takeUsesOfOthers(); uses.count != 0) {
    misuse_->noteUses(connection->peer().user, uses.count, uses.first, now_());
  }
  if (connection->ending() != PeerConnection::Ending::kNone) {
    work += kWorkOfEnding +
            std::min(connection->sessions(), kManySessions) * kWorkOfSessionsEnd;
  }
  line_.use(found->second.place, work);
  settle(*connection);
  return work;
}

void UnixSocketIPCListener::handleEvent(std::uint64_t id, std::uint32_t events) {
  switch (id) {
    case kSocketEvent:
      line_.enter(id, placeOfSocket_);
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
  if ((events & EPOLLOUT) == 0) {
    line_.enter(id, found->second.place);
    return;
  }
  const auto connection = found->second.connection;
  if ((events & ~EPOLLOUT) != 0) line_.enter(id, found->second.place);
  connection->write(now_());
  settle(*connection);
}

// What other threads asked for since the last wait.
void UnixSocketIPCListener::handleWork() {
  waker_->take(work_);
  for (const PeerConnection::ID id : work_.connections) {
    const auto found = connections_.find(id);
    if (found == connections_.end()) continue;
    const auto connection = found->second.connection;
    connection->write(now_());
    settle(*connection);
  }
  if (!work_.hasBudgetEased) return;
  std::vector<PeerConnection::ID> waiting;
  std::swap(waiting, heldBack_);
  for (const PeerConnection::ID id : waiting) {
    const auto found = connections_.find(id);
    if (found == connections_.end()) continue;
    found->second.isListedHeldBack = false;
    const auto connection = found->second.connection;
    settle(*connection);
  }
}

void UnixSocketIPCListener::settle(PeerConnection& connection) {
  // Replies that were read make room again for a client that was merely slow.
  connection.goOn();
  if (connection.ending() != PeerConnection::Ending::kNone) {
    if (connection.ending() == PeerConnection::Ending::kBrokenRules) {
      cutOff(connection);
    } else {
      end(connection);
    }
    return;
  }
  Watched& watched = connections_.at(connection.id());
  if (connection.isUnfinished()) line_.enter(connection.id(), watched.place);
  if (connection.isHeldBack() && !std::exchange(watched.isListedHeldBack, true)) {
    heldBack_.push_back(connection.id());
  }
  if (connection.isImpatient() && !std::exchange(watched.isListedImpatient, true)) {
    impatient_.push_back(connection.id());
    noteDeadline(connection.patienceEnds());
  }
  watch(connection);
  countHalfFrame(connection);
  countUntaken(connection);
}

void UnixSocketIPCListener::cutOff(PeerConnection& connection) {
  misuse_->note(connection.peer().user, MisuseLog::Kind::kCutOff,
                connection.endingReason(), now_());
  end(connection);
}

// A client that begins frames and does not end them takes memory for as long as it likes:
// where a user has too many such, those go that began first, of the process that has most
// of them. Whoever sends one large frame, however slowly, is not taken for a hoarder.
void UnixSocketIPCListener::countHalfFrame(PeerConnection& connection) {
  const auto found = connections_.find(connection.id());
  if (found == connections_.end()) return;
  Watched& watched = found->second;
  const std::size_t before =
      std::exchange(watched.halfFrameBytes, connection.halfFrameBytes());
  watched.process->changeHalfFrames(before, connection.halfFrameBytes());
  const std::uint32_t user = connection.peer().user;
  if (users_.at(user).account->hasManyHalfFrames()) cutOffOldestHalf(user);
}

bool UnixSocketIPCListener::cutOffOldestHalf(std::uint32_t user) {
  const Watched* first = nullptr;
  for (const auto& [id, each] : connections_) {
    if (each.connection->halfFrameBytes() == 0) continue;
    if (each.connection->peer().user != user) continue;
    if (first == nullptr || goesBefore(each, *first)) first = &each;
  }
  if (first == nullptr) return false;
  const std::shared_ptr<PeerConnection> oldest = first->connection;
  oldest->breakOff(PeerConnection::Ending::kBrokenRules, "too many frames are not whole");
  cutOff(*oldest);
  return true;
}

bool UnixSocketIPCListener::goesBefore(const Watched& one, const Watched& other) {
  const std::size_t ofOne = one.process->halfFrameBytes();
  const std::size_t ofOther = other.process->halfFrameBytes();
  if (ofOne != ofOther) return ofOne > ofOther;
  return one.connection->pendingSince() < other.connection->pendingSince();
}

// A reply may be large, and each connection has one at least. Where those that their
// clients did not take are too many, who has read nothing for longest goes: whoever reads
// is never taken for one who does not.
void UnixSocketIPCListener::countUntaken(PeerConnection& connection) {
  const auto found = connections_.find(connection.id());
  if (found == connections_.end()) return;
  const std::size_t now = connection.untakenBytes();
  const std::size_t before = std::exchange(found->second.untakenBytes, now);
  if (now == before) return;
  const std::uint32_t id = connection.peer().user;
  User& user = users_.at(id);
  user.untakenBytes += now - before;
  while (!user.account->mayLeaveUntaken(user.untakenBytes) && cutOffLongestUntaken(id)) {
  }
}

bool UnixSocketIPCListener::cutOffLongestUntaken(std::uint32_t user) {
  std::shared_ptr<PeerConnection> first;
  for (const auto& [id, each] : connections_) {
    if (each.untakenBytes == 0 || each.connection->peer().user != user) continue;
    if (!first || each.connection->lastRead() < first->lastRead()) {
      first = each.connection;
    }
  }
  if (!first) return false;
  first->breakOff(PeerConnection::Ending::kBrokenRules, "too many replies are unread");
  cutOff(*first);
  return true;
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
    connection.breakOff(PeerConnection::Ending::kRefused, "the service is full");
    end(connection);
    return;
  }
  watched.events = event.events;
}

void UnixSocketIPCListener::end(PeerConnection& connection) {
  const auto found = connections_.find(connection.id());
  if (found == connections_.end()) return;
  const std::shared_ptr<PeerConnection> ended = std::move(found->second.connection);
  found->second.process->changeHalfFrames(found->second.halfFrameBytes, /*now=*/0);
  const std::size_t untaken = found->second.untakenBytes;
  connections_.erase(found);
  peers_->peerDisconnected(ended->peer().pid, ended->id());
  users_.at(ended->peer().user).untakenBytes -= untaken;
  noteLeaving(ended->peer().user);
  const bool isLarge = disposal_ != nullptr && ended->sessions() > kManySessions;
  (isLarge ? largeEstates_ : estates_).push_back(ended->invalidate());
}

// Called when what clients asked for on their way out has been served, so that nobody
// else holds their sessions any more.
void UnixSocketIPCListener::giveUpEstates() {
  estates_.clear();
  forgetUsers();
  if (largeEstates_.empty()) return;
  disposal_->asyncAfter(std::chrono::nanoseconds(0),
                        [estates = std::exchange(largeEstates_, {})] {});
}

UnixSocketIPCListener::User& UnixSocketIPCListener::knownUser(std::uint32_t number) {
  User& user = users_[number];
  if (!user.account) {
    user.account = std::make_shared<UserAccount>(limits_.ofUser, service_, number);
    usersKnown_ = users_.size();
  }
  return user;
}

void UnixSocketIPCListener::noteLeaving(std::uint32_t number) {
  const auto user = users_.find(number);
  if (user == users_.end() || --user->second.connections != 0) return;
  if (!std::exchange(user->second.isListedLeaving, true)) leaving_.push_back(number);
}

// What a user's clients left under way or kept counts for those that come after them; an
// account without any of that is like a new one.
void UnixSocketIPCListener::forgetUsers() {
  if (leaving_.empty()) return;
  std::erase_if(leaving_, [this](std::uint32_t number) { return mayForget(number); });
  usersKnown_ = users_.size();
}

// Whether it needs no further look: forgotten, or back.
bool UnixSocketIPCListener::mayForget(std::uint32_t number) {
  const auto found = users_.find(number);
  User& user = found->second;
  if (user.connections != 0) {
    user.isListedLeaving = false;
    return true;
  }
  // Other threads have references only from those that there are.
  if (user.account.use_count() != 1 || !user.account->isIdle()) return false;
  users_.erase(found);
  return true;
}

std::uint64_t UnixSocketIPCListener::acceptSome() {
  std::uint64_t work = 0;
  for (; work < limits_.turnWork; work += kWorkOfAccepting) {
    FileDescriptor socket(
        ::accept4(socket_.descriptor(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
    if (socket) {
      accept(std::move(socket));
      continue;
    }
    if (errno == EINTR || errno == ECONNABORTED) continue;
    if (errno == EAGAIN) break;
    // No descriptors or memory: those who wait are accepted later.
    OSTREL_LOG_ERROR(processLogScope, "no connection can be accepted now: error %i",
                     errno);
    ::epoll_ctl(epoll_.get(), EPOLL_CTL_DEL, socket_.descriptor(), nullptr);
    isBackedOff_ = true;
    acceptAgainAt_ = now_() + limits::kAcceptBackOff;
    noteDeadline(acceptAgainAt_);
    break;
  }
  return work;
}

void UnixSocketIPCListener::accept(FileDescriptor socket) {
  const PeerIdentity peer = identityOf_(socket.get());
  if (!isWithinLimits(peer, socket.get())) return;
  if (peer.user != firstUser_.value_or(peer.user) && !owners_.areKept()) keepOwners();
  firstUser_ = firstUser_.value_or(peer.user);
  User& user = knownUser(peer.user);
  const PeerConnection::ID id = nextID_++;
  peers_->peerConnected(peer.pid, id, processOf(socket.get(), peer.pid));
  const auto process = user.processAccount(peer.pid);
  auto channel = std::make_shared<PeerChannel>(
      id, waker_, user.account,
      PeerChannel::Limits{limits_.queuedBytes, limits_.unreadReplyBytes,
                          limits_.reservedQueuedBytes, limits_.mostReservedBytes},
      process);
  auto connection = std::make_shared<PeerConnection>(
      id, std::move(socket), peer, std::move(channel), limits_, *misuse_, owners_);
  Watched& watched = connections_[id];
  watched.connection = connection;
  watched.process = process;
  line_.introduce(watched.place, {process, &process->group()});
  ++user.connections;
  const bool isAccepted = delegate_ != nullptr &&
                          delegate_->listenerShouldAcceptNewConnection(*this, connection);
  if (!isAccepted || !connection->isResumed()) {
    connection->breakOff(PeerConnection::Ending::kRefused, "the service refused");
    end(*connection);
    return;
  }
  watch(*connection);
}

// From the second user on: a service with one user's clients alone never asks.
void UnixSocketIPCListener::keepOwners() {
  std::size_t sessions = 0;
  for (const auto& [id, each] : connections_) sessions += each.connection->sessions();
  owners_.keep(sessions);
  for (const auto& [id, each] : connections_) each.connection->enterSessions();
}

// What a connection that has gone left under way still counts for its process.
std::shared_ptr<ProcessAccount> UnixSocketIPCListener::User::processAccount(
    ProcessID pid) {
  if (processes.size() > 2 * connections + kProcessesKept) {
    std::erase_if(processes, [](const auto& each) { return each.second.expired(); });
  }
  std::weak_ptr<ProcessAccount>& known = processes[pid];
  std::shared_ptr<ProcessAccount> process = known.lock();
  if (!process) known = process = std::make_shared<ProcessAccount>(account);
  return process;
}

bool UnixSocketIPCListener::isWithinLimits(const PeerIdentity& peer, int socket) {
  const auto user = users_.find(peer.user);
  const std::size_t ofUser = user != users_.end() ? user->second.connections : 0;
  if (connections_.size() < limits_.connections && ofUser < limits_.connectionsOfUser) {
    return true;
  }
  misuse_->note(peer.user, MisuseLog::Kind::kConnectionRefused, "there are too many",
                now_());
  sendClosing(socket, "there are too many connections");
  return false;
}

void UnixSocketIPCListener::noteDeadline(Clock::time_point deadline) {
  if (!firstDeadline_ || deadline < *firstDeadline_) firstDeadline_ = deadline;
}

void UnixSocketIPCListener::handleDeadlines(Clock::time_point now) {
  if (now < *firstDeadline_) return;
  firstDeadline_.reset();
  if (isBackedOff_ && now >= acceptAgainAt_) {
    isBackedOff_ = !watchDescriptor(epoll_.get(), socket_.descriptor(), kSocketEvent);
    acceptAgainAt_ = now + limits::kAcceptBackOff;
  }
  if (isBackedOff_) noteDeadline(acceptAgainAt_);
  std::vector<PeerConnection::ID> waiting;
  std::swap(waiting, impatient_);
  for (const PeerConnection::ID id : waiting) {
    const auto found = connections_.find(id);
    if (found == connections_.end()) continue;
    found->second.isListedImpatient = false;
    const auto connection = found->second.connection;
    connection->checkPatience(now);
    settle(*connection);
  }
}

// -1, without end, unless somebody's time runs.
int UnixSocketIPCListener::millisecondsToWait() const {
  if (!firstDeadline_) return -1;
  const auto left =
      std::chrono::ceil<std::chrono::milliseconds>(*firstDeadline_ - now_());
  return static_cast<int>(std::max<std::int64_t>(left.count(), 0));
}

}  // namespace ostrel
