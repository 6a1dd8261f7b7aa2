#include "platform/fake/FakeUse.h"

#include <cstdio>
#include <cstdlib>

namespace ostrel {

void checkFakeUse(bool isRight, const char* rule) {
  if (isRight) return;
  std::fprintf(stderr, "a fake is misused: %s\n", rule);
  std::abort();
}

}  // namespace ostrel
