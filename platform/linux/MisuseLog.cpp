#include "platform/linux/MisuseLog.h"

#include "platform/Logging.h"
#include "platform/linux/Limits.h"

namespace ostrel {
namespace {

struct Wording {
  std::string_view key;  // Of the service's status.
  std::string_view sentence;
};

constexpr std::array<Wording, MisuseLog::kKinds> kWordings{{
    {"clients_cut_off", "is cut off"},
    {"connections_refused", "is not let in"},
    {"sessions_refused", "gets no session"},
    {"configurations_cut", "has no room for entries of a configuration"},
}};

const Wording& wordingOf(MisuseLog::Kind kind) {
  return kWordings[static_cast<std::size_t>(kind)];
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
                     wordingOf(kind).sentence, reason);
  }
  if (counted_) counted_();
}

MisuseLog::Counts MisuseLog::counts() const {
  const std::lock_guard lock(mutex_);
  return counts_;
}

std::string_view MisuseLog::keyOf(Kind kind) { return wordingOf(kind).key; }

}  // namespace ostrel
