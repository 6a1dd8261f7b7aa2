#pragma once

namespace ostrel {

/// Lets the heap keep some free memory: giving it back to the system after every
/// batch of requests, and taking it again for the next, costs 4 page faults for 100
/// messages. Once, at the start.
void keepHeapForBursts();

/// Gives what is free back to the system. Takes some 100 us after a burst; for when
/// nothing else is to be done.
void giveBackHeap();

}  // namespace ostrel
