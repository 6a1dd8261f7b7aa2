#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <string_view>
#include <utility>

#include "platform/UserDefaults.h"
#include "platform/linux/Limits.h"

namespace ostrel {

/// Suites as files "NAME.json" in one directory, each a JSON object. Only a regular
/// file of at most `kMostFileBytes` is read, never through a link. An entry that is
/// null is none; one that is no value of a suite, or a text beyond
/// `kMostTextBytes`, is left out with an error logged.
class JSONUserDefaults final : public UserDefaults {
 public:
  static constexpr std::size_t kMostFileBytes = limits::kDefaultsFileBytes;
  static constexpr std::size_t kMostTextBytes = limits::kDefaultsTextBytes;

  /// `directory` need not exist.
  explicit JSONUserDefaults(std::string directory) : directory_(std::move(directory)) {}

  /// The state directory + "/defaults".
  static std::string systemDirectory();

  std::unique_ptr<UserDefaultsSuite> openSuite(std::string_view name) override;

 private:
  const std::string directory_;
};

}  // namespace ostrel
