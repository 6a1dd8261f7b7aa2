// What a service says to systemd and takes from it. The protocols are a few
// environment variables and a datagram: too little to load a library for.
#pragma once

#include <string_view>

namespace ostrel {

/// The first of the descriptors that `takePassedSockets` counts.
inline constexpr int kFirstPassedSocket = 3;

/// How many sockets were passed to this process (`LISTEN_PID`, `LISTEN_FDS`), from
/// `kFirstPassedSocket` on; they are closed in programs that this one starts. Takes
/// the variables out of the environment. A negative `errno` value when they are
/// wrong. Before there are threads.
int takePassedSockets();

/// Whether `descriptor` is a Unix stream socket that listens.
bool isListeningUnixStream(int descriptor);

/// Tells systemd such as "READY=1", if it asked to be told (`NOTIFY_SOCKET`).
void notifySystemd(std::string_view state);

}  // namespace ostrel
