#pragma once

#include <cstdint>
#include <deque>
#include <map>
#include <mutex>

#include "platform/IPCListener.h"
#include "platform/linux/FileDescriptor.h"

namespace ostrel {

/// Holds a grip on the process of each connected client until its name was looked
/// up: a process descriptor, which never comes to mean another process although the
/// id may. Shared by the listener and the process information. Any thread.
class PeerRegistry {
 public:
  /// What is known of the process that a client's id meant when it connected.
  struct Peer {
    bool wasConnected = false;  // The other two mean something.
    bool isConnected = false;   // Not any more: its id may be another's by now.
    FileDescriptor descriptor;  // Readable once the process has ended. None: unknown.
  };

  using Key = std::uint64_t;

  /// A client with the id `pid` connected. `connection` names the connection.
  void peerConnected(ProcessID pid, Key connection, FileDescriptor descriptor);

  /// The connection ended. Its look-up may still come.
  void peerDisconnected(ProcessID pid, Key connection);

  /// Hands out the oldest connection of `pid` that was not handed out before.
  Peer takePeer(ProcessID pid);

 private:
  struct Entry {
    Key connection;
    bool isConnected;
    FileDescriptor descriptor;
  };

  std::mutex mutex_;
  std::map<ProcessID, std::deque<Entry>> peers_;
};

}  // namespace ostrel
