#pragma once

namespace ostrel {

/// Ends the test program with a sentence when a fake is used as the real thing
/// must not be used.
void checkFakeUse(bool isRight, const char* rule);

}  // namespace ostrel
