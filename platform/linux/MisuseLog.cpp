#include "platform/linux/MisuseLog.h"

#include "platform/Logging.h"
#include "platform/linux/Limits.h"

namespace ostrel {
namespace {

std::string_view sentenceOf(MisuseLog::Kind kind) {
  switch (kind) {
    case MisuseLog::Kind::kCutOff:
      return "is cut off";
    case MisuseLog::Kind::kConnectionRefused:
      return "is not let in";
    case MisuseLog::Kind::kSessionRefused:
      return "gets no session";
    case MisuseLog::Kind::kUserInfoRefused:
      return "has no room for entries of a configuration";
  }
  return "";
}

}  // namespace

void MisuseLog::note(std::uint32_t user, Kind kind, std::string_view reason,
                     Clock::time_point now) {
  bool mayLog = false;
  {
    const std::lock_guard lock(mutex_);
    ++counts_[static_cast<std::size_t>(kind)];
    Clock::time_point& mayLogAgain = mayLogAgain_[{user, kind}];
    mayLog = now >= mayLogAgain;
    if (mayLog) mayLogAgain = now + limits::kMisuseLogInterval;
  }
  if (mayLog) {
    OSTREL_LOG_ERROR(processLogScope, "a client of user %u %@: %@", user,
                     sentenceOf(kind), reason);
  }
  if (counted_) counted_();
}

MisuseLog::Counts MisuseLog::counts() const {
  const std::lock_guard lock(mutex_);
  return counts_;
}

std::string_view MisuseLog::keyOf(Kind kind) {
  switch (kind) {
    case Kind::kCutOff:
      return "clients_cut_off";
    case Kind::kConnectionRefused:
      return "connections_refused";
    case Kind::kSessionRefused:
      return "sessions_refused";
    case Kind::kUserInfoRefused:
      return "configurations_cut";
  }
  return "";
}

}  // namespace ostrel
