#include "platform/linux/MisuseLog.h"

#include <algorithm>

#include "platform/Logging.h"
#include "platform/linux/Limits.h"

namespace ostrel {
namespace {

// Those whose time is over are left out where there are so many.
constexpr std::size_t kFewHeldBack = 64;

struct Wording {
  std::string_view key;  // Of the service's status.
  std::string_view sentence;
};

constexpr std::array<Wording, MisuseLog::kKinds> kWordings{{
    {"clients_cut_off", "is cut off"},
    {"connections_refused", "is not let in"},
    {"sessions_refused", "gets no session"},
    {"configurations_cut", "has no room for entries of a configuration"},
    {"sessions_of_others_used", "uses a session of another user"},
}};

const Wording& wordingOf(MisuseLog::Kind kind) {
  return kWordings[static_cast<std::size_t>(kind)];
}

}  // namespace

void MisuseLog::note(std::uint32_t user, Kind kind, std::string_view reason,
                     Clock::time_point now) {
  if (count(user, kind, /*count=*/1, now)) {
    OSTREL_LOG_ERROR(processLogScope, "a client of user %u %@: %@", user,
                     wordingOf(kind).sentence, reason);
  }
  if (counted_) counted_();
}

void MisuseLog::noteUses(std::uint32_t user, std::uint64_t uses, const UseOfOthers& use,
                         Clock::time_point now) {
  if (count(user, Kind::kUseOfOthers, uses, now)) {
    OSTREL_LOG_DEFAULT(
        processLogScope,
        "a client of user %u %@: it %@ %lli, which a client of user %u made", user,
        wordingOf(Kind::kUseOfOthers).sentence, use.deed, use.session, use.maker);
  }
  if (counted_) counted_();
}

bool MisuseLog::count(std::uint32_t user, Kind kind, std::uint64_t count,
                      Clock::time_point now) {
  const std::lock_guard lock(mutex_);
  counts_[static_cast<std::size_t>(kind)] += count;
  if (mayLogAgain_.size() >= mostHeldBack_) {
    std::erase_if(mayLogAgain_, [now](const auto& each) { return now >= each.second; });
    mostHeldBack_ = std::max(kFewHeldBack, 2 * mayLogAgain_.size());
  }
  Clock::time_point& mayLogAgain = mayLogAgain_[{user, kind}];
  if (now < mayLogAgain) return false;
  mayLogAgain = now + limits::kMisuseLogInterval;
  return true;
}

std::size_t MisuseLog::heldBack() const {
  const std::lock_guard lock(mutex_);
  return mayLogAgain_.size();
}

MisuseLog::Counts MisuseLog::counts() const {
  const std::lock_guard lock(mutex_);
  return counts_;
}

std::string_view MisuseLog::keyOf(Kind kind) { return wordingOf(kind).key; }

}  // namespace ostrel
