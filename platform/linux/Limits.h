// Every limit of the service, each with its reason. Limits live in the bindings;
// the core knows none.
#pragma once

#include <chrono>
#include <cstddef>

namespace ostrel::limits {

/// Of one frame, its length field left out. Payloads of 256 KiB must fit with
/// their request around them.
inline constexpr std::size_t kFrameBytes = 320 * 1024;

/// Arrays and dictionaries within one another in a payload. Deeper ones are no
/// reports; walks stay short.
inline constexpr std::size_t kNesting = 32;

/// Values in one payload, keys included: bounds the work that one frame causes.
inline constexpr std::size_t kNodes = 65536;

/// Of one text key.
inline constexpr std::size_t kKeyBytes = 1024;

/// IDs in one request: each is one delivery.
inline constexpr std::size_t kReporterIDs = 1024;

/// Connections in all, and of one user. Room for 512 and for load tests of
/// 1,000 by one user.
inline constexpr std::size_t kConnections = 2048;
inline constexpr std::size_t kConnectionsOfUser = 1536;

/// Payload bytes of one connection that are accepted and not yet delivered and
/// stored. Beyond it the socket is not read until half of it is free again.
inline constexpr std::size_t kQueuedBytes = 4 * 1024 * 1024;

/// Reply bytes that a client has not read. Beyond it the client is cut off.
inline constexpr std::size_t kUnreadReplyBytes = 1024 * 1024;

}  // namespace ostrel::limits
