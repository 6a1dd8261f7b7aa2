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

/// Bytes of one connection's requests that are accepted and not yet carried out,
/// delivered and stored. Beyond it the socket is not read until half of it is free
/// again. Some 10,000 messages of usual size: the store's next commit always finds
/// enough to write.
inline constexpr std::size_t kQueuedBytes = 4 * 1024 * 1024;

/// The same of all connections of one user, so that many connections do not make
/// many times the memory.
inline constexpr std::size_t kQueuedBytesOfUser = 32 * 1024 * 1024;

/// Sessions in all, and of one user. Room for the 16,384 that are promised and for
/// load tests of 100,000 by one user; an idle session costs some 500 bytes.
inline constexpr std::size_t kSessions = 256 * 1024;
inline constexpr std::size_t kSessionsOfUser = 128 * 1024;

/// Bytes of the entries that sessions keep for their summaries, in all, and of the
/// messages of one user's clients. Room for a session of a million messages with its
/// summary, twice. What is beyond a small budget in memory is in files.
inline constexpr std::size_t kKeptBytes = std::size_t{2} * 1024 * 1024 * 1024;
inline constexpr std::size_t kKeptBytesOfUser = std::size_t{1} * 1024 * 1024 * 1024;

/// What a request costs on a queue beside its payload: the step, its place in the
/// queue, the buffer's head.
inline constexpr std::size_t kRequestBytes = 256;

/// What each delivery of a message costs beyond the first: its step on the queue of the
/// session, and its place in the store's. A message to all is taken to go to every
/// session that there is.
inline constexpr std::size_t kDeliveryBytes = 512;

/// What a request that wants a reply costs besides: the callback, and the reply
/// that it causes. Keeps the replies to what is queued below `kUnreadReplyBytes`.
inline constexpr std::size_t kReplyBytes = 256;

/// Reply bytes that a client has not read. Beyond it the client is cut off. A reply
/// that is larger alone is sent all the same.
inline constexpr std::size_t kUnreadReplyBytes = 1024 * 1024;

/// Reply bytes from which on no further requests are read; a client that is merely
/// slow stays below `kUnreadReplyBytes` by it.
inline constexpr std::size_t kUnreadReplyBytesToPause = kUnreadReplyBytes / 4;

/// How long such a client may read nothing at all before it is cut off.
inline constexpr std::chrono::seconds kUnreadPatience{3};

/// How long no connection is accepted once the process or the system has no
/// descriptor left.
inline constexpr std::chrono::milliseconds kAcceptBackOff{100};

/// How often one kind of misuse by one user is logged.
inline constexpr std::chrono::seconds kMisuseLogInterval{60};

/// Memory of what one session collects until its stop; what is more lies in a file.
/// A thousand messages of usual size, which few sessions reach.
inline constexpr std::size_t kListBytesInMemory = 256 * 1024;

/// The same of all sessions together: a hundred long ones at a time, and a small part of
/// what the service may have. Each session begins with 1 KiB whatever the others have.
inline constexpr std::size_t kListsBytesInMemory = 24 * 1024 * 1024;

/// How long that file is left alone once it could not be written: a disk that is full
/// is not asked with each message.
inline constexpr std::chrono::milliseconds kPauseOfListsFile{1000};

/// Sessions that watch the orientation of the device at a time, and that of the
/// interface. One that its client left while it was starting never ends, and costs some 5
/// KiB.
inline constexpr std::size_t kOrientationObservers = 2048;

}  // namespace ostrel::limits
