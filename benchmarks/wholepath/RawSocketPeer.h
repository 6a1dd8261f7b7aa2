// What a stream socket alone can do with the same bytes: the measure of everything
// that is built on one. Its other end is a process that walks the frames and counts.
#pragma once

#include <cstdint>

#include "benchmarks/wholepath/ChildProcess.h"

namespace ostrel::bench {

struct PeerResult {
  double messagesPerSecond = 0;
  double processorNanoseconds = 0;  // A message, both ends together.
};

/// Sends `messages` frames in writes of 64 KiB.
PeerResult runRawBatched(std::uint64_t messages);

/// Sends `messages` frames, one write each.
PeerResult runRawSingle(std::uint64_t messages);

/// A frame there and a small one back, one at a time, both ends on one processor.
/// Microseconds a round trip.
double runRawRoundTripOnOneCore(std::uint64_t roundTrips);

}  // namespace ostrel::bench
