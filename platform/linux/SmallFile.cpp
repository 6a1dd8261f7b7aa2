#include "platform/linux/SmallFile.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <system_error>

#include "platform/linux/FileDescriptor.h"

namespace ostrel {

ErrorObject errorOfPath(int error, const std::string& path) {
  return {std::string(kPOSIXErrorDomain), error,
          path + ": " + std::generic_category().message(error)};
}

Outcome<std::string> readSmallFile(const std::string& path, std::size_t mostBytes,
                                   FileLinks links) {
  const int noFollow = links == FileLinks::kRefuse ? O_NOFOLLOW : 0;
  const FileDescriptor file(
      ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY | noFollow));
  if (!file) return {std::nullopt, errorOfPath(errno, path)};
  struct stat status {};
  if (::fstat(file.get(), &status) != 0) {
    return {std::nullopt, errorOfPath(errno, path)};
  }
  if (S_ISDIR(status.st_mode)) return {std::nullopt, errorOfPath(EISDIR, path)};
  if (!S_ISREG(status.st_mode)) return {std::nullopt, errorOfPath(EINVAL, path)};
  std::string text(mostBytes + 1, '\0');
  std::size_t size = 0;
  while (size < text.size()) {
    const ssize_t more = ::read(file.get(), text.data() + size, text.size() - size);
    if (more == 0) break;
    if (more < 0 && errno != EINTR) return {std::nullopt, errorOfPath(errno, path)};
    if (more > 0) size += static_cast<std::size_t>(more);
  }
  if (size > mostBytes) return {std::nullopt, errorOfPath(EFBIG, path)};
  text.resize(size);
  return {std::move(text), std::nullopt};
}

}  // namespace ostrel
