#pragma once

#include <string>
#include <vector>

#include "forwarder/ForwarderSettings.h"

namespace ostrel {

/// The program with these arguments, its own name left out. Runs until SIGTERM or
/// SIGINT, or, with "--once", until what there is was forwarded. Gives the exit status:
/// 0 done, 1 failed, 2 wrong usage or settings; a sentence went to standard error.
int runForwarder(const std::vector<std::string>& arguments,
                 const Environment& environment);

}  // namespace ostrel
