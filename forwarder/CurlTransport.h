#pragma once

#include <memory>
#include <string>

#include "forwarder/ForwarderSettings.h"
#include "forwarder/Transport.h"

namespace ostrel {

/// HTTP/1.1 by libcurl, over one connection that is kept open. The other side's
/// certificate and name are verified, redirects are not followed. One thread.
class CurlTransport final : public Transport {
 public:
  /// At most; a shorter limit of the whole request holds for this part of it too.
  static constexpr std::chrono::milliseconds kConnectTimeout{5'000};

  /// `end` becomes readable when the process is to end, which interrupts a request; it
  /// stays the caller's.
  CurlTransport(const ForwarderSettings& settings, int end);
  ~CurlTransport() override;

  Reply post(const std::string& body) override;

 private:
  class Handles;

  const int end_;
  const std::unique_ptr<Handles> handles_;
};

}  // namespace ostrel
