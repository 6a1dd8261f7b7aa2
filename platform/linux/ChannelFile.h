#pragma once

#include <cstddef>
#include <string>
#include <utility>

#include "platform/linux/ChannelSource.h"
#include "platform/linux/Limits.h"

namespace ostrel {

/// The counters in the channel file at `path`. Read, never mapped, and never
/// through a link: whatever its owner does to the file meanwhile, the outcome is
/// values or an error of the domain "POSIX": EBADMSG for what is no whole channel
/// file, EFBIG beyond the largest, EINVAL for a pipe or a device.
Outcome<std::vector<ChannelValue>> readChannelFile(const std::string& path);

/// The channel files in a directory.
class ChannelFileFinder final : public ChannelFinder {
 public:
  /// Files that are looked at in one directory, of whatever kind.
  static constexpr std::size_t kMostFiles = limits::kChannelFiles;

  /// `directory` need not exist.
  explicit ChannelFileFinder(std::string directory) : directory_(std::move(directory)) {}

  /// The runtime directory + "/channels".
  static std::string systemDirectory();

  /// Ordered by file name. A file of a fitting name that cannot be read is left
  /// out and gives an error.
  Found find(const std::optional<std::string>& group,
             const std::optional<std::string>& subgroup) const override;

 private:
  const std::string directory_;
};

}  // namespace ostrel
