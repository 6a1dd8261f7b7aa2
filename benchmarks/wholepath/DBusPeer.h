// The usual way between processes here: method calls through a message bus daemon.
#pragma once

#include <cstdint>

#include "benchmarks/wholepath/RawSocketPeer.h"

namespace ostrel::bench {

/// Sends `messages` calls that want no reply, the example payload as a dictionary,
/// through a daemon of its own. The processor time is that of sender, daemon and
/// receiver.
PeerResult runDBusOneWay(std::uint64_t messages);

}  // namespace ostrel::bench
