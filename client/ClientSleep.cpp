// The event and the timer are watched for changes only, so that neither need be read
// before the next wait: what has told of itself is quiet until it tells of itself anew.
// The socket is watched for what is in it, so that no end of the connection is missed
// behind the last bytes.
#include "client/ClientSleep.h"

#include <sys/epoll.h>
#include <sys/timerfd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <utility>

namespace ostrel::reporting {
namespace {

constexpr int kMostEvents = 3;

bool change(int poll, int operation, int descriptor, std::uint32_t events) {
  epoll_event event{};
  event.events = events;
  event.data.fd = descriptor;
  return ::epoll_ctl(poll, operation, descriptor, &event) == 0;
}

}  // namespace

Outcome<ClientSleep> ClientSleep::make() {
  auto wake = WakeEvent::make();
  if (!wake.value) return {{}, std::move(wake.error)};
  OwnedDescriptor poll(::epoll_create1(EPOLL_CLOEXEC));
  OwnedDescriptor timer(::timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK));
  if (!poll || !timer ||
      !change(poll.get(), EPOLL_CTL_ADD, wake.value->descriptor(), EPOLLIN | EPOLLET) ||
      !change(poll.get(), EPOLL_CTL_ADD, timer.get(), EPOLLIN | EPOLLET)) {
    return {{},
            ErrorObject{std::string(kPOSIXErrorDomain), errno,
                        std::string("cannot wait: ") + std::strerror(errno)}};
  }
  return {ClientSleep(std::move(poll), *std::move(wake.value), std::move(timer)), {}};
}

bool ClientSleep::watch(int socket) {
  waitsForRoom_ = false;
  return change(poll_.get(), EPOLL_CTL_ADD, socket, EPOLLIN);
}

void ClientSleep::forget(int socket) {
  ::epoll_ctl(poll_.get(), EPOLL_CTL_DEL, socket, /*event=*/nullptr);
}

ClientSleep::Clock::time_point ClientSleep::endOfWait(Clock::time_point time) const {
  return std::min(time, timerEnd_);
}

void ClientSleep::wait(Clock::time_point time, int socket, bool wantsToWrite) {
  if (socket >= 0) setEvents(socket, wantsToWrite);
  const bool isAtOnce = time == Clock::time_point::min();
  // Earlier than it is set is seen to; at a later time it goes off once for nothing.
  if (!isAtOnce && time < timerEnd_) setTimer(time);
  epoll_event events[kMostEvents];
  const int count = ::epoll_wait(poll_.get(), events, kMostEvents, isAtOnce ? 0 : -1);
  for (int i = 0; i < count; ++i) {
    if (events[i].data.fd == timer_.get()) timerEnd_ = Clock::time_point::max();
  }
}

void ClientSleep::setTimer(Clock::time_point time) {
  // A timer that is set to 0 is off.
  const auto nanoseconds = std::max<std::int64_t>(
      std::chrono::nanoseconds(time.time_since_epoch()).count(), 1);
  itimerspec when{};
  when.it_value.tv_sec = static_cast<time_t>(nanoseconds / 1'000'000'000);
  when.it_value.tv_nsec = static_cast<long>(nanoseconds % 1'000'000'000);
  ::timerfd_settime(timer_.get(), TFD_TIMER_ABSTIME, &when, /*old=*/nullptr);
  timerEnd_ = time;
}

void ClientSleep::setEvents(int socket, bool wantsToWrite) {
  if (wantsToWrite == waitsForRoom_) return;
  const std::uint32_t events = wantsToWrite ? EPOLLIN | EPOLLOUT : EPOLLIN;
  if (change(poll_.get(), EPOLL_CTL_MOD, socket, events)) {
    waitsForRoom_ = wantsToWrite;
  }
}

void ClientSleep::close() {
  poll_.reset();
  wake_.close();
  timer_.reset();
}

}  // namespace ostrel::reporting
