// What a session's end is made of: pure functions, no logging, no I/O.
#pragma once

#include <optional>
#include <string>

#include "Statistics/OstrelReportingTypes.h"
#include "Statistics/Service/OstrelReportingAggregatedPayloads.h"
#include "platform/Clock.h"

namespace ostrel {

/// A copy of `message` in which each blank of a text key is "_"; other keys and
/// all values as they are. Of keys that become equal the later one wins. The
/// message itself when no key holds a blank.
Dictionary SanitisedPayload(const Dictionary& message);

/// {"Ostrel_Session_Summary_Event": the type's number as text} and, for each key
/// of the entries, the descriptions of its values in order, joined by ",".
Dictionary summaryEvent(ServiceType serviceType,
                        const OstrelReportingAggregatedPayloads::Snapshot& entries);

/// The session log's name: date, "-ostrel-", host application, service type.
/// `hostApplication` none stands as the null text.
std::string sessionLogFileName(const Clock& clock, Date date,
                               const std::optional<Value>& hostApplication,
                               ServiceType serviceType);

}  // namespace ostrel
