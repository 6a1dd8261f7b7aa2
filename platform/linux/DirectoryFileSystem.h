#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <string>

#include "platform/FileSystem.h"

namespace ostrel {

class FileDescriptor;

/// The system calls whose failures and answers tests bring about.
struct FileCalls {
  ssize_t (*write)(int file, const void* bytes, std::size_t size);
  int (*fstat)(int file, struct stat* status);
  int (*fchmod)(int file, mode_t mode);
  int (*fsync)(int file);
  int (*renameat)(int fromDirectory, const char* from, int toDirectory, const char* to);

  static FileCalls system();
};

/// The directory below `root`. Below it every path is walked from directory to
/// opened directory; links are not followed, and a directory that belongs to
/// another user than the service's or root is refused. Files get the mode 0640
/// whatever the umask. Errors are those of the system, in the POSIX domain.
class DirectoryFileSystem final : public FileSystem {
 public:
  explicit DirectoryFileSystem(std::string root);
  DirectoryFileSystem(std::string root, const FileCalls& calls);

  std::string diagnosticLogDirectory() const override { return root_; }
  Success createDirectory(const std::string& path, std::uint32_t permissions) override;
  Success writeFileAtomically(const std::string& directory, const std::string& name,
                              const std::optional<TextSource>& text) override;

 private:
  const std::string root_;
  const FileCalls calls_;
};

}  // namespace ostrel
