// Two services never share a path: whoever holds the lock of the file beside it is
// the one. The lock goes with the process, however that ends, so a socket file
// without a holder is stale and may be replaced. It is replaced by a rename, which
// takes the place of a link or a pipe at the path instead of following it.
#include "platform/linux/ServiceSocket.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "platform/linux/SystemdService.h"

namespace ostrel {
namespace {

constexpr mode_t kDirectoryMode = 0755;
constexpr mode_t kLockMode = 0600;
constexpr mode_t kSocketMode = 0660;
constexpr int kBacklog = 4096;

ErrorObject failure(int error, const std::string& sentence) {
  return {std::string(kPOSIXErrorDomain), error, sentence + ": " + std::strerror(error)};
}

Outcome<ServiceSocket> failed(const std::string& sentence) {
  return {std::nullopt, failure(errno, sentence)};
}

bool makeDirectoriesOf(const std::string& path) {
  for (auto slash = path.find('/', 1); slash != std::string::npos;
       slash = path.find('/', slash + 1)) {
    const std::string directory = path.substr(0, slash);
    if (::mkdir(directory.c_str(), kDirectoryMode) != 0 && errno != EEXIST) return false;
  }
  return true;
}

bool makeNonBlocking(int descriptor) {
  const int flags = ::fcntl(descriptor, F_GETFL);
  return flags >= 0 && ::fcntl(descriptor, F_SETFL, flags | O_NONBLOCK) == 0;
}

}  // namespace

ServiceSocket::ServiceSocket(FileDescriptor socket, FileDescriptor lock, std::string path)
    : socket_(std::move(socket)), lock_(std::move(lock)), path_(std::move(path)) {}

ServiceSocket::~ServiceSocket() {
  if (lock_) ::unlink(path_.c_str());
}

Outcome<ServiceSocket> ServiceSocket::open(const std::string& path) {
  const int count = takePassedSockets();
  if (count < 0) {
    return {std::nullopt, failure(-count, "the sockets passed by LISTEN_FDS are wrong")};
  }
  if (count == 0) return bind(path);
  FileDescriptor found;
  for (int i = 0; i < count; ++i) {
    FileDescriptor passed(kFirstPassedSocket + i);
    if (!found && isListeningUnixStream(passed.get())) found = std::move(passed);
  }
  if (!found) {
    return {std::nullopt,
            failure(EPROTOTYPE,
                    "none of the sockets passed is a listening Unix stream socket")};
  }
  if (!makeNonBlocking(found.get())) return failed("the socket passed is of no use");
  return {ServiceSocket(std::move(found), FileDescriptor(), std::string()), std::nullopt};
}

Outcome<ServiceSocket> ServiceSocket::bind(const std::string& path) {
  const std::string fresh = path + ".new";
  const std::string lockPath = path + ".lock";
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (fresh.size() >= sizeof address.sun_path) {
    return {std::nullopt, failure(ENAMETOOLONG, "no socket can be made at " + path)};
  }
  std::memcpy(address.sun_path, fresh.data(), fresh.size());
  if (!makeDirectoriesOf(path)) {
    return failed("the directory of " + path + " cannot be made");
  }

  FileDescriptor lock(
      ::open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, kLockMode));
  if (!lock) return failed("the lock " + lockPath + " cannot be opened");
  if (::flock(lock.get(), LOCK_EX | LOCK_NB) != 0) {
    if (errno != EWOULDBLOCK) return failed("the lock " + lockPath + " is of no use");
    return {std::nullopt, ErrorObject{std::string(kPOSIXErrorDomain), EADDRINUSE,
                                      "another service is already listening at " + path}};
  }

  FileDescriptor socket(
      ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, /*protocol=*/0));
  if (!socket) return failed("no socket can be made");
  ::unlink(fresh.c_str());
  const auto* plain = reinterpret_cast<const sockaddr*>(&address);
  if (::bind(socket.get(), plain, sizeof address) != 0 ||
      ::chmod(fresh.c_str(), kSocketMode) != 0 || ::listen(socket.get(), kBacklog) != 0 ||
      ::rename(fresh.c_str(), path.c_str()) != 0) {
    const int error = errno;
    ::unlink(fresh.c_str());
    return {std::nullopt, failure(error, "no socket can be made at " + path)};
  }
  return {ServiceSocket(std::move(socket), std::move(lock), path), std::nullopt};
}

}  // namespace ostrel
