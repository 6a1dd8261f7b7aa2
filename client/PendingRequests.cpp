#include "client/PendingRequests.h"

#include <algorithm>
#include <limits>
#include <utility>

namespace ostrel::reporting {
namespace {

// Requests that were answered but may be answered again; beyond it the oldest
// is forgotten.
constexpr std::size_t kMostLongLived = 4096;

template <typename T>
void call(const std::function<void(const Reply<T>&)>& handler,
          const Reply<T>& reply) noexcept {
  try {
    if (handler) handler(reply);
  } catch (...) {
    // The host's failure must not end the thread that serves its other requests.
  }
}

template <typename T>
Reply<T> endedReply(const std::function<void(const Reply<T>&)>&, Status status) {
  Reply<T> reply;
  reply.status = status;
  return reply;
}

template <typename T, typename From, typename Convert>
bool callWith(const Handler& handler, wire::ReplyValue& value, Convert convert) noexcept {
  auto* from = std::get_if<From>(&value);
  if (from == nullptr) return false;
  Reply<T> reply;
  if (!convert(*from, reply)) return false;
  call(std::get<std::function<void(const Reply<T>&)>>(handler), reply);
  return true;
}

bool readValidity(const Dictionary& dictionary, Reply<ReporterValidity>& reply) {
  const auto reporterID = dictionary.find("reporterID");
  const auto serviceType = dictionary.find("serviceType");
  if (!reporterID || !serviceType) return false;
  const auto id = reporterID->signedInteger();
  const auto type = serviceType->unsignedInteger();
  if (!id || !type || *type > std::numeric_limits<std::uint16_t>::max()) return false;
  reply.value = {ReporterID{*id}, ServiceType{static_cast<std::uint16_t>(*type)}};
  return true;
}

}  // namespace

void callHandler(const Handler& handler, Status status) noexcept {
  std::visit(
      [&](const auto& function) {
        if constexpr (!std::is_same_v<decltype(function), const std::monostate&>) {
          call(function, endedReply(function, status));
        }
      },
      handler);
}

bool callHandler(const Handler& handler, wire::ReplyValue& value) noexcept {
  if (auto* error = std::get_if<ErrorObject>(&value)) {
    return std::visit(
        [&](const auto& function) {
          if constexpr (!std::is_same_v<decltype(function), const std::monostate&>) {
            auto reply = endedReply(function, Status::kRefused);
            reply.error = {std::move(error->domain), error->code,
                           std::move(error->description)};
            call(function, reply);
          }
          return true;
        },
        handler);
  }
  switch (handler.index()) {
    case 0:
      return true;
    case 1:
      return callWith<bool, bool>(handler, value, [](bool from, auto& reply) {
        reply.value = from;
        return true;
      });
    case 2:
      return callWith<ServiceType, ostrel::ServiceType>(
          handler, value, [](ostrel::ServiceType from, auto& reply) {
            reply.value = ServiceType{static_cast<std::uint16_t>(from)};
            return true;
          });
    case 3:
      return callWith<void, std::monostate>(handler, value,
                                            [](auto&, auto&) { return true; });
    case 4:
      return callWith<ReporterValidity, Dictionary>(handler, value, readValidity);
    default:
      return callWith<ReporterIDs, ostrel::ReporterIDs>(
          handler, value, [](const auto& from, auto& reply) {
            reply.value.reserve(from.size());
            for (const auto id : from) {
              reply.value.push_back(ReporterID{static_cast<std::int64_t>(id)});
            }
            return true;
          });
  }
}

void PendingRequests::add(wire::Operation operation, Handler&& handler, Replies replies,
                          TimePoint deadline) {
  const bool isLongLived = replies != Replies::kOne || deadline == TimePoint::max();
  row_.emplace_back();
  Entry& entry = isLongLived ? longLived_[nextNumber_] : row_.back();
  entry.operation = operation;
  entry.handler = std::move(handler);
  entry.deadline = deadline;
  entry.repliesLeft = replies == Replies::kOne   ? 1
                      : replies == Replies::kTwo ? 2
                                                 : std::numeric_limits<unsigned>::max();
  nextDeadline_ = std::min(nextDeadline_, deadline);
  ++nextNumber_;
  trim();
}

PendingRequests::Entry* PendingRequests::find(wire::RequestNumber number) {
  if (number >= firstNumber_ && number < nextNumber_) {
    Entry& entry = row_[number - firstNumber_];
    if (entry.repliesLeft != 0) return &entry;
  }
  const auto found = longLived_.find(number);
  return found != longLived_.end() ? &found->second : nullptr;
}

void PendingRequests::takeForReply(wire::RequestNumber number, Answered& answered) {
  if (number == 0 || number >= nextNumber_) return;
  Entry* entry = find(number);
  if (entry == nullptr) {
    answered.operation = wire::Operation::kFarewell;
    return;
  }
  answered.operation = entry->operation;
  answered.isFirst = !entry->hasEnded;
  entry->hasEnded = true;
  entry->deadline = TimePoint::max();
  if (--entry->repliesLeft != 0) {
    answered.handler = entry->handler;
    return;
  }
  answered.handler = std::move(entry->handler);
  entry->handler = {};
  longLived_.erase(number);
  trim();
}

std::vector<Handler> PendingRequests::takeExpired(TimePoint now) {
  std::vector<Handler> expired;
  if (now < nextDeadline_) return expired;
  nextDeadline_ = TimePoint::max();
  const auto hasExpired = [&](const Entry& entry) {
    if (entry.repliesLeft == 0 || entry.hasEnded) return false;
    if (entry.deadline <= now) return true;
    nextDeadline_ = std::min(nextDeadline_, entry.deadline);
    return false;
  };
  for (Entry& entry : row_) {
    if (!hasExpired(entry)) continue;
    expired.push_back(std::move(entry.handler));
    entry = Entry();
  }
  for (auto i = longLived_.begin(); i != longLived_.end();) {
    Entry& entry = i->second;
    if (!hasExpired(entry)) {
      ++i;
    } else if (entry.repliesLeft == 1) {
      expired.push_back(std::move(entry.handler));
      i = longLived_.erase(i);
    } else {
      expired.push_back(entry.handler);
      entry.hasEnded = true;
      ++i;
    }
  }
  trim();
  return expired;
}

std::vector<Handler> PendingRequests::takeAll() {
  std::vector<Handler> all;
  for (auto& [number, entry] : longLived_) {
    if (!entry.hasEnded) all.push_back(std::move(entry.handler));
  }
  for (Entry& entry : row_) {
    if (entry.repliesLeft != 0) all.push_back(std::move(entry.handler));
  }
  longLived_.clear();
  row_.clear();
  firstNumber_ = nextNumber_;
  nextDeadline_ = TimePoint::max();
  return all;
}

void PendingRequests::trim() {
  while (!row_.empty() && row_.front().repliesLeft == 0) {
    row_.pop_front();
    ++firstNumber_;
  }
  while (longLived_.size() > kMostLongLived && longLived_.begin()->second.hasEnded) {
    longLived_.erase(longLived_.begin());
  }
}

}  // namespace ostrel::reporting
