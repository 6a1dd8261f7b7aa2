#include "ostrelctl/DefaultsFile.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <system_error>
#include <utility>

#include "platform/linux/FileDescriptor.h"

namespace ostrel {
namespace {

// The service, which may be another user, reads what root makes here.
constexpr mode_t kFileMode = 0644;
constexpr mode_t kDirectoryMode = 0755;

ErrorObject fileError(const std::string& what, int code) {
  return {std::string(kPOSIXErrorDomain), code, what + ": " + std::strerror(code)};
}

std::string directoryOf(const std::string& path) {
  return std::filesystem::path(path).parent_path().string();
}

bool writeAll(int descriptor, std::string_view text) {
  while (!text.empty()) {
    const auto written = ::write(descriptor, text.data(), text.size());
    if (written < 0 && errno == EINTR) continue;
    if (written < 0) return false;
    text.remove_prefix(static_cast<std::size_t>(written));
  }
  return true;
}

/// The new file belongs to whom the old one belonged to, with its mode.
void takeOverOwner(int descriptor, const std::string& path) {
  struct stat old {};
  if (::stat(path.c_str(), &old) != 0) {
    ::fchmod(descriptor, kFileMode);
    return;
  }
  // Only root may give a file away; for others it stays their own.
  if (::fchown(descriptor, old.st_uid, old.st_gid) != 0) errno = 0;
  ::fchmod(descriptor, old.st_mode & 07777);
}

}  // namespace

Outcome<JSONObject> DefaultsFile::read() const {
  std::ifstream file(path_);
  if (!file) {
    if (errno == ENOENT) return {JSONObject{}, {}};
    return {{}, fileError("the defaults at " + path_ + " cannot be read", errno)};
  }
  std::ostringstream text;
  text << file.rdbuf();
  auto parsed = parseJSON(text.str());
  if (!parsed.value || parsed.value->object() == nullptr) {
    return {{},
            ErrorObject{std::string(kGeneralErrorDomain), 1,
                        "the defaults at " + path_ + " are not a JSON object" +
                            (parsed.error ? ": " + parsed.error->description : "")}};
  }
  return {*parsed.value->object(), {}};
}

Success DefaultsFile::change(const std::function<bool(JSONObject&)>& change) const {
  const std::string directory = directoryOf(path_);
  if (auto made = makeDirectories(directory); !made.succeeded) return made;
  const FileDescriptor lock(
      ::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!lock || ::flock(lock.get(), LOCK_EX) != 0) {
    return {false, fileError("the directory " + directory + " cannot be locked", errno)};
  }
  auto object = read();
  if (!object.value) return {false, std::move(object.error)};
  if (!change(*object.value)) return {true, {}};
  std::string text;
  appendJSON(text, {std::move(*object.value)}, JSONSpacing::kPretty);
  auto replaced = replace(text + "\n");
  // The directory's entry, too, is to outlast a power cut.
  if (replaced.succeeded) ::fsync(lock.get());
  return replaced;
}

Success DefaultsFile::replace(const std::string& text) const {
  std::string temporary = path_ + ".XXXXXX";
  const FileDescriptor file(::mkostemp(temporary.data(), O_CLOEXEC));
  if (!file) {
    return {false, fileError("the defaults at " + path_ + " cannot be written", errno)};
  }
  takeOverOwner(file.get(), path_);
  if (!writeAll(file.get(), text) || ::fsync(file.get()) != 0 ||
      ::rename(temporary.c_str(), path_.c_str()) != 0) {
    const int code = errno;
    ::unlink(temporary.c_str());
    return {false, fileError("the defaults at " + path_ + " cannot be written", code)};
  }
  return {true, {}};
}

Success makeDirectories(const std::string& path) {
  std::filesystem::path made;
  for (const auto& part : std::filesystem::path(path)) {
    made /= part;
    if (::mkdir(made.c_str(), kDirectoryMode) == 0) {
      ::chmod(made.c_str(), kDirectoryMode);
      continue;
    }
    const int code = errno == EEXIST ? ENOTDIR : errno;
    std::error_code ignored;
    if (!std::filesystem::is_directory(made, ignored)) {
      return {false,
              fileError("the directory " + made.string() + " cannot be made", code)};
    }
  }
  return {true, {}};
}

Success postNotification(const std::string& path) {
  if (auto made = makeDirectories(directoryOf(path)); !made.succeeded) return made;
  // The end of a write is what watchers see.
  const FileDescriptor file(
      ::open(path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC | O_NOFOLLOW, kFileMode));
  if (!file) {
    return {false, fileError("the notification " + path + " cannot be posted", errno)};
  }
  return {true, {}};
}

}  // namespace ostrel
