// What a request costs until it has run. A payload is charged to the connection's
// account for as long as its bytes live anywhere. Everything else that a request
// keeps in memory (the step on the queue, its ID list, its reply) is charged by a
// ticket that the reply callback owns. Requests run in the order in which they were
// queued, so that a ticket that is called or dropped says the same of all before it.
// What a request puts on a session's queue, and from there into the store's, is none of
// these: it is charged to a burden that travels with it.
#include "platform/linux/RequestDispatch.h"

#include <array>
#include <utility>

#include "platform/linux/Burden.h"
#include "platform/linux/Limits.h"
#include "platform/linux/wire/OperationTable.h"

namespace ostrel {
namespace {

using wire::Operation;
using wire::Request;
using Protocol = OstrelReportingServiceProtocol;

// IDs up to this number are part of `limits::kRequestBytes`.
constexpr std::size_t kFewIDs = 8;

// The replies of all such requests under way stay below the unread limit.
constexpr std::size_t kIDsReplyWeight = 8;

class RequestTicket {
 public:
  RequestTicket(std::shared_ptr<PeerChannel> channel, wire::RequestNumber number,
                std::uint64_t mark)
      : channel_(std::move(channel)), number_(number), mark_(mark) {}
  RequestTicket(const RequestTicket&) = delete;
  RequestTicket& operator=(const RequestTicket&) = delete;
  ~RequestTicket() { channel_->requestsRan(mark_); }

  void reply(const wire::ReplyValue& value) const {
    channel_->requestsRan(mark_);
    if (number_ != 0) channel_->reply(number_, value);
  }

 private:
  const std::shared_ptr<PeerChannel> channel_;
  const wire::RequestNumber number_;
  const std::uint64_t mark_;
};

// One for a request that was charged so much; none for nothing.
std::shared_ptr<RequestTicket> ticketFor(const std::shared_ptr<PeerChannel>& channel,
                                         wire::RequestNumber number, std::size_t cost) {
  if (cost == 0) return nullptr;
  return std::make_shared<RequestTicket>(channel, number, channel->chargeRequest(cost));
}

class SessionStepBurden final : public Burden {
 public:
  SessionStepBurden(std::shared_ptr<PeerChannel> channel, std::size_t bytes)
      : Burden(channel->user()), channel_(std::move(channel)), bytes_(bytes) {
    channel_->charge(bytes_);
  }

 private:
  ~SessionStepBurden() override { channel_->relieve(bytes_); }

  const std::shared_ptr<PeerChannel> channel_;
  const std::size_t bytes_;
};

// Of what a request leaves for a session's queue to do.
std::size_t burdenOf(Operation operation) {
  switch (operation) {
    case Operation::kStartReportingSessionForID:
      return limits::kStartBytes;
    case Operation::kSetServiceType:
    case Operation::kStopReportingSessionForID:
    case Operation::kDestroyReportingSession:
      return limits::kSessionStepBytes;
    default:
      return 0;
  }
}

// A reply callback of any of the protocol's types, or none.
class Reply {
 public:
  explicit Reply(std::shared_ptr<RequestTicket> ticket) : ticket_(std::move(ticket)) {}

  operator ErrorReply() && {
    if (!ticket_) return {};
    return [ticket = std::move(ticket_)](const std::optional<ErrorObject>& error) {
      ticket->reply(error ? wire::ReplyValue(*error) : wire::ReplyValue());
    };
  }

  template <typename Argument>
  operator std::function<void(Argument)>() && {
    if (!ticket_) return {};
    return [ticket = std::move(ticket_)](Argument value) { ticket->reply(value); };
  }

 private:
  std::shared_ptr<RequestTicket> ticket_;
};

// What a request costs beside its payload.
std::size_t costOf(const Request& request, const PeerChannel& channel) {
  std::size_t cost = request.number != 0 ? limits::kReplyBytes : 0;
  if (request.operation == Operation::kGetAllReporters) {
    cost += kIDsReplyWeight * channel.idsReplyBytes();
  }
  if (request.reporterIDs && request.reporterIDs->size() > kFewIDs) {
    cost += request.reporterIDs->size() * sizeof(ReporterID);
  }
  // A message brings this charge along with its payload.
  if (request.operation != Operation::kSendMessage) cost += limits::kRequestBytes;
  if (request.operation == Operation::kSetConfiguration && request.dictionary) {
    cost += request.dictionary->value().bytes().size();
  }
  return cost;
}

// One row for each operation: the call. Names and arguments are in
// `wire::kOperationTable`.
struct Handler {
  Operation operation;
  void (*call)(Protocol& object, Request& request, Reply reply);
};

constexpr std::array<Handler, 12> kHandlers = {{
    {Operation::kFarewell, [](Protocol&, Request&, Reply) {}},
    {Operation::kCreateReportingSession,
     [](Protocol& object, Request& request, Reply reply) {
       object.createReportingSession(request.reporterID, std::move(reply));
     }},
    {Operation::kSetServiceType,
     [](Protocol& object, Request& request, Reply reply) {
       object.setServiceType(request.serviceType, request.reporterID, std::move(reply));
     }},
    {Operation::kGetServiceNameForReporterID,
     [](Protocol& object, Request& request, Reply reply) {
       object.getServiceNameForReporterID(request.reporterID, std::move(reply));
     }},
    {Operation::kSetConfiguration,
     [](Protocol& object, Request& request, Reply reply) {
       object.setConfiguration(std::move(request.dictionary), request.reporterID,
                               std::move(reply));
     }},
    {Operation::kStartReportingSessionForID,
     [](Protocol& object, Request& request, Reply reply) {
       object.startReportingSessionForID(request.reporterID, std::move(reply));
     }},
    {Operation::kSendMessage,
     [](Protocol& object, Request& request, Reply reply) {
       object.sendMessage(*std::move(request.dictionary), request.category, request.type,
                          std::move(request.reporterIDs), std::move(reply));
     }},
    {Operation::kStopReportingSessionForID,
     [](Protocol& object, Request& request, Reply reply) {
       object.stopReportingSessionForID(request.reporterID, std::move(reply));
     }},
    {Operation::kDestroyReportingSession,
     [](Protocol& object, Request& request, Reply reply) {
       object.destroyReportingSession(request.reporterID, std::move(reply));
     }},
    {Operation::kReporterIDValid,
     [](Protocol& object, Request& request, Reply reply) {
       object.reporterIDValid(request.reporterID, std::move(reply));
     }},
    {Operation::kGetAllReporters,
     [](Protocol& object, Request&, Reply reply) {
       object.getAllReporters(std::move(reply));
     }},
    {Operation::kKillService, [](Protocol& object, Request&,
                                 Reply reply) { object.killService(std::move(reply)); }},
}};

constexpr bool rowsStandInOrder() {
  for (std::size_t i = 0; i < kHandlers.size(); ++i) {
    if (kHandlers[i].operation != wire::kOperationTable[i].operation) return false;
  }
  return true;
}
static_assert(rowsStandInOrder(), "handlers and operations are one table");

// A configuration of nothing for nobody changes nothing, is answered with YES and costs
// the same however many sessions there are.
void changeNothing(Protocol& object, Reply reply) {
  object.setConfiguration(/*configuration=*/std::nullopt, kNoReporter, std::move(reply));
}

}  // namespace

void dispatchRequest(OstrelReportingServiceProtocol& object,
                     const std::shared_ptr<PeerChannel>& channel,
                     wire::Request& request) {
  auto ticket = ticketFor(channel, request.number, costOf(request, *channel));
  BurdenShare burden;
  if (const std::size_t bytes = burdenOf(request.operation); bytes != 0) {
    burden = BurdenShare(new SessionStepBurden(channel, bytes));
  }
  const Burden::Scope bearing(burden.get());
  const auto row = static_cast<std::size_t>(request.operation);
  kHandlers[row].call(object, request, Reply(std::move(ticket)));
}

void dispatchRefusedSession(OstrelReportingServiceProtocol& object,
                            const std::shared_ptr<PeerChannel>& channel,
                            const wire::Request& request) {
  changeNothing(object,
                Reply(ticketFor(channel, request.number, costOf(request, *channel))));
}

bool keepsReply(wire::Operation operation) {
  return operation == Operation::kStartReportingSessionForID;
}

bool onlyAsks(wire::Operation operation) {
  return operation == Operation::kGetServiceNameForReporterID ||
         operation == Operation::kReporterIDValid ||
         operation == Operation::kGetAllReporters;
}

void dispatchProbe(OstrelReportingServiceProtocol& object,
                   const std::shared_ptr<PeerChannel>& channel) {
  changeNothing(object, Reply(ticketFor(channel, /*number=*/0, limits::kRequestBytes)));
}

}  // namespace ostrel
