#include "platform/linux/PeerConnection.h"

#include <sys/socket.h>
#include <sys/uio.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <utility>

#include "Statistics/Service/OstrelReportingServiceProtocol.h"
#include "platform/Logging.h"
#include "platform/linux/RequestDispatch.h"

namespace ostrel {
namespace {

// Read at a time: at first and at most.
constexpr std::size_t kFirstReadBytes = 16 * 1024;
constexpr std::size_t kLeastReadBytes = 4 * 1024;

// Work, in nanoseconds: what requests were seen to take on the server's queue, log lines
// included.
constexpr std::uint64_t kWorkOfRequest = 2000;
constexpr std::uint64_t kWorkOfConfiguration = 20'000;
constexpr std::uint64_t kWorkOfStart = 20'000;  // With the session's thread's.
constexpr std::uint64_t kWorkOfMessage = 500;
constexpr std::uint64_t kWorkOfDelivery = 500;
constexpr std::uint64_t kWorkOfByte = 2;
constexpr std::uint64_t kWorkOfLaterByte = 20;  // Of many keys, at the worst.
constexpr std::size_t kFirstBytes = 4096;
constexpr std::uint64_t kWorkOfReading = 2000;
constexpr std::uint64_t kWorkOfSessionListed = 100;
constexpr std::uint64_t kWorkOfSessionAsked = 200;

std::uint64_t workOf(const wire::Request& request, std::size_t bytes,
                     std::size_t sessionsOfAll) {
  const std::size_t first = std::min(bytes, kFirstBytes);
  const std::uint64_t work = first * kWorkOfByte + (bytes - first) * kWorkOfLaterByte;
  switch (request.operation) {
    case wire::Operation::kSendMessage:
      return work + kWorkOfMessage +
             (request.reporterIDs ? request.reporterIDs->size() * kWorkOfDelivery
                                  : sessionsOfAll * kWorkOfSessionAsked);
    case wire::Operation::kGetAllReporters:
      return work + kWorkOfRequest + sessionsOfAll * kWorkOfSessionListed;
    case wire::Operation::kSetConfiguration:
      return work + kWorkOfConfiguration;
    case wire::Operation::kStartReportingSessionForID:
      return work + kWorkOfStart;
    default:
      return work + kWorkOfRequest;
  }
}

// Read at a time while the user's clients have all under way that they may: part of what
// a connection has for itself then, since what cannot be carried out waits in memory.
constexpr std::size_t kReadInNeed = limits::kReservedQueuedBytes / 2;

// How many messages are known of before they are carried out.
constexpr int kMessagesAhead = 3;

// What of a frame is copied once more. A client that writes byte by byte makes the
// service copy half of this for each.
constexpr std::size_t kMostJoined = 2 * 1024;

// Descriptors that a client passes are nothing that it may do; they are closed.
bool closePassedDescriptors(msghdr& message) {
  bool hasPassed = (message.msg_flags & MSG_CTRUNC) != 0;
  for (cmsghdr* header = CMSG_FIRSTHDR(&message); header != nullptr;
       header = CMSG_NXTHDR(&message, header)) {
    if (header->cmsg_level != SOL_SOCKET || header->cmsg_type != SCM_RIGHTS) continue;
    hasPassed = true;
    const std::size_t count = (header->cmsg_len - CMSG_LEN(0)) / sizeof(int);
    for (std::size_t i = 0; i < count; ++i) {
      int descriptor;
      std::memcpy(&descriptor, CMSG_DATA(header) + i * sizeof descriptor,
                  sizeof descriptor);
      FileDescriptor passed(descriptor);
    }
  }
  return hasPassed;
}

// How many of the first bytes are frames that are whole and not too large; no further
// frame from `enough` on.
std::size_t wholeFrames(std::span<const std::uint8_t> bytes, std::size_t mostBytes,
                        std::size_t enough) {
  std::size_t whole = 0;
  while (whole < enough && bytes.size() - whole >= wire::kFrameHeaderSize) {
    const std::size_t length = wire::frameLength(bytes.data() + whole);
    if (length == 0 || length > mostBytes) break;
    if (bytes.size() - whole - wire::kFrameHeaderSize < length) break;
    whole += wire::kFrameHeaderSize + length;
  }
  return whole;
}

}  // namespace

PeerConnection::PeerConnection(ID id, FileDescriptor socket, PeerIdentity peer,
                               std::shared_ptr<PeerChannel> channel,
                               const ListenerLimits& limits, MisuseLog& misuse,
                               SessionOwners& owners)
    : id_(id),
      socket_(std::move(socket)),
      peer_(peer),
      channel_(std::move(channel)),
      limits_(limits),
      misuse_(misuse),
      owners_(owners),
      self_{id, peer.user},
      readBytes_(kFirstReadBytes) {}

std::string PeerConnection::description() const {
  return format("<connection %lu of process %i, user %u>", id_, peer_.pid, peer_.user);
}

void PeerConnection::setExportedObject(
    std::shared_ptr<OstrelReportingServiceProtocol> object) {
  object_ = std::move(object);
}

std::shared_ptr<OstrelReportingServiceProtocol> PeerConnection::exportedObject() const {
  return object_;
}

void PeerConnection::setInterruptionHandler(std::function<void()> handler) {
  interrupted_ = std::move(handler);
}

void PeerConnection::setInvalidationHandler(std::function<void()> handler) {
  invalidated_ = std::move(handler);
}

std::uint64_t PeerConnection::takeTurn(std::span<std::uint8_t> buffer) {
  work_ = 0;
  noteRefusedMerge();
  if (ending_ != Ending::kNone) return 0;
  if (std::exchange(isUnfinished_, false)) {
    if (!holdBackIfFull()) processPending();
  } else if (wantsToRead()) {
    work_ += kWorkOfReading;
    read(buffer);
  }
  return work_;
}

// What is pending is a frame that is not whole. A little is put before what comes
// next, so that a burst costs one call to the system; to more the rest is appended,
// so that a frame is copied twice however small its pieces are.
void PeerConnection::read(std::span<std::uint8_t> buffer) {
  // What cannot be carried out now stays in the socket.
  if (holdBackIfFull()) return;
  if (pending_.size() > kMostJoined) {
    const auto room = buffer.first(std::min(missingBytes(), buffer.size()));
    const ssize_t count = receive(room);
    if (count <= 0) return;
    pending_.append(reinterpret_cast<const char*>(room.data()),
                    static_cast<std::size_t>(count));
    processPending();
    return;
  }
  std::copy(pending_.begin(), pending_.end(), buffer.begin());
  std::span<std::uint8_t> room = buffer.subspan(pending_.size());
  // What would be held back, or wait for the next turn, stays in the socket.
  room = room.first(std::min(room.size(), channel_->isUserOverBudget()
                                              ? std::min(readBytes_, kReadInNeed)
                                              : readBytes_));
  const ssize_t count = receive(room);
  if (count <= 0) return;
  const auto bytes = buffer.first(pending_.size() + static_cast<std::size_t>(count));
  const std::size_t done = process(bytes);
  if (ending_ != Ending::kNone) return;
  if (!isTurnOver() && static_cast<std::size_t>(count) == room.size()) {
    readBytes_ = std::min(2 * readBytes_, buffer.size());
  }
  if (done != 0 || pending_.empty()) pendingSince_ = Clock::now();
  pending_.assign(reinterpret_cast<const char*>(bytes.data()) + done,
                  bytes.size() - done);
}

void PeerConnection::noteRefusedMerge() {
  if (!channel_->takeRefusedMerge()) return;
  misuse_.note(peer_.user, MisuseLog::Kind::kUserInfoRefused, "there is too much",
               Clock::now());
}

void PeerConnection::goOn() {
  if (!isHeldBack_ || ending_ != Ending::kNone) return;
  isHeldBack_ = false;
  isUnfinished_ = !holdBackIfFull() && !pending_.empty();
}

ssize_t PeerConnection::receive(std::span<std::uint8_t> room) {
  iovec place{room.data(), room.size()};
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))];
  msghdr message{};
  message.msg_iov = &place;
  message.msg_iovlen = 1;
  message.msg_control = control;
  message.msg_controllen = sizeof control;
  const ssize_t count =
      ::recvmsg(socket_.get(), &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
  if (count < 0) {
    if (errno == EAGAIN || errno == EINTR || errno == ENOMEM || errno == ENOBUFS) {
      return -1;
    }
    ending_ = Ending::kVanished;
    return -1;
  }
  if (closePassedDescriptors(message)) {
    breakOff(Ending::kBrokenRules, "descriptors are not taken");
    return -1;
  }
  if (count == 0) ending_ = Ending::kVanished;
  return count;
}

// How many bytes are whole requests that were carried out.
//
// Their payloads are left where they lie, in one copy of all that came: a burst of
// messages takes one piece of memory and not one each (some 120 ns a message less).
std::size_t PeerConnection::process(std::span<const std::uint8_t> bytes) {
  const std::size_t whole = wholeFrames(bytes, limits_.frameBytes, readBytes_);
  if (whole != 0 && holdBackIfFull()) return 0;
  ValueBuffer input = ValueBuffer::copyOfInput(bytes.first(whole), channel_);
  const auto frames = std::span(std::as_const(input).data(), whole);
  input_ = &input;
  std::size_t used = 0;
  std::size_t done = 0;
  std::size_t announced = 0;
  for (int i = 0; i < kMessagesAhead; ++i)
    announced += announce(frames.subspan(announced));
  while (done != whole && !isTurnOver() && !holdBackIfFull()) {
    const std::size_t length = wire::frameLength(frames.data() + done);
    announced += announce(frames.subspan(announced));
    used += carryOut(input, frames.subspan(done + wire::kFrameHeaderSize, length));
    if (ending_ != Ending::kNone || isHeldBack_) break;
    done += wire::kFrameHeaderSize + length;
  }
  // One message keeps all of them alive.
  if (used != 0) uncharged_ += input.memory() - used;
  chargeInput();
  input_ = nullptr;
  if (done == whole) checkNextFrame(bytes.subspan(whole));
  if (ending_ != Ending::kNone || isHeldBack_) return done;
  if (isTurnOver()) readBytes_ = std::clamp(done, kLeastReadBytes, readBytes_);
  isUnfinished_ = wholeFrames(bytes.subspan(done), limits_.frameBytes, /*enough=*/1) != 0;
  return done;
}

// Says whom the message in the first of the frames is for, so that what it needs can be
// fetched while others are carried out. How many bytes it has.
std::size_t PeerConnection::announce(std::span<const std::uint8_t> frames) {
  if (frames.empty()) return 0;
  const std::size_t size = wire::kFrameHeaderSize + wire::frameLength(frames.data());
  const ReporterID id = wire::likelyReporterID(
      frames.subspan(wire::kFrameHeaderSize, size - wire::kFrameHeaderSize));
  // Of several to one session the first is enough.
  const bool isAnother = std::exchange(lastAnnounced_, id) != id;
  object_->expectMessage(isAnother ? id : kNoReporter);
  if (isAnother && owners_.areKept()) owners_.fetchAhead(id);
  return size;
}

// The client's sessions, as they will be when the request has run. False: it would
// make one too many. A session under the ID 0 cannot be destroyed.
bool PeerConnection::countSession(const wire::Request& request) {
  const ReporterID id = request.reporterID;
  if (request.operation == wire::Operation::kDestroyReportingSession) {
    if (id != kNoReporter && sessions_.erase(id)) {
      channel_->giveSessions(1);
      owners_.remove(id, self_);
    }
    return true;
  }
  if (request.operation != wire::Operation::kCreateReportingSession) return true;
  if (sessions_.contains(id)) return true;
  if (!channel_->takeSession()) {
    misuse_.note(peer_.user, MisuseLog::Kind::kSessionRefused, "there are too many",
                 Clock::now());
    return false;
  }
  sessions_.insert(id);
  owners_.enter(id, self_);
  return true;
}

void PeerConnection::enterSessions() {
  sessions_.forEach([this](ReporterID id) { owners_.enter(id, self_); });
}

// Whoever may connect may do that. To set the type of a session and to destroy it is left
// to the client that made it, and what is for all sessions is for nobody's.
void PeerConnection::noteUseOfOthers(const wire::Request& request) {
  switch (request.operation) {
    case wire::Operation::kSetConfiguration:
      return noteUseOfOthers(request.reporterID, "configures");
    case wire::Operation::kStartReportingSessionForID:
      return noteUseOfOthers(request.reporterID, "starts");
    case wire::Operation::kStopReportingSessionForID:
      return noteUseOfOthers(request.reporterID, "stops");
    case wire::Operation::kSendMessage:
      if (!request.reporterIDs) return;
      for (const ReporterID id : *request.reporterIDs) noteUseOfOthers(id, "sends to");
      return;
    default:
      return;
  }
}

void PeerConnection::noteUseOfOthers(ReporterID id, std::string_view deed) {
  const SessionOwners::Owner* const owner = owners_.find(id);
  if (owner == nullptr || owner == &self_ || owner->user == peer_.user) return;
  if (usesOfOthers_.count++ == 0) usesOfOthers_.first = {deed, id, owner->user};
}

void PeerConnection::checkNextFrame(std::span<const std::uint8_t> bytes) {
  if (bytes.size() < wire::kFrameHeaderSize || ending_ != Ending::kNone) return;
  const std::size_t length = wire::frameLength(bytes.data());
  if (length == 0) breakOff(Ending::kBrokenRules, "a frame is empty");
  if (length > limits_.frameBytes) {
    breakOff(Ending::kBrokenRules, "a frame is too large");
  }
}

void PeerConnection::processPending() {
  const auto* bytes = reinterpret_cast<const std::uint8_t*>(pending_.data());
  const std::size_t done = process({bytes, pending_.size()});
  pending_.erase(0, done);
  if (done != 0) pendingSince_ = Clock::now();
  if (pending_.empty()) pending_.shrink_to_fit();
}

// Of the payload and what is made of it.
std::size_t PeerConnection::costOf(const wire::Request& request,
                                   std::size_t bytes) const {
  if (!request.dictionary) return 0;
  std::size_t cost = bytes + limits::kRequestBytes;
  if (request.operation != wire::Operation::kSendMessage) return cost;
  // To all that are started, which are few of many at most times.
  const std::size_t deliveries =
      request.reporterIDs ? request.reporterIDs->size()
                          : std::min(channel_->sessionsOfAll(), limits_.reporterIDs);
  // Each is written to a list and to the store.
  if (deliveries > 1) cost += (deliveries - 1) * (limits::kDeliveryBytes + bytes);
  return cost;
}

// Nothing where the request has to wait. How many bytes of `input` were charged to it:
// all of a request with a payload.
std::size_t PeerConnection::carryOut(ValueBuffer& input,
                                     std::span<const std::uint8_t> item) {
  wire::Request request;
  const wire::DecodeError error =
      wire::decodeRequest(item, limits_.payload, limits_.reporterIDs, input, request);
  if (error) {
    breakOff(Ending::kBrokenRules, *error);
    return 0;
  }
  if (request.operation == wire::Operation::kFarewell) {
    ending_ = Ending::kFarewell;
    return 0;
  }
  // A client that has gone may have left thousands of questions behind.
  if (isDeaf_ && onlyAsks(request.operation)) return 0;
  work_ += workOf(request, item.size(), channel_->sessionsOfAll());
  const std::size_t cost = costOf(request, item.size());
  if (channel_->mustWaitForLarge(cost)) {
    isHeldBack_ = true;
    return 0;
  }
  if (!countSession(request)) {
    dispatchRefusedSession(*object_, channel_, request);
    return 0;
  }
  if (owners_.areKept()) noteUseOfOthers(request);
  const std::size_t used = request.dictionary ? item.size() : 0;
  uncharged_ += cost;
  if (cost > limits_.mostReservedBytes) {
    chargeInput();
    channel_->noteLarge();
  }
  if (keepsReply(request.operation)) {
    needsProbe_ = true;
  } else if (request.number != 0) {
    needsProbe_ = false;
  }
  dispatchRequest(*object_, channel_, request);
  return used;
}

std::size_t PeerConnection::unreadBytesToPause() const {
  return std::min(limits_.unreadReplyBytesToPause, channel_->mostUnreadBytes() / 4);
}

// What requests with a payload cost is charged once for all of a read, or as soon as it
// matters: for each it would be two locked additions (30 ns a message).
void PeerConnection::chargeInput() {
  if (uncharged_ != 0) input_->charge(std::exchange(uncharged_, 0));
}

bool PeerConnection::holdBackIfFull() {
  const bool hasManyUnread = channel_->unreadBytes() > unreadBytesToPause();
  if (!hasManyUnread && !channel_->isOverBudget(uncharged_)) return false;
  chargeInput();
  if (channel_->isOverBudget() && std::exchange(needsProbe_, false)) {
    dispatchProbe(*object_, channel_);
  }
  isHeldBack_ = hasManyUnread || channel_->awaitBudget();
  return isHeldBack_;
}

// The bytes up to the end of the pending frame, or of its length.
std::size_t PeerConnection::missingBytes() const {
  if (pending_.size() < wire::kFrameHeaderSize) {
    return wire::kFrameHeaderSize - pending_.size();
  }
  const auto* header = reinterpret_cast<const std::uint8_t*>(pending_.data());
  const std::size_t whole = wire::kFrameHeaderSize + wire::frameLength(header);
  return whole > pending_.size() ? whole - pending_.size() : 1;
}

void PeerConnection::write(Clock::time_point now) {
  noteRefusedMerge();
  const std::size_t before = channel_->unreadBytes();
  // A client that cannot be written to has gone; what it sent is still read.
  if (!channel_->flush(socket_.get())) {
    isDeaf_ = true;
    channel_->close();
  }
  const std::size_t after = channel_->unreadBytes();
  if (after < before || !hasUnread_) lastRead_ = now;
  hasUnread_ = after != 0;
  if (channel_->hasTooManyUnread()) {
    breakOff(Ending::kBrokenRules, "too many replies are unread");
  }
}

void PeerConnection::checkPatience(Clock::time_point now) {
  if (!hasUnread_ || now < patienceEnds()) return;
  if (channel_->unreadBytes() <=
      std::min(limits_.unreadReplyBytesToPause, channel_->mostUnreadBytes())) {
    lastRead_ = now;
    return;
  }
  breakOff(Ending::kBrokenRules, "the replies are not read");
}

std::size_t PeerConnection::untakenBytes() const {
  if (!hasUnread_) return 0;
  const std::size_t unread = channel_->unreadBytes();
  return unread > limits::kUnreadReplyBytesInNeed ? unread : 0;
}

void PeerConnection::breakOff(Ending ending, std::string_view reason) {
  if (ending_ != Ending::kNone) return;
  ending_ = ending;
  reason_ = reason;
  channel_->close(reason);
  channel_->flush(socket_.get());
}

std::shared_ptr<void> PeerConnection::invalidate() {
  noteRefusedMerge();
  if (ending_ == Ending::kFarewell) channel_->flush(socket_.get());
  channel_->close();
  socket_.reset();
  // Whoever never was served is not interrupted.
  const bool isInterrupted = ending_ == Ending::kVanished ||
                             ending_ == Ending::kBrokenRules ||
                             (ending_ == Ending::kRefused && isResumed_);
  if (isInterrupted && interrupted_) interrupted_();
  if (invalidated_) invalidated_();
  if (owners_.areKept()) {
    sessions_.forEach([this](ReporterID id) { owners_.remove(id, self_); });
  }
  interrupted_ = nullptr;
  invalidated_ = nullptr;
  struct Estate {
    ~Estate() {
      object.reset();
      channel->giveSessions(sessions);
    }
    std::shared_ptr<OstrelReportingServiceProtocol> object;
    std::shared_ptr<PeerChannel> channel;
    std::size_t sessions;
  };
  return std::shared_ptr<Estate>(
      new Estate{std::move(object_), channel_, sessions_.size()});
}

}  // namespace ostrel
