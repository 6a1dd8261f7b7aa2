#pragma once

#include <string>
#include <string_view>

#include "platform/Outcome.h"

namespace ostrel {

/// Where a collector takes requests.
struct Endpoint {
  std::string url;
  /// "https://collector.example:4318": for people, without what may be secret.
  std::string place;
  bool isSecure = false;
  /// A name or an address of this machine alone: "localhost", 127.0.0.0/8, "[::1]".
  bool isLoopback = false;
};

/// Takes an "http" or "https" URL apart; `signalPath`, such as "v1/logs", is added to its
/// path, if not empty. The error is a sentence for people, which does not repeat the
/// text: for what is no such URL, for one with a user name or a fragment, and for "http"
/// to another machine.
Outcome<Endpoint> endpointFrom(std::string_view text, std::string_view signalPath);

}  // namespace ostrel
