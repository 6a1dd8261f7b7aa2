#pragma once

#include <chrono>
#include <functional>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "forwarder/Endpoint.h"
#include "platform/Outcome.h"

namespace ostrel {

using NamesAndValues = std::vector<std::pair<std::string, std::string>>;

/// What the standard variables of OpenTelemetry exporters say.
struct ForwarderSettings {
  Endpoint logs;
  /// Sent with each request; the values may be secret and are never logged.
  NamesAndValues headers;
  /// Of a whole request, from the look-up of the name to the end of the reply.
  std::chrono::milliseconds timeout{30'000};
  // PEM files, empty for none.
  std::string authoritiesFile;  // In place of the system's authorities.
  std::string certificateFile;
  std::string keyFile;
  /// What the records are of; has "service.name".
  NamesAndValues resource;
};

/// The value of a variable, or none. An empty one counts as none.
using Environment = std::function<std::optional<std::string>(const std::string& name)>;

/// Neither a value nor an error: no collector is named, so nothing is to be forwarded.
/// The error is a sentence for people, which names the variable and repeats no value
/// that may be secret.
Outcome<ForwarderSettings> forwarderSettings(const Environment& environment);

}  // namespace ostrel
