#include "Statistics/Service/OstrelReportingMessageCounts.h"

#include <algorithm>
#include <charconv>
#include <functional>

namespace ostrel {

MessageIdentifier::MessageIdentifier(std::string_view name, std::int64_t number) {
  char* const end = text_.data() + text_.size();
  char* at = std::copy(name.begin(), name.end(), text_.data());
  *at++ = '_';
  at = std::to_chars(at, end, number).ptr;
  size_ = static_cast<std::size_t>(at - text_.data());
}

MessageIdentifier MessageCounts::next(const MessageNames& names) {
  return {names.identifier, ++countOf(names).count};
}

MessageCounts::Count& MessageCounts::countOf(const MessageNames& names) {
  if (first_.names == nullptr) first_.names = &names;
  if (first_.names == &names) return first_;
  const auto place = std::lower_bound(
      others_.begin(), others_.end(), &names, [](const Count& a, const MessageNames* b) {
        return std::less<const MessageNames*>()(a.names, b);
      });
  if (place != others_.end() && place->names == &names) return *place;
  return *others_.insert(place, {&names, /*count=*/0});
}

std::map<std::string, std::int64_t> MessageCounts::byName() const {
  std::map<std::string, std::int64_t> counts;
  if (first_.names != nullptr) counts.emplace(first_.names->identifier, first_.count);
  for (const Count& other : others_) counts.emplace(other.names->identifier, other.count);
  return counts;
}

}  // namespace ostrel
