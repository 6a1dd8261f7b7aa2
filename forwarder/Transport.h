#pragma once

#include <string>

namespace ostrel {

/// How a request ended.
struct Reply {
  /// Of HTTP; 0 when no reply came.
  int status = 0;
  /// As much of it as came; what is beyond `Transport::kMostReplyBytes` is not read.
  std::string body;
  /// The header of that name; empty for none.
  std::string retryAfter;
  /// Why there is none, a phrase for people.
  std::string failure;
  /// The process is to end.
  bool isInterrupted = false;
};

/// What carries requests to the collector. One thread.
class Transport {
 public:
  static constexpr std::size_t kMostReplyBytes = 64 * 1024;

  virtual ~Transport() = default;

  /// Posts `body`, which is JSON, and waits for the reply.
  virtual Reply post(const std::string& body) = 0;
};

}  // namespace ostrel
