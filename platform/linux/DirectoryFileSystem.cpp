// A file comes to its place in these steps: a new file of a random name in the
// opened directory, its text, its mode, fsync, a rename within the directory. A
// link or anything else that stands at the final name is replaced, never followed;
// until the rename nothing of the new file is to be seen under that name, and
// after any failure the new file is removed.
#include "platform/linux/DirectoryFileSystem.h"

#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <functional>
#include <utility>
#include <vector>

#include "platform/linux/FileDescriptor.h"

namespace ostrel {
namespace {

constexpr mode_t kFileMode = 0640;
constexpr mode_t kRootMode = 0755;
constexpr std::size_t kBufferSize = 64 * 1024;
constexpr int kNameAttempts = 16;

Success success() { return {/*succeeded=*/true, std::nullopt}; }

Success failure(int error, std::string_view action, const std::string& path) {
  return {/*succeeded=*/false, ErrorObject{std::string(kPOSIXErrorDomain), error,
                                           "cannot " + std::string(action) + " " + path +
                                               ": " + std::strerror(error)}};
}

// 0, or the error of a name that cannot stand for a file in a directory.
int errorOfName(std::string_view name) {
  if (name.empty() || name == "." || name == "..") return ENOENT;
  if (name.find('/') != name.npos || name.find('\0') != name.npos) return ENOENT;
  return name.size() > NAME_MAX ? ENAMETOOLONG : 0;
}

// The names that lead from `root` to `path`; none when it does not lie below.
std::optional<std::vector<std::string>> namesBelow(const std::string& root,
                                                   std::string_view path) {
  if (!path.starts_with(root)) return std::nullopt;
  path.remove_prefix(root.size());
  if (!path.empty() && path.front() != '/') return std::nullopt;
  std::vector<std::string> names;
  while (!path.empty()) {
    path.remove_prefix(1);
    const std::string_view name = path.substr(0, path.find('/'));
    if (!name.empty()) names.emplace_back(name);
    path.remove_prefix(name.size());
  }
  return names;
}

// Makes the root with all above it; links there are the administrator's own.
int makeRoot(const std::string& root) {
  for (std::size_t end = root.find('/', 1);; end = root.find('/', end + 1)) {
    if (::mkdir(root.substr(0, end).c_str(), kRootMode) != 0 && errno != EEXIST) {
      return errno;
    }
    if (end == std::string::npos) return 0;
  }
}

FileDescriptor openRoot(const std::string& root) {
  return FileDescriptor(::open(root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
}

// Opens the directory `name` in `parent` if it is one, and trustworthy; else sets
// errno.
FileDescriptor openDirectory(const FileCalls& calls, int parent,
                             const std::string& name) {
  FileDescriptor directory(
      ::openat(parent, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  struct stat status;
  if (!directory || calls.fstat(directory.get(), &status) != 0) return FileDescriptor();
  if (status.st_uid != ::geteuid() && status.st_uid != 0) {
    errno = EPERM;
    return FileDescriptor();
  }
  return directory;
}

std::string temporaryName() {
  std::uint64_t random[2] = {};
  if (::getrandom(random, sizeof random, GRND_NONBLOCK) != sizeof random) {
    random[0] = static_cast<std::uint64_t>(std::clock());
    random[1] = static_cast<std::uint64_t>(::getpid());
  }
  char name[48];
  std::snprintf(name, sizeof name, ".%016llx%016llx.tmp",
                static_cast<unsigned long long>(random[0]),
                static_cast<unsigned long long>(random[1]));
  return name;
}

// A new file that is removed unless it is kept.
class TemporaryFile {
 public:
  // errno says why the file is not open.
  explicit TemporaryFile(int directory) : directory_(directory) {
    for (int i = 0; i < kNameAttempts && !file_; ++i) {
      name_ = temporaryName();
      file_.reset(::openat(directory, name_.c_str(),
                           O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
      if (!file_ && errno != EEXIST) return;
    }
  }
  ~TemporaryFile() {
    if (file_ && !isKept_) ::unlinkat(directory_, name_.c_str(), /*flag=*/0);
  }
  TemporaryFile(const TemporaryFile&) = delete;
  TemporaryFile& operator=(const TemporaryFile&) = delete;

  bool isOpen() const { return static_cast<bool>(file_); }
  int get() const { return file_.get(); }
  const char* name() const { return name_.c_str(); }
  void keep() { isKept_ = true; }

 private:
  const int directory_;
  std::string name_;
  FileDescriptor file_;
  bool isKept_ = false;
};

// Writes a text in large pieces. After an error it only swallows.
class FileWriter {
 public:
  FileWriter(int file, const FileCalls& calls) : file_(file), calls_(calls) {
    buffer_.reserve(kBufferSize);
  }

  void append(std::string_view piece) {
    if (error_ != 0) return;
    if (buffer_.size() + piece.size() > kBufferSize) {
      write(buffer_);
      buffer_.clear();
    }
    if (piece.size() >= kBufferSize) {
      write(piece);
    } else {
      buffer_ += piece;
    }
  }

  // 0, or the first error.
  int finish() {
    write(buffer_);
    buffer_.clear();
    return error_;
  }

 private:
  void write(std::string_view piece) {
    while (error_ == 0 && !piece.empty()) {
      const ssize_t written = calls_.write(file_, piece.data(), piece.size());
      if (written >= 0) {
        piece.remove_prefix(static_cast<std::size_t>(written));
      } else if (errno != EINTR) {
        error_ = errno;
      }
    }
  }

  const int file_;
  const FileCalls& calls_;
  std::string buffer_;
  int error_ = 0;
};

}  // namespace

FileCalls FileCalls::system() {
  return {::write, ::fstat, ::fchmod, ::fsync, ::renameat};
}

DirectoryFileSystem::DirectoryFileSystem(std::string root)
    : DirectoryFileSystem(std::move(root), FileCalls::system()) {}

DirectoryFileSystem::DirectoryFileSystem(std::string root, const FileCalls& calls)
    : root_(std::move(root)), calls_(calls) {}

Success DirectoryFileSystem::createDirectory(const std::string& path,
                                             std::uint32_t permissions) {
  constexpr std::string_view kAction = "make the directory";
  const auto names = namesBelow(root_, path);
  if (!names) return failure(ENOENT, kAction, path);
  FileDescriptor directory = openRoot(root_);
  if (!directory && errno == ENOENT) {
    if (const int error = makeRoot(root_)) return failure(error, kAction, root_);
    directory = openRoot(root_);
  }
  if (!directory) return failure(errno, kAction, root_);
  for (const std::string& name : *names) {
    if (const int error = errorOfName(name)) return failure(error, kAction, path);
    const bool isNew = ::mkdirat(directory.get(), name.c_str(), 0700) == 0;
    if (!isNew && errno != EEXIST) return failure(errno, kAction, path);
    directory = openDirectory(calls_, directory.get(), name);
    if (!directory) return failure(errno, kAction, path);
    if (isNew && calls_.fchmod(directory.get(), permissions & 07777) != 0) {
      return failure(errno, kAction, path);
    }
  }
  return success();
}

Success DirectoryFileSystem::writeFileAtomically(const std::string& directory,
                                                 const std::string& name,
                                                 const std::optional<TextSource>& text) {
  constexpr std::string_view kAction = "write";
  if (!text) return {/*succeeded=*/false, std::nullopt};
  const std::string path = directory + "/" + name;
  const auto names = namesBelow(root_, directory);
  if (!names) return failure(ENOENT, kAction, path);
  if (const int error = errorOfName(name)) return failure(error, kAction, path);
  FileDescriptor parent = openRoot(root_);
  for (const std::string& step : *names) {
    if (!parent) break;
    if (const int error = errorOfName(step)) return failure(error, kAction, path);
    parent = openDirectory(calls_, parent.get(), step);
  }
  if (!parent) return failure(errno, kAction, path);

  TemporaryFile file(parent.get());
  if (!file.isOpen()) return failure(errno, kAction, path);
  FileWriter writer(file.get(), calls_);
  (*text)([&](std::string_view piece) { writer.append(piece); });
  if (const int error = writer.finish()) return failure(error, kAction, path);
  if (calls_.fchmod(file.get(), kFileMode) != 0 || calls_.fsync(file.get()) != 0 ||
      calls_.renameat(parent.get(), file.name(), parent.get(), name.c_str()) != 0) {
    return failure(errno, kAction, path);
  }
  file.keep();
  calls_.fsync(parent.get());
  return success();
}

}  // namespace ostrel
