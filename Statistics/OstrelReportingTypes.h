// The codes and ids of the service. Each is a type of its own, so that swapped
// arguments do not compile.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>

#include "Statistics/ReporterIDs.h"
#include "platform/ErrorObject.h"
#include "platform/Value.h"

namespace ostrel {

/// Upper half: domain, lower half: kind.
enum class MessageCategory : std::uint32_t {};

enum class MessageType : std::uint16_t {};

enum class ServiceType : std::uint16_t {};
inline constexpr ServiceType kServiceTypeTelephony{2};
inline constexpr ServiceType kServiceTypeAlarms{4};
inline constexpr ServiceType kServiceTypeStandalone{5};
inline constexpr ServiceType kServiceTypeLongFormAudio{7};
inline constexpr ServiceType kServiceTypeTest{11};
inline constexpr ServiceType kServiceTypeUnknown{0xFFFF};

// Replies. An empty one is never called.
using BoolReply = std::function<void(bool)>;
using ServiceTypeReply = std::function<void(ServiceType)>;
using ErrorReply = std::function<void(const std::optional<ErrorObject>&)>;
using DictionaryReply = std::function<void(const Dictionary&)>;
using ReporterIDsReply = std::function<void(const ReporterIDs&)>;

}  // namespace ostrel
