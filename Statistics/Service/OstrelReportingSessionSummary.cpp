#include "Statistics/Service/OstrelReportingSessionSummary.h"

#include <algorithm>
#include <cstdint>
#include <deque>
#include <functional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "Statistics/OstrelReportingUtility.h"

namespace ostrel {
namespace {

bool holdsBlank(ValueView key) {
  const auto text = key.string();
  return text && text->find(' ') != std::string_view::npos;
}

// The values of the entries under their keys. A session of a million messages has
// about as many keys, so that what is kept for each is small: 50 bytes, and no
// allocation of its own.
class Grouping {
 public:
  Grouping(const Value& firstKey, const Value& firstValue,
           const OstrelReportingAggregatedPayloads::Snapshot& entries) {
    add(firstKey, firstValue);
    entries.forEach([this](ValueView entry) {
      for (const auto& [key, value] : entry.entries()) add(key, value);
    });
  }

  std::size_t groupCount() const { return groups_.size(); }

  /// Calls `use` with each group's key and joined text, encoded.
  template <typename Use>
  void forEachGroup(Use use) const {
    std::string text;
    std::string encoded;
    for (const Group& group : groups_) {
      text.clear();
      for (std::size_t at = group.first; at != kNone; at = values_[at].next) {
        if (at != group.first) text += ',';
        appendDescription(text, values_[at].value);
      }
      encoded.clear();
      ValueEncoder encoder(encoded);
      encoder.item(group.key);
      encoder.string(text);
      use(encoded);
    }
  }

 private:
  static constexpr std::size_t kNone = SIZE_MAX;
  static constexpr std::size_t kFewestSlots = 64;  // A power of two, as all counts.
  struct Link {
    ValueView value;
    std::size_t next;
  };
  struct Group {
    ValueView key;
    std::size_t first;
    std::size_t last;
  };

  static std::string_view nameOf(ValueView key) {
    const auto bytes = key.bytes();
    return {reinterpret_cast<const char*>(bytes.data()), bytes.size()};
  }

  void add(ValueView key, ValueView value) {
    const std::size_t link = values_.size();
    values_.push_back({value, kNone});
    if (2 * groups_.size() >= slots_.size()) growSlots();
    std::size_t& slot = findSlot(key);
    if (slot == kNone) {
      slot = groups_.size();
      groups_.push_back({key, link, link});
      return;
    }
    Group& group = groups_[slot];
    values_[group.last].next = link;
    group.last = link;
  }

  // The slot of the key's group, or the free one where it belongs.
  std::size_t& findSlot(ValueView key) {
    const std::string_view name = nameOf(key);
    std::size_t at = std::hash<std::string_view>()(name);
    while (true) {
      std::size_t& slot = slots_[at++ & (slots_.size() - 1)];
      if (slot == kNone || nameOf(groups_[slot].key) == name) return slot;
    }
  }

  void growSlots() {
    slots_.assign(std::max(kFewestSlots, 2 * slots_.size()), kNone);
    for (std::size_t i = 0; i < groups_.size(); ++i) findSlot(groups_[i].key) = i;
  }

  // A value's place in a group's list; the lists do not move as they grow.
  std::deque<Link> values_;
  std::deque<Group> groups_;
  std::vector<std::size_t> slots_;  // Of `groups_`, by the hash of the key.
};

}  // namespace

Dictionary SanitisedPayload(const Dictionary& message) {
  const bool isClean =
      std::none_of(message.begin(), message.end(),
                   [](const auto& entry) { return holdsBlank(entry.key); });
  if (isClean) return message;
  DictionaryBuilder sanitised(message.owner().account());
  for (const auto& [key, value] : message) {
    if (holdsBlank(key)) {
      std::string name(*key.string());
      std::replace(name.begin(), name.end(), ' ', '_');
      sanitised.set(Value(name), value);
    } else {
      sanitised.set(key, value);
    }
  }
  return sanitised.build();
}

Dictionary summaryEvent(ServiceType serviceType,
                        const OstrelReportingAggregatedPayloads::Snapshot& entries) {
  const Value key("Ostrel_Session_Summary_Event");
  const Value type(static_cast<std::uint16_t>(serviceType));
  const Grouping grouping(key, type, entries);
  std::string head;
  ValueEncoder(head).beginDictionary(grouping.groupCount());
  // The texts are made twice: a summary may be as large as all that it sums up, and
  // a buffer that grew with it would take as much again.
  std::size_t size = head.size();
  grouping.forEachGroup([&](const std::string& group) { size += group.size(); });
  ValueBuffer event = ValueBuffer::make(size);
  std::uint8_t* at = std::copy(head.begin(), head.end(), event.data());
  grouping.forEachGroup(
      [&](const std::string& group) { at = std::copy(group.begin(), group.end(), at); });
  return Dictionary(event, std::as_const(event).data());
}

std::string sessionLogFileName(const Clock& clock, Date date,
                               const std::optional<Value>& hostApplication,
                               ServiceType serviceType) {
  std::string name = clock.fileNameDate(date);
  name += "-ostrel-";
  if (hostApplication) {
    appendDescription(name, *hostApplication);
  } else {
    name += "(null)";
  }
  name += '-';
  name += ServiceTypeName(serviceType);
  name += ".json";
  return name;
}

}  // namespace ostrel
