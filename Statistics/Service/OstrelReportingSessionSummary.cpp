#include "Statistics/Service/OstrelReportingSessionSummary.h"

#include <algorithm>
#include <cstdint>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "Statistics/OstrelReportingUtility.h"

namespace ostrel {
namespace {

bool holdsBlank(ValueView key) {
  const auto text = key.string();
  return text && text->find(' ') != std::string_view::npos;
}

// The values of the entries under their keys. A key's values are a list through
// `values`: a session of a million messages has about as many keys.
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

  template <typename Use>
  void forEachGroup(Use use) const {
    for (const Group& group : groups_) {
      std::string text;
      for (std::size_t at = group.first; at != kNone; at = values_[at].next) {
        if (at != group.first) text += ',';
        appendDescription(text, values_[at].value);
      }
      use(group.key, text);
    }
  }

 private:
  static constexpr std::size_t kNone = SIZE_MAX;
  struct Link {
    ValueView value;
    std::size_t next;
  };
  struct Group {
    ValueView key;
    std::size_t first;
    std::size_t last;
  };

  void add(ValueView key, ValueView value) {
    const auto bytes = key.bytes();
    const std::string_view name(reinterpret_cast<const char*>(bytes.data()),
                                bytes.size());
    values_.push_back({value, kNone});
    const std::size_t link = values_.size() - 1;
    const auto [found, isNew] = indices_.try_emplace(name, groups_.size());
    if (isNew) {
      groups_.push_back({key, link, link});
      return;
    }
    Group& group = groups_[found->second];
    values_[group.last].next = link;
    group.last = link;
  }

  std::vector<Link> values_;
  std::vector<Group> groups_;
  std::unordered_map<std::string_view, std::size_t> indices_;
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
  std::string event;
  ValueEncoder encoder(event);
  encoder.beginDictionary(grouping.groupCount());
  grouping.forEachGroup([&](ValueView groupKey, const std::string& text) {
    encoder.item(groupKey);
    encoder.string(text);
  });
  return Dictionary::copyOf(event);
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
