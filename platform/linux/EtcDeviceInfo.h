#pragma once

#include <chrono>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/DeviceInfo.h"
#include "platform/linux/Limits.h"

namespace ostrel {

/// The variables of an environment-like file as `os-release` and `machine-info`
/// are: `NAME=value` lines with shell-like quoting, comments with "#" or ";". A
/// later line wins; what is no assignment is passed over.
std::map<std::string, std::string, std::less<>> parseEnvironmentFile(
    std::string_view text);

/// What is known of the device by "machine-info" and "os-release", read once,
/// when it is first asked for.
///
/// Answers "InternalBuild": true by `DEPLOYMENT=development` or
/// `VARIANT_ID=internal`, none when there is neither file. The device class
/// comes from `CHASSIS`.
class EtcDeviceInfo final : public DeviceInfo {
 public:
  struct Files {
    std::string machineInfo;
    std::vector<std::string> osRelease;  // The first that exists.
  };
  /// How long the first question waits for files on a disk that hangs. They
  /// count as missing then.
  static constexpr std::chrono::seconds kMostWait{1};
  static constexpr std::size_t kMostFileBytes = limits::kDeviceFileBytes;

  /// The system's files; `$SYSTEMD_ETC_MACHINE_INFO` and `$SYSTEMD_OS_RELEASE`
  /// name others.
  static Files systemFiles();

  explicit EtcDeviceInfo(Files files) : files_(std::move(files)) {}

  std::optional<Value> answer(std::string_view key) const override;
  std::int32_t deviceClass() const override;

 private:
  struct Facts {
    std::optional<bool> isInternalBuild;
    std::int32_t deviceClass = 0;
  };

  static Facts read(const Files& files);
  const Facts& facts() const;

  const Files files_;
  mutable std::once_flag once_;
  mutable Facts facts_;  // Written once.
};

}  // namespace ostrel
