// Requests of the public library as they travel. The frequent one is written
// without a detour over the protocol's values; `MessageTest.cpp` and
// `ClientServiceTest.cpp` hold it against the wire codec.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "ostrel/Message.h"
#include "platform/linux/wire/Frame.h"

namespace ostrel::reporting {

/// Appends a frame that sends `payload`, an encoded dictionary, and says where
/// in `out` the payload begins.
std::size_t appendSendMessage(std::string& out, wire::RequestNumber number,
                              std::string_view payload, Category category,
                              MessageType type,
                              const std::optional<ReporterIDs>& reporterIDs);

// Each appends one whole frame; number 0 asks for no reply.

/// A request whose argument is a reporter ID or nothing.
void appendRequest(std::string& out, wire::Operation operation,
                   wire::RequestNumber number, ReporterID reporterID);
void appendSetServiceType(std::string& out, wire::RequestNumber number,
                          ServiceType serviceType, ReporterID reporterID);
void appendSetConfiguration(std::string& out, wire::RequestNumber number,
                            const Message& configuration, ReporterID reporterID);

/// Writes the length of the frame that begins at `begin` and ends with `out`.
void setFrameLength(std::string& out, std::size_t begin);

}  // namespace ostrel::reporting
