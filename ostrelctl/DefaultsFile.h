#pragma once

#include <functional>
#include <string>

#include "ostrelctl/JSONNode.h"
#include "platform/Outcome.h"

namespace ostrel {

/// The defaults suite on the disk: one JSON object in one file. Errors are
/// sentences for people.
class DefaultsFile {
 public:
  explicit DefaultsFile(std::string path) : path_(std::move(path)) {}

  /// An empty object when there is no file.
  Outcome<JSONObject> read() const;

  /// Reads the object, has `change` change it, and puts the result in the file's
  /// place: a reader finds the old one or the new one, whole, also after a power
  /// cut. Two that change the file at once do it one after the other. Makes
  /// missing directories. Nothing is written when `change` returns false.
  Success change(const std::function<bool(JSONObject&)>& change) const;

 private:
  Success replace(const std::string& text) const;

  const std::string path_;
};

/// Makes a directory and those above it, with mode 0755 whatever the umask.
Success makeDirectories(const std::string& path);

/// Posts a change notification: writes the file that is its name, in a directory
/// that the service watches.
Success postNotification(const std::string& path);

}  // namespace ostrel
