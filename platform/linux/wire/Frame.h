// The frames between client and service: a 4-byte little-endian length and one
// CBOR item. `docs/protocol.md` is the reference.
//
//   request  = [operation, number, arguments...]   number 0: no reply wanted
//                                                  (`OperationTable.h`)
//   farewell = [0]                                 the client ends well
//   reply    = [number, value] / [number, null, [domain, code, description]]
//   closing  = [0, reason]                         the service ends the connection
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <variant>

#include "Statistics/OstrelReportingTypes.h"
#include "platform/linux/wire/PayloadDecoder.h"

namespace ostrel::wire {

/// Numbers of the operations on the wire, in the protocol's order.
enum class Operation : std::uint8_t {
  kFarewell = 0,
  kCreateReportingSession = 1,
  kSetServiceType = 2,
  kGetServiceNameForReporterID = 3,
  kSetConfiguration = 4,
  kStartReportingSessionForID = 5,
  kSendMessage = 6,
  kStopReportingSessionForID = 7,
  kDestroyReportingSession = 8,
  kReporterIDValid = 9,
  kGetAllReporters = 10,
  kKillService = 11,
};

inline constexpr std::size_t kFrameHeaderSize = 4;

/// The length that the `kFrameHeaderSize` bytes at `header` say.
inline std::uint32_t frameLength(const std::uint8_t* header) {
  return std::uint32_t{header[0]} | std::uint32_t{header[1]} << 8 |
         std::uint32_t{header[2]} << 16 | std::uint32_t{header[3]} << 24;
}

/// Names a request among those of its connection; 0 asks for no reply.
using RequestNumber = std::uint64_t;

/// One request, decoded. Only the arguments of its operation are set.
struct Request {
  Operation operation = Operation::kFarewell;
  RequestNumber number = 0;
  ReporterID reporterID{0};
  ServiceType serviceType{0};
  MessageCategory category{0};
  MessageType type{0};
  std::optional<Dictionary> dictionary;  // The message or the configuration.
  std::optional<ReporterIDs> reporterIDs;
};

/// The session that a message goes to, by the frame's last bytes alone: a guess, for who
/// wants to know before the frame is decoded. 0: to none, to several, or no message.
ReporterID likelyReporterID(std::span<const std::uint8_t> item);

/// Decodes the item of one frame (without its length). Anything but exactly one
/// well-formed request with arguments in range is an error. When the item lies in
/// `owner`, which may be none, a dictionary is left there; else it is copied.
DecodeError decodeRequest(std::span<const std::uint8_t> item, const PayloadLimits& limits,
                          std::size_t mostIDs, const ValueBuffer& owner,
                          Request& request);

/// Each appends one whole frame, length included. Texts must be UTF-8.
void appendRequest(std::string& out, const Request& request);
void appendFarewell(std::string& out);

/// What a reply holds: nothing (null), boolean, service type, dictionary, IDs or
/// error.
using ReplyValue =
    std::variant<std::monostate, bool, ServiceType, Dictionary, ReporterIDs, ErrorObject>;

void appendReply(std::string& out, RequestNumber number, const ReplyValue& value);
void appendClosing(std::string& out, std::string_view reason);

/// A frame from the service: the reply to `number`, or, with number 0, the
/// closing with its reason.
struct Reply {
  RequestNumber number = 0;
  ReplyValue value;  // A service type comes as ServiceType.
  std::string closingReason;
};

/// Decodes the item of one frame from the service. `operationOf` names the
/// operation that a number was sent for, so that the value is read as that
/// operation's; a reply to a number that was never sent (none) is an error.
DecodeError decodeReply(
    std::span<const std::uint8_t> item, const PayloadLimits& limits,
    const std::function<std::optional<Operation>(RequestNumber)>& operationOf,
    Reply& reply);

/// Finds whole frames in a stream of bytes, where they were read. Keeps what is
/// not whole yet.
class FrameReader {
 public:
  explicit FrameReader(std::size_t mostFrameBytes) : mostFrameBytes_(mostFrameBytes) {}

  /// Room for at least `size` more bytes, to be read into; `added` says how many
  /// came. Views from `next` end here.
  std::span<std::uint8_t> room(std::size_t size);
  void added(std::size_t size);

  enum class Next { kFrame, kMoreNeeded, kTooLarge, kEmpty };
  /// The next whole frame's item, if there is one. `kTooLarge` and `kEmpty` are
  /// said as soon as the length is there, before any of the frame is kept.
  Next next(std::span<const std::uint8_t>& item);

  /// Whether a frame has begun that is not whole yet.
  bool isWithinFrame() const { return begin_ != end_; }

 private:
  std::size_t mostFrameBytes_;
  std::string buffer_;
  std::size_t begin_ = 0;
  std::size_t end_ = 0;
};

}  // namespace ostrel::wire
