#pragma once

#include <string>

#include "forwarder/ForwardMark.h"
#include "platform/linux/DirectoryFileSystem.h"

namespace ostrel {

/// The mark as a small JSON file, replaced as a whole.
class MarkFile final : public MarkKeeper {
 public:
  /// Neither is made before it is needed.
  MarkFile(std::string directory, std::string name);

  /// That of a new start when there is no such file, or, with an error logged, when it
  /// holds something else: then all is forwarded again, under the same record IDs. The
  /// error is a sentence for people: the file is there and cannot be read.
  Outcome<ForwardMark> load() const;

  Success save(const ForwardMark& mark) override;

 private:
  const std::string directory_;
  const std::string name_;
  DirectoryFileSystem files_;
};

}  // namespace ostrel
