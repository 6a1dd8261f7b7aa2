#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace ostrel {

/// What a failed operation reports: where the code belongs, the code, and a
/// sentence for people.
struct ErrorObject {
  std::string domain;
  std::int64_t code = 0;
  std::string description;

  friend bool operator==(const ErrorObject&, const ErrorObject&) = default;
};

/// The service's own errors.
inline constexpr std::string_view kOstrelErrorDomain = "com.orbisk.audio.reporting";
/// Errors without a more particular home.
inline constexpr std::string_view kGeneralErrorDomain = "com.orbisk.general";
/// Errors whose code is an `errno` value.
inline constexpr std::string_view kPOSIXErrorDomain = "POSIX";

}  // namespace ostrel
