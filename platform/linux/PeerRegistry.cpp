#include "platform/linux/PeerRegistry.h"

#include <unistd.h>

#include <algorithm>

namespace ostrel {

void PeerRegistry::peerConnected(ProcessID pid, Key connection,
                                 FileDescriptor descriptor) {
  // The service's own name is never looked up, so its entries would stay.
  if (pid <= 0 || pid == ::getpid()) return;
  const std::lock_guard lock(mutex_);
  peers_[pid].push_back({connection, /*isConnected=*/true, std::move(descriptor)});
}

void PeerRegistry::peerDisconnected(ProcessID pid, Key connection) {
  const std::lock_guard lock(mutex_);
  const auto peers = peers_.find(pid);
  if (peers == peers_.end()) return;
  for (Entry& entry : peers->second) {
    if (entry.connection != connection) continue;
    entry.isConnected = false;
    entry.descriptor.reset();
  }
}

PeerRegistry::Peer PeerRegistry::takePeer(ProcessID pid) {
  const std::lock_guard lock(mutex_);
  const auto peers = peers_.find(pid);
  if (peers == peers_.end()) return {};
  Entry entry = std::move(peers->second.front());
  peers->second.pop_front();
  if (peers->second.empty()) peers_.erase(peers);
  return {/*wasConnected=*/true, entry.isConnected, std::move(entry.descriptor)};
}

}  // namespace ostrel
