#pragma once

#include <cstddef>
#include <string>
#include <string_view>

#include "ostrel/Message.h"

namespace ostrel::bench {

/// What every whole path carries: 10 entries (4 strings, 4 integers, a double, an
/// array), `kPayloadBytes` of CBOR.
reporting::Message examplePayload();
inline constexpr std::size_t kPayloadBytes = 185;

inline constexpr reporting::Category kExampleCategory{0x40000007};
inline constexpr reporting::MessageType kExampleType{1};
/// Of its identifiers, which end with its number in the session.
inline constexpr std::string_view kExampleName = "Routing_RouteChange_Start_";

/// The frame of the same payload without anything of ours around it: a length of 4
/// bytes and the payload.
std::string rawFrame();

/// Bytes of a message to one session as the client library sends it.
std::size_t bytesOnTheWire();

}  // namespace ostrel::bench
