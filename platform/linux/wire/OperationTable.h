// The operations as they travel: one row each.
#pragma once

#include <array>
#include <cstdint>
#include <span>
#include <string_view>

#include "platform/linux/wire/Frame.h"

namespace ostrel::wire {

enum class Argument : std::uint8_t {
  kReporterID,             // Integer of 64 bits, signed.
  kServiceType,            // 0 to 65535.
  kCategory,               // 0 to 4294967295.
  kType,                   // 0 to 65535.
  kMessage,                // Dictionary.
  kOptionalConfiguration,  // Dictionary or null.
  kOptionalReporterIDs,    // Array of reporter IDs, or null.
};

enum class ReplyKind : std::uint8_t {
  kNone,
  kBoolean,
  kServiceType,
  kNull,  // Or an error.
  kDictionary,
  kReporterIDs,
};

struct OperationRow {
  Operation operation;
  std::string_view name;
  std::span<const Argument> arguments;
  ReplyKind reply;
};

namespace rows {
using enum Argument;
inline constexpr Argument kID[] = {kReporterID};
inline constexpr Argument kSetType[] = {Argument::kServiceType, kReporterID};
inline constexpr Argument kConfigure[] = {kOptionalConfiguration, kReporterID};
inline constexpr Argument kSend[] = {kMessage, kCategory, kType, kOptionalReporterIDs};
}  // namespace rows

inline constexpr std::array<OperationRow, 12> kOperationTable = {{
    {Operation::kFarewell, "farewell", {}, ReplyKind::kNone},
    {Operation::kCreateReportingSession, "createReportingSession:reply:", rows::kID,
     ReplyKind::kBoolean},
    {Operation::kSetServiceType, "setServiceType:reportingSession:reply:", rows::kSetType,
     ReplyKind::kBoolean},
    {Operation::kGetServiceNameForReporterID,
     "getServiceNameForReporterID:reply:", rows::kID, ReplyKind::kServiceType},
    {Operation::kSetConfiguration,
     "setConfiguration:forReporterID:reply:", rows::kConfigure, ReplyKind::kBoolean},
    {Operation::kStartReportingSessionForID,
     "startReportingSessionForID:reply:", rows::kID, ReplyKind::kBoolean},
    {Operation::kSendMessage, "sendMessage:withCategory:andType:forReportingIDs:reply:",
     rows::kSend, ReplyKind::kNull},
    {Operation::kStopReportingSessionForID, "stopReportingSessionForID:reply:", rows::kID,
     ReplyKind::kBoolean},
    {Operation::kDestroyReportingSession, "destroyReportingSession:reply:", rows::kID,
     ReplyKind::kBoolean},
    {Operation::kReporterIDValid, "reporterID:valid:", rows::kID, ReplyKind::kDictionary},
    {Operation::kGetAllReporters, "getAllReporters:", {}, ReplyKind::kReporterIDs},
    {Operation::kKillService, "killService:", {}, ReplyKind::kBoolean},
}};

/// `operation` must be one of the enumerators.
constexpr const OperationRow& rowOf(Operation operation) {
  return kOperationTable[static_cast<std::size_t>(operation)];
}

}  // namespace ostrel::wire
