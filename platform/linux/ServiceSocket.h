#pragma once

#include <string>

#include "platform/Outcome.h"
#include "platform/linux/FileDescriptor.h"

namespace ostrel {

/// The socket on which the service listens: one that systemd passed, or its own at a
/// path. Its own is locked for as long as this lives, and its file removed after.
class ServiceSocket {
 public:
  /// The socket that the environment passes (`LISTEN_FDS`), else `bind(path)`. The
  /// environment is cleared of it. An error is a sentence for people.
  static Outcome<ServiceSocket> open(const std::string& path);

  /// Makes the missing directories of `path` and a listening socket there that owner
  /// and group may use, in place of whatever a dead service left. Clients never see a
  /// socket that does not listen yet. An error when another service is using it.
  static Outcome<ServiceSocket> bind(const std::string& path);

  ServiceSocket(ServiceSocket&&) = default;
  ServiceSocket& operator=(ServiceSocket&&) = delete;
  ~ServiceSocket();

  /// Listening, non-blocking.
  int descriptor() const { return socket_.get(); }

 private:
  ServiceSocket(FileDescriptor socket, FileDescriptor lock, std::string path);

  FileDescriptor socket_;
  FileDescriptor lock_;  // None for a socket that was passed.
  std::string path_;     // Empty for a socket that was passed.
};

}  // namespace ostrel
