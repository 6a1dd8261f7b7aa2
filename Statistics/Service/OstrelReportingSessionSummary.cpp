#include "Statistics/Service/OstrelReportingSessionSummary.h"

#include <algorithm>
#include <cstdint>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "Statistics/OstrelReportingUtility.h"
#include "Statistics/Service/OstrelReportingPayloadSurvey.h"
#include "platform/SpreadHash.h"

namespace ostrel {
namespace {

// The summary of entries that need not be in memory: they are walked twice. The first
// walk finds the groups and how long the text of each will be, the second writes the
// values to their places. A session of a million messages has about as many groups, so
// that what is kept for each is small: some 120 bytes, the key included.
class Summary {
 public:
  /// A value of the first walk.
  void measure(ValueView key, ValueView value) {
    const std::size_t number = groupOf(key);
    groupOfValue_.push_back(number);
    Group& group = groups_[number];
    group.textBytes += textOf(value, group).size();
    group.hasText = true;
  }

  /// Between the walks.
  void layOut() {
    std::string head;
    ValueEncoder encoder(head);
    encoder.beginDictionary(groups_.size());
    std::size_t size = head.size();
    for (Group& group : groups_) {
      textHead(group);
      size += keyOf(group).size() + head_.size() + group.textBytes;
    }
    event_ = ValueBuffer::make(size);
    std::uint8_t* at = std::copy(head.begin(), head.end(), event_.data());
    for (Group& group : groups_) {
      const std::string_view key = keyOf(group);
      at = std::copy(key.begin(), key.end(), at);
      textHead(group);
      at = std::copy(head_.begin(), head_.end(), at);
      group.text = at;
      group.hasText = false;
      at += group.textBytes;
    }
  }

  /// The same value of the second walk.
  void write(ValueView value) {
    if (writtenValues_ == groupOfValue_.size()) return;
    Group& group = groups_[groupOfValue_[writtenValues_++]];
    const std::string_view text =
        std::string_view(textOf(value, group)).substr(0, group.textBytes);
    group.text = std::copy(text.begin(), text.end(), group.text);
    group.textBytes -= text.size();
    group.hasText = true;
  }

  /// Blank is what the second walk did not come to, for want of a list that reads as it
  /// did before.
  Dictionary finish() {
    for (const Group& group : groups_) std::fill_n(group.text, group.textBytes, ' ');
    return Dictionary(event_, std::as_const(event_).data());
  }

 private:
  static constexpr std::size_t kNone = SIZE_MAX;
  static constexpr std::size_t kFewestSlots = 64;  // A power of two, as all counts.
  struct Group {
    std::size_t key;            // In `keys_`.
    std::size_t textBytes = 0;  // In the second walk: those to come.
    std::uint8_t* text = nullptr;
    bool hasText = false;  // Of this walk.
  };
  struct Slot {
    std::size_t group = kNone;  // In `groups_`.
    std::size_t hash = 0;
  };

  std::string_view keyOf(const Group& group) const {
    const char* const key = keys_.data() + group.key;
    return nameOf(ValueView(reinterpret_cast<const std::uint8_t*>(key)));
  }

  static std::string_view nameOf(ValueView key) {
    const auto bytes = key.bytes();
    return {reinterpret_cast<const char*>(bytes.data()), bytes.size()};
  }

  // What `value` adds to its group's text.
  const std::string& textOf(ValueView value, const Group& group) {
    text_.clear();
    if (group.hasText) text_ += ',';
    appendDescription(text_, value);
    return text_;
  }

  // Into `head_`.
  void textHead(const Group& group) {
    head_.clear();
    ValueEncoder(head_).beginString(group.textBytes);
  }

  std::size_t groupOf(ValueView key) {
    if (2 * groups_.size() >= slots_.size()) growSlots();
    const std::string_view name = nameOf(key);
    const std::size_t hash = SpreadHash()(name);
    std::size_t at = hash;
    while (true) {
      Slot& slot = slots_[at++ & (slots_.size() - 1)];
      if (slot.group == kNone) {
        slot = {groups_.size(), hash};
        groups_.push_back({keys_.size()});
        keys_ += name;
        return slot.group;
      }
      if (slot.hash == hash && keyOf(groups_[slot.group]) == name) return slot.group;
    }
  }

  void growSlots() {
    std::vector<Slot> old(std::max(kFewestSlots, 2 * slots_.size()));
    old.swap(slots_);
    for (const Slot& slot : old) {
      if (slot.group == kNone) continue;
      std::size_t at = slot.hash;
      while (slots_[at & (slots_.size() - 1)].group != kNone) ++at;
      slots_[at & (slots_.size() - 1)] = slot;
    }
  }

  std::vector<Group> groups_;  // In the order of their first values.
  std::vector<std::size_t> groupOfValue_;
  std::size_t writtenValues_ = 0;
  std::string keys_;         // Encoded, one after the other.
  std::vector<Slot> slots_;  // By the hash of the key.
  ValueBuffer event_;
  std::string text_;
  std::string head_;
};

}  // namespace

Dictionary SanitisedPayload(const Dictionary& message) {
  if (!PayloadSurvey(message).hasBlankInKey()) return message;
  DictionaryBuilder sanitised(message.owner().account());
  for (const auto& [key, value] : message) {
    const auto text = key.string();
    if (text && text->find(' ') != std::string_view::npos) {
      std::string name(*text);
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
  Summary summary;
  summary.measure(key, type);
  entries.forEach([&](ValueView entry) {
    for (const auto& [name, value] : entry.entries()) summary.measure(name, value);
  });
  summary.layOut();
  summary.write(type);
  entries.forEach([&](ValueView entry) {
    for (const auto& [name, value] : entry.entries()) summary.write(value);
  });
  return summary.finish();
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
