#include "platform/fake/FakeFileSystem.h"

#include <cerrno>
#include <cstdio>
#include <utility>

namespace ostrel {
namespace {

constexpr std::size_t kMostNameBytes = 255;

Success failure(int code, const char* sentence) {
  return {false, ErrorObject{std::string(kPOSIXErrorDomain), code, sentence}};
}

}  // namespace

FakeFileSystem::FakeFileSystem(SharedEventLog events) : events_(std::move(events)) {
  directories_.emplace("/logs", 0755);
}

Success FakeFileSystem::createDirectory(const std::string& path,
                                        std::uint32_t permissions) {
  char mode[16];
  std::snprintf(mode, sizeof mode, " %04o", permissions);
  events_->add("files.createDirectory " + path + mode);
  const std::lock_guard lock(mutex_);
  if (directoryResult_) return *directoryResult_;
  if (path != diagnosticLogDirectory() &&
      !path.starts_with(diagnosticLogDirectory() + '/')) {
    return failure(ENOENT, "No such file or directory");
  }
  for (std::size_t slash = path.find('/', 1);; slash = path.find('/', slash + 1)) {
    const std::string directory = path.substr(0, slash);
    if (files_.contains(directory)) return failure(ENOTDIR, "Not a directory");
    directories_.emplace(directory, permissions);
    if (slash == std::string::npos) break;
  }
  return {true, std::nullopt};
}

Success FakeFileSystem::writeFileAtomically(const std::string& directory,
                                            const std::string& name,
                                            const std::optional<TextSource>& text) {
  events_->add("files.write " + directory + '/' + name);
  {
    const std::lock_guard lock(mutex_);
    if (writeResult_) return *writeResult_;
    if (!directories_.contains(directory)) {
      return failure(ENOENT, "No such file or directory");
    }
  }
  if (!text) return failure(EINVAL, "there is no text to write");
  if (name.empty() || name == "." || name == ".." ||
      name.find_first_of(std::string_view("/\0", 2)) != std::string::npos) {
    return failure(ENOENT, "no file can have this name");
  }
  if (name.size() > kMostNameBytes) return failure(ENAMETOOLONG, "File name too long");
  std::string whole;
  (*text)([&whole](std::string_view piece) { whole += piece; });
  const std::lock_guard lock(mutex_);
  files_.insert_or_assign(directory + '/' + name, std::move(whole));
  return {true, std::nullopt};
}

void FakeFileSystem::setDirectoryResult(std::optional<Success> result) {
  const std::lock_guard lock(mutex_);
  directoryResult_ = std::move(result);
}

void FakeFileSystem::setWriteResult(std::optional<Success> result) {
  const std::lock_guard lock(mutex_);
  writeResult_ = std::move(result);
}

std::map<std::string, std::string> FakeFileSystem::files() const {
  const std::lock_guard lock(mutex_);
  return files_;
}

std::optional<std::string> FakeFileSystem::file(const std::string& path) const {
  const std::lock_guard lock(mutex_);
  const auto found = files_.find(path);
  if (found == files_.end()) return std::nullopt;
  return found->second;
}

std::map<std::string, std::uint32_t> FakeFileSystem::directories() const {
  const std::lock_guard lock(mutex_);
  return directories_;
}

}  // namespace ostrel
