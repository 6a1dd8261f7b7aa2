#include "platform/WorkQueue.h"

#include <cstdio>
#include <cstdlib>

namespace ostrel {

void WorkQueue::assertCurrent() const {
  if (isCurrent()) return;
  std::fprintf(stderr, "<2>work of queue \"%s\" runs off its queue\n", label().c_str());
  std::abort();
}

}  // namespace ostrel
