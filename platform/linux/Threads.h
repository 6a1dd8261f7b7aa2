#pragma once

#include <functional>
#include <string>
#include <thread>

namespace ostrel {

/// Starts a thread that runs `body`. No signal is delivered to it. `name` is cut
/// to 15 bytes. `niceness` is for this thread alone; where the system does not
/// allow it, the thread keeps that of its maker. Throws std::system_error when
/// no thread can be made.
std::thread startThread(const std::string& name, int niceness,
                        std::function<void()> body);

}  // namespace ostrel
