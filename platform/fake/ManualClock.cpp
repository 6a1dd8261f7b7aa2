#include "platform/fake/ManualClock.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>

#include "platform/fake/FakeUse.h"

namespace ostrel {

using std::chrono::nanoseconds;

Date ManualClock::now() const {
  const std::lock_guard lock(mutex_);
  return wall_;
}

nanoseconds ManualClock::monotonicNow() const {
  const std::lock_guard lock(mutex_);
  return monotonic_;
}

std::string ManualClock::fileNameDate(Date date) const {
  using namespace std::chrono;
  const minutes zone = [&] {
    const std::lock_guard lock(mutex_);
    return zone_;
  }();
  const sys_seconds time{
      seconds{static_cast<std::int64_t>(std::floor(date.secondsSince1970))} + zone};
  const auto day = floor<days>(time);
  const year_month_day calendar{day};
  const hh_mm_ss clock{time - day};
  const auto absolute = std::abs(static_cast<int>(zone.count()));
  char text[48];
  std::snprintf(
      text, sizeof text, "%04d%02u%02u-%02d%02d%02d%c%02d%02d",
      static_cast<int>(calendar.year()), static_cast<unsigned>(calendar.month()),
      static_cast<unsigned>(calendar.day()), static_cast<int>(clock.hours().count()),
      static_cast<int>(clock.minutes().count()),
      static_cast<int>(clock.seconds().count()), zone.count() < 0 ? '-' : '+',
      absolute / 60, absolute % 60);
  return text;
}

void ManualClock::advance(nanoseconds duration) {
  checkFakeUse(duration.count() >= 0, "the clock moves forward");
  std::unique_lock lock(mutex_);
  const nanoseconds target = monotonic_ + duration;
  const auto moveTo = [this](nanoseconds time) {
    const nanoseconds step = std::max(time - monotonic_, nanoseconds(0));
    monotonic_ += step;
    wall_.secondsSince1970 += std::chrono::duration<double>(step).count();
  };
  while (!timers_.empty() && timers_.begin()->first.first <= target) {
    auto first = timers_.extract(timers_.begin());
    moveTo(first.key().first);
    lock.unlock();
    first.mapped()();
    lock.lock();
  }
  moveTo(target);
}

void ManualClock::setWallClock(Date date) {
  const std::lock_guard lock(mutex_);
  wall_ = date;
}

void ManualClock::setZone(std::chrono::minutes offset) {
  const std::lock_guard lock(mutex_);
  zone_ = offset;
}

ManualClock::TimerID ManualClock::scheduleAt(nanoseconds due,
                                             std::function<void()> action) {
  const std::lock_guard lock(mutex_);
  const TimerID timer = ++lastTimer_;
  timers_.emplace(Key{due, timer}, std::move(action));
  return timer;
}

bool ManualClock::cancel(TimerID timer) {
  std::function<void()> dropped;  // Destroyed without the lock.
  const std::lock_guard lock(mutex_);
  const auto found = std::find_if(timers_.begin(), timers_.end(), [&](const auto& entry) {
    return entry.first.second == timer;
  });
  if (found == timers_.end()) return false;
  dropped = std::move(found->second);
  timers_.erase(found);
  return true;
}

std::optional<nanoseconds> ManualClock::nextDue() const {
  const std::lock_guard lock(mutex_);
  if (timers_.empty()) return std::nullopt;
  return timers_.begin()->first.first;
}

std::size_t ManualClock::timerCount() const {
  const std::lock_guard lock(mutex_);
  return timers_.size();
}

void ManualClock::releaseCallbacks() {
  std::map<Key, std::function<void()>> dropped;  // Destroyed without the lock.
  const std::lock_guard lock(mutex_);
  dropped.swap(timers_);
}

}  // namespace ostrel
