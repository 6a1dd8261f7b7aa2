#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>

#include "platform/FileSystem.h"
#include "platform/fake/EventLog.h"

namespace ostrel {

/// Files in memory below "/logs". Adds "files.createDirectory PATH MODE" (mode
/// in octal, "0777") and "files.write DIRECTORY/NAME" to the events.
class FakeFileSystem final : public FileSystem {
 public:
  explicit FakeFileSystem(SharedEventLog events);

  std::string diagnosticLogDirectory() const override { return "/logs"; }
  Success createDirectory(const std::string& path, std::uint32_t permissions) override;
  Success writeFileAtomically(const std::string& directory, const std::string& name,
                              const std::optional<TextSource>& text) override;

  /// Calls from now on give this result and do nothing; none ends that.
  void setDirectoryResult(std::optional<Success> result);
  void setWriteResult(std::optional<Success> result);

  /// Text by path.
  std::map<std::string, std::string> files() const;
  std::optional<std::string> file(const std::string& path) const;
  /// Permissions by path, of the directories made.
  std::map<std::string, std::uint32_t> directories() const;

 private:
  const SharedEventLog events_;
  mutable std::mutex mutex_;
  std::optional<Success> directoryResult_;
  std::optional<Success> writeResult_;
  std::map<std::string, std::string> files_;
  std::map<std::string, std::uint32_t> directories_;
};

}  // namespace ostrel
