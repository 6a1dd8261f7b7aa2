#pragma once

#include <memory>

#include "Statistics/Service/OstrelReportingServiceProtocol.h"
#include "platform/linux/PeerChannel.h"
#include "platform/linux/wire/Frame.h"

namespace ostrel {

/// Calls the operation that `request` names, on `object`. Its replies go to `channel`
/// under the request's number; a request without one gets a reply callback all the
/// same where that tells when the request has run. `request` is used up and must not
/// be a farewell.
void dispatchRequest(OstrelReportingServiceProtocol& object,
                     const std::shared_ptr<PeerChannel>& channel, wire::Request& request);

/// Answers the creation of a session that is one too many: YES, in its turn, and
/// nothing is made.
void dispatchRefusedSession(OstrelReportingServiceProtocol& object,
                            const std::shared_ptr<PeerChannel>& channel,
                            const wire::Request& request);

/// Whether the reply callback of an operation may be kept long after the operation
/// has run.
bool keepsReply(wire::Operation operation);

/// Whether an operation changes nothing: without anybody to reply to, it need not run.
bool onlyAsks(wire::Operation operation);

/// Queues a request on `object` that changes nothing; its only purpose is to learn when
/// everything before it has run.
void dispatchProbe(OstrelReportingServiceProtocol& object,
                   const std::shared_ptr<PeerChannel>& channel);

}  // namespace ostrel
