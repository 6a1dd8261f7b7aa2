// A message is kept as its encoding from the first entry on; its head grows in
// place. Whether a key is there already is answered by a filter of 64 bits
// first, so that building an ordinary message looks at no entry twice.
#include "ostrel/Message.h"

#include <algorithm>
#include <bit>
#include <cstring>
#include <functional>
#include <span>

#include "client/RequestFrame.h"
#include "platform/Bytes.h"
#include "platform/Value.h"
#include "platform/linux/Limits.h"
#include "platform/linux/wire/PayloadDecoder.h"

namespace ostrel::reporting {
namespace {

constexpr unsigned char kArrayHead = 0x80;
constexpr unsigned char kDictionaryHead = 0xA0;
constexpr unsigned char kWideUnsigned = 0x1B;
constexpr unsigned char kWideNegative = 0x3B;
constexpr unsigned char kWideDouble = 0xFB;
constexpr std::size_t kWideSize = 9;

// Beyond it, keys are kept in a set of their own.
constexpr std::size_t kFewKeys = 32;

ValueView viewOf(std::string_view encoded) { return ValueView(asBytes(encoded).data()); }

std::uint64_t filterBit(std::string_view key) {
  return std::uint64_t{1} << (std::hash<std::string_view>()(key) % 64);
}

std::size_t headSize(std::size_t size) {
  return size < 24            ? 1
         : size <= 0xFF       ? 2
         : size <= 0xFFFF     ? 3
         : size <= 0xFFFFFFFF ? 5
                              : 9;
}

std::size_t countValues(ValueView value) {
  std::size_t count = 0;
  std::vector<ValueView> open{value};
  while (!open.empty()) {
    const ValueView item = open.back();
    open.pop_back();
    ++count;
    if (const auto array = item.array()) {
      open.insert(open.end(), array->begin(), array->end());
    } else if (const auto dictionary = item.dictionary()) {
      count += dictionary->size();
      for (const auto& entry : *dictionary) open.push_back(entry.value);
    }
  }
  return count;
}

}  // namespace

Collection::Collection(unsigned char majorType)
    : encoded_(/*count=*/1, static_cast<char>(majorType)) {}

bool Collection::isValid() const {
  return isWellFormed_ && values_ <= limits::kNodes && nesting_ <= limits::kNesting;
}

void Collection::write(const Item& item) {
  ValueEncoder encoder(encoded_);
  switch (item.kind_) {
    case Item::Kind::kBoolean:
      encoder.boolean(item.boolean_);
      break;
    case Item::Kind::kSigned:
      encoder.signedInteger(item.signed_);
      break;
    case Item::Kind::kUnsigned:
      encoder.unsignedInteger(item.unsigned_);
      break;
    case Item::Kind::kDouble:
      encoder.floatingPoint(item.double_);
      break;
    case Item::Kind::kDate:
      encoder.date(ostrel::Date{item.double_});
      break;
    case Item::Kind::kText:
      writeText(item.text_);
      break;
    case Item::Kind::kList:
      writeEncoded(*item.list_);
      return;
    case Item::Kind::kMessage:
      writeEncoded(*item.message_);
      return;
  }
  ++values_;
}

void Collection::writeText(std::string_view text) {
  isWellFormed_ = isWellFormed_ && wire::isUTF8(asBytes(text));
  ValueEncoder(encoded_).string(text);
}

void Collection::writeEncoded(const Collection& part) {
  values_ += part.values_;
  nesting_ = std::max(nesting_, part.nesting_ + 1);
  isWellFormed_ = isWellFormed_ && part.isWellFormed_;
  encoded_ += std::string(part.encoded_);  // A copy: `part` may be this one.
}

bool Collection::isSameAs(const Item& item) const {
  return (item.kind_ == Item::Kind::kMessage && item.message_ == this) ||
         (item.kind_ == Item::Kind::kList && item.list_ == this);
}

void Collection::setSize(std::size_t size) {
  const bool isList = (static_cast<unsigned char>(encoded_[0]) & 0xE0) == kArrayHead;
  std::string head;
  ValueEncoder encoder(head);
  isList ? encoder.beginArray(size) : encoder.beginDictionary(size);
  encoded_.replace(0, headSize(size_), head);
  size_ = size;
}

List::List() : Collection(kArrayHead) {}

List::List(std::initializer_list<Item> items) : List() {
  for (const Item& item : items) append(item);
}

List& List::append(const Item& item) {
  write(item);
  setSize(size_ + 1);
  return *this;
}

Message::Message() : Collection(kDictionaryHead) {}

Message::Message(std::initializer_list<std::pair<std::string_view, Item>> entries)
    : Message() {
  for (const auto& [key, value] : entries) set(key, value);
}

Message& Message::set(std::string_view key, const Item& value) {
  if (isSameAs(value)) {
    const Message copy(*this);
    return set(key, Item(copy));
  }
  makeRoomFor(key);
  isWellFormed_ = isWellFormed_ && key.size() <= limits::kKeyBytes;
  writeText(key);
  ++values_;
  write(value);
  setSize(size_ + 1);
  return *this;
}

Message& Message::merge(const Message& other) {
  if (&other == this || !other.isValid()) return *this;
  for (const auto& [key, value] : viewOf(other.encoded_).entries()) {
    makeRoomFor(*key.string());
    writeText(*key.string());
    encoded_.append(reinterpret_cast<const char*>(value.bytes().data()),
                    value.bytes().size());
    values_ += 1 + countValues(value);
    setSize(size_ + 1);
  }
  nesting_ = std::max(nesting_, other.nesting_);
  return *this;
}

std::optional<Message::Entry> Message::find(std::string_view key) const {
  const auto* start = viewOf(encoded_).bytes().data();
  for (const auto& [entryKey, value] : viewOf(encoded_).entries()) {
    if (entryKey.string() != key) continue;
    return Entry{static_cast<std::size_t>(entryKey.bytes().data() - start),
                 static_cast<std::size_t>(value.end() - start), 1 + countValues(value)};
  }
  return std::nullopt;
}

void Message::makeRoomFor(std::string_view key) {
  const std::uint64_t bit = filterBit(key);
  const bool mayBeThere =
      (keyFilter_ & bit) != 0 && (keys_.empty() || keys_.count(std::string(key)) != 0);
  keyFilter_ |= bit;
  if (mayBeThere) {
    if (const auto entry = find(key)) {
      encoded_.erase(entry->begin, entry->end - entry->begin);
      values_ -= entry->values;
      setSize(size_ - 1);
      return;
    }
  }
  remember(key);
}

void Message::remember(std::string_view key) {
  if (!keys_.empty()) {
    keys_.emplace(key);
  } else if (size_ == kFewKeys) {
    for (const auto& entry : viewOf(encoded_).entries()) {
      keys_.emplace(*entry.key.string());
    }
    keys_.emplace(key);
  }
}

PreparedMessage::PreparedMessage(const Message& message, Category category,
                                 MessageType type,
                                 const std::optional<ReporterIDs>& reporterIDs) {
  payload_ = appendSendMessage(frame_, /*number=*/0, message.encoded(), category, type,
                               reporterIDs);
  isValid_ = message.isValid() && frame_.size() <= limits::kFrameBytes &&
             (!reporterIDs || reporterIDs->size() <= limits::kReporterIDs);
}

PreparedMessage::Field PreparedMessage::field(std::string_view key) {
  Field field;
  if (!isValid_) return field;
  const auto* start = asBytes(frame_).data();
  const auto value = ValueView(start + payload_).dictionary()->find(key);
  if (!value) return field;
  const auto date = value->date();
  const auto number = value->number();
  if (value->kind() == ValueKind::kBoolean || (!date && !number)) return field;

  std::size_t offset = static_cast<std::size_t>(value->bytes().data() - start);
  const std::size_t end = static_cast<std::size_t>(value->end() - start);
  if (date) ++offset;  // The number follows the tag.
  field.index_ = offsets_.size();
  const auto known = std::find(offsets_.begin(), offsets_.end(), offset);
  if (known != offsets_.end()) {
    field.index_ = static_cast<std::size_t>(known - offsets_.begin());
    return field;
  }
  const std::size_t size = end - offset;
  const auto natural = value->unsignedInteger();
  const auto negative = value->signedInteger();
  frame_.replace(offset, size, kWideSize, '\0');
  for (std::size_t& other : offsets_) {
    if (other > offset) other += kWideSize - size;
  }
  offsets_.push_back(offset);
  setFrameLength(frame_, /*begin=*/0);
  isValid_ = frame_.size() <= limits::kFrameBytes;
  if (date) {
    set(field, date->secondsSince1970);
  } else if (natural) {
    set(field, *natural);
  } else if (negative) {
    set(field, *negative);
  } else {
    set(field, *number);
  }
  return field;
}

void PreparedMessage::set(Field field, double value) noexcept {
  write(field, kWideDouble, std::bit_cast<std::uint64_t>(value));
}

void PreparedMessage::set(Field field, Date value) noexcept {
  using Seconds = std::chrono::duration<double>;
  set(field, std::chrono::duration_cast<Seconds>(value.time_since_epoch()).count());
}

void PreparedMessage::setSigned(Field field, std::int64_t value) noexcept {
  const auto bits = static_cast<std::uint64_t>(value);
  value < 0 ? write(field, kWideNegative, ~bits) : write(field, kWideUnsigned, bits);
}

void PreparedMessage::setUnsigned(Field field, std::uint64_t value) noexcept {
  write(field, kWideUnsigned, value);
}

void PreparedMessage::write(Field field, unsigned char head,
                            std::uint64_t bits) noexcept {
  if (field.index_ >= offsets_.size()) return;
  char* at = frame_.data() + offsets_[field.index_];
  *at = static_cast<char>(head);
  const std::uint64_t bigEndian = __builtin_bswap64(bits);
  std::memcpy(at + 1, &bigEndian, sizeof bigEndian);
}

}  // namespace ostrel::reporting
