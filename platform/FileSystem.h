#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Outcome.h"

namespace ostrel {

/// Takes text piece by piece. The pieces are not kept.
using TextWriter = std::function<void(std::string_view)>;

/// Writes the whole of a text to the writer, piece by piece, as often as it is
/// asked: a text that need not stand in memory at once.
using TextSource = std::function<void(const TextWriter&)>;

/// Files below the diagnostic log directory. All operations from any thread;
/// each may block on the disk.
class FileSystem {
 public:
  virtual ~FileSystem() = default;

  /// The root of the diagnostic logs, without a slash at its end.
  virtual std::string diagnosticLogDirectory() const = 0;

  /// Makes `path` and the directories above it that are missing. `permissions`
  /// become those of each directory it makes below the diagnostic log
  /// directory, whatever the umask. A directory that exists already is a
  /// success.
  virtual Success createDirectory(const std::string& path, std::uint32_t permissions) = 0;

  /// Replaces the file `name` in `directory` by `text` in one step: other
  /// readers see the old file, or none, or the whole new one. No `text` is a
  /// failure without an error object. A name that cannot exist ("/" or NUL in it, too
  /// long) is a failure; nothing is ever written outside `directory`, nor through a link.
  virtual Success writeFileAtomically(const std::string& directory,
                                      const std::string& name,
                                      const std::optional<TextSource>& text) = 0;
};

}  // namespace ostrel
