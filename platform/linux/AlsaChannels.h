#pragma once

#include <cstddef>
#include <string>
#include <utility>

#include "platform/linux/ChannelSource.h"

namespace ostrel {

/// The frame counters of the sound cards, from "card*/pcm*/sub*/status" below
/// "/proc/asound": group "Speaker", subgroup "ALSA". Each open stream has the
/// channels "card0_pcm0p_sub0_hw_ptr" (frames that the hardware moved) and
/// "..._appl_ptr" (frames that programs moved), both since it was opened; of a
/// closed stream they are 0.
class AlsaChannelFinder final : public ChannelFinder {
 public:
  static constexpr std::size_t kMostStreams = 256;
  static constexpr std::size_t kMostStatusBytes = 4096;

  /// `root` is "/proc/asound" or what stands for it; it need not exist.
  explicit AlsaChannelFinder(std::string root) : root_(std::move(root)) {}

  Found find(const std::optional<std::string>& group,
             const std::optional<std::string>& subgroup) const override;

 private:
  const std::string root_;
};

}  // namespace ostrel
