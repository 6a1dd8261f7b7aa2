#pragma once

#include <functional>
#include <string>
#include <thread>

namespace ostrel {

/// Of the threads that clients wait for: they have a processor before all that is less
/// urgent.
inline constexpr int kInteractiveNiceness = -5;

/// Of the calling thread alone. False where the system does not allow it.
bool setNiceness(int niceness);

/// Starts a thread that runs `body`. No signal is delivered to it. `name` is cut
/// to 15 bytes. Where the system does not allow `niceness`, the thread keeps that of its
/// maker. Throws std::system_error when no thread can be made.
std::thread startThread(const std::string& name, int niceness,
                        std::function<void()> body);

}  // namespace ostrel
