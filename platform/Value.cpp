// The walks below keep their own stack where they need one. Most do not: an
// item's end is found by counting the items that are still to come.
#include "platform/Value.h"

#include <algorithm>
#include <bit>
#include <charconv>
#include <cmath>
#include <cstring>
#include <limits>

#include "platform/Bytes.h"

namespace ostrel {
namespace {

enum MajorType : std::uint8_t {
  kUnsigned = 0,
  kNegative = 1,
  kText = 3,
  kArrayType = 4,
  kMapType = 5,
  kTag = 6,
  kSimple = 7,
};

constexpr std::uint8_t kFalse = 20;
constexpr std::uint8_t kTrue = 21;
constexpr std::uint8_t kHalf = 25;
constexpr std::uint8_t kSingle = 26;
constexpr std::uint8_t kFullDouble = 27;

constexpr std::uint8_t kEmptyArray = kArrayType << 5;
constexpr std::uint8_t kEmptyMap = kMapType << 5;

constexpr std::size_t kLinearSearchLimit = 16;

template <typename T>
T loadBigEndian(const std::uint8_t* at) {
  T value;
  std::memcpy(&value, at, sizeof value);
  if constexpr (sizeof(T) == 2) return __builtin_bswap16(value);
  if constexpr (sizeof(T) == 4) return __builtin_bswap32(value);
  if constexpr (sizeof(T) == 8) return __builtin_bswap64(value);
  return value;
}

struct Head {
  std::uint8_t majorType;
  std::uint8_t additional;
  std::uint64_t argument;
  const std::uint8_t* next;  // One past the head.
};

Head readHead(const std::uint8_t* at) {
  const std::uint8_t additional = *at & 0x1F;
  Head head{static_cast<std::uint8_t>(*at >> 5), additional, additional, at + 1};
  switch (additional) {
    case 24:
      head.argument = at[1];
      head.next = at + 2;
      break;
    case 25:
      head.argument = loadBigEndian<std::uint16_t>(at + 1);
      head.next = at + 3;
      break;
    case 26:
      head.argument = loadBigEndian<std::uint32_t>(at + 1);
      head.next = at + 5;
      break;
    case 27:
      head.argument = loadBigEndian<std::uint64_t>(at + 1);
      head.next = at + 9;
      break;
    default:
      break;
  }
  return head;
}

bool isShortest(const Head& head) {
  switch (head.additional) {
    case 24:
      return head.argument >= 24;
    case 25:
      return head.argument > 0xFF;
    case 26:
      return head.argument > 0xFFFF;
    case 27:
      return head.argument > 0xFFFFFFFF;
    default:
      return true;
  }
}

// The shortest head of an item.
class EncodedHead {
 public:
  EncodedHead(std::uint8_t majorType, std::uint64_t argument) {
    if (argument < 24) {
      bytes_[0] = static_cast<std::uint8_t>(majorType << 5 | argument);
      return;
    }
    const int log2Width = argument <= 0xFF         ? 0
                          : argument <= 0xFFFF     ? 1
                          : argument <= 0xFFFFFFFF ? 2
                                                   : 3;
    const std::size_t width = std::size_t{1} << log2Width;
    bytes_[0] = static_cast<std::uint8_t>(majorType << 5 | (24 + log2Width));
    for (std::size_t i = 0; i < width; ++i) {
      bytes_[1 + i] = static_cast<std::uint8_t>(argument >> (8 * (width - 1 - i)));
    }
    size_ = 1 + width;
  }

  std::span<const std::uint8_t> bytes() const { return {bytes_, size_}; }
  std::size_t size() const { return size_; }

 private:
  std::uint8_t bytes_[9];
  std::size_t size_ = 1;
};

double decodeHalf(std::uint16_t bits) {
  const int exponent = (bits >> 10) & 0x1F;
  const int fraction = bits & 0x3FF;
  double value;
  if (exponent == 0) {
    value = std::ldexp(fraction, -24);
  } else if (exponent == 31) {
    value = fraction == 0 ? std::numeric_limits<double>::infinity()
                          : std::numeric_limits<double>::quiet_NaN();
  } else {
    value = std::ldexp(fraction + 1024, exponent - 25);
  }
  return (bits & 0x8000) ? -value : value;
}

std::optional<double> doubleOf(const Head& head) {
  if (head.majorType != kSimple) return std::nullopt;
  switch (head.additional) {
    case kHalf:
      return decodeHalf(static_cast<std::uint16_t>(head.argument));
    case kSingle:
      return std::bit_cast<float>(static_cast<std::uint32_t>(head.argument));
    case kFullDouble:
      return std::bit_cast<double>(head.argument);
    default:
      return std::nullopt;
  }
}

double integerAsDouble(const Head& head) {
  return head.majorType == kUnsigned ? static_cast<double>(head.argument)
                                     : -static_cast<double>(head.argument + 1);
}

// The same key always has the same bytes here, however its sender wrote it.
std::string canonicalKey(ValueView key) {
  std::string bytes;
  ValueEncoder encoder(bytes);
  if (auto text = key.string()) {
    encoder.string(*text);
  } else if (auto natural = key.unsignedInteger()) {
    encoder.unsignedInteger(*natural);
  } else {
    encoder.signedInteger(key.signedInteger().value_or(0));
  }
  return bytes;
}

template <typename Number>
void appendNumber(std::string& out, Number number) {
  char digits[32];
  const auto [end, error] = std::to_chars(digits, digits + sizeof digits, number);
  out.append(digits, end);
}

void appendDouble(std::string& out, double number) {
  if (std::isnan(number)) {
    out += "nan";
  } else if (std::isinf(number)) {
    out += number < 0 ? "-inf" : "inf";
  } else {
    appendNumber(out, number);
  }
}

void appendScalarDescription(std::string& out, ValueView value) {
  switch (value.kind()) {
    case ValueKind::kBoolean:
      out += *value.boolean() ? "true" : "false";
      return;
    case ValueKind::kInteger:
      if (auto natural = value.unsignedInteger()) {
        appendNumber(out, *natural);
      } else {
        appendNumber(out, *value.signedInteger());
      }
      return;
    case ValueKind::kDouble:
      appendDouble(out, *value.floatingPoint());
      return;
    case ValueKind::kDate: {
      const Date date = *value.date();
      const std::string text = iso8601(date);
      if (text.empty()) {
        appendDouble(out, date.secondsSince1970);
      } else {
        out += text;
      }
      return;
    }
    case ValueKind::kString:
      out += *value.string();
      return;
    case ValueKind::kArray:
    case ValueKind::kDictionary:
      return;
  }
}

template <typename Encode>
std::string encoded(Encode encode) {
  std::string bytes;
  ValueEncoder encoder(bytes);
  encode(encoder);
  return bytes;
}

Dictionary joined(std::initializer_list<std::span<const std::uint8_t>> parts,
                  std::shared_ptr<PayloadAccount> account) {
  std::size_t size = 0;
  for (const auto part : parts) size += part.size();
  ValueBuffer buffer = ValueBuffer::make(size, std::move(account));
  std::uint8_t* at = buffer.data();
  for (const auto part : parts) at = std::ranges::copy(part, at).out;
  const std::uint8_t* const item = std::as_const(buffer).data();
  return Dictionary(std::move(buffer), item);
}

}  // namespace

ValueKind ValueView::kind() const {
  switch (*item_ >> 5) {
    case kUnsigned:
    case kNegative:
      return ValueKind::kInteger;
    case kText:
      return ValueKind::kString;
    case kArrayType:
      return ValueKind::kArray;
    case kMapType:
      return ValueKind::kDictionary;
    case kTag:
      return ValueKind::kDate;
    default:
      return (*item_ & 0x1F) >= kHalf ? ValueKind::kDouble : ValueKind::kBoolean;
  }
}

std::optional<bool> ValueView::boolean() const {
  if (*item_ == (kSimple << 5 | kTrue)) return true;
  if (*item_ == (kSimple << 5 | kFalse)) return false;
  return std::nullopt;
}

std::optional<std::int64_t> ValueView::signedInteger() const {
  const Head head = readHead(item_);
  if (head.argument > std::numeric_limits<std::int64_t>::max()) return std::nullopt;
  const auto magnitude = static_cast<std::int64_t>(head.argument);
  if (head.majorType == kUnsigned) return magnitude;
  if (head.majorType == kNegative) return -1 - magnitude;
  return std::nullopt;
}

std::optional<std::uint64_t> ValueView::unsignedInteger() const {
  const Head head = readHead(item_);
  if (head.majorType != kUnsigned) return std::nullopt;
  return head.argument;
}

std::optional<double> ValueView::floatingPoint() const {
  return doubleOf(readHead(item_));
}

std::optional<Date> ValueView::date() const {
  if (kind() != ValueKind::kDate) return std::nullopt;
  const ValueView seconds(readHead(item_).next);
  return Date{*seconds.number()};
}

std::optional<std::string_view> ValueView::longString() const {
  const Head head = readHead(item_);
  if (head.majorType != kText) return std::nullopt;
  return asText({head.next, static_cast<std::size_t>(head.argument)});
}

std::optional<ArrayView> ValueView::array() const {
  const Head head = readHead(item_);
  if (head.majorType != kArrayType) return std::nullopt;
  return ArrayView(head.next, head.argument);
}

std::optional<DictionaryView> ValueView::dictionary() const {
  const Head head = readHead(item_);
  if (head.majorType != kMapType) return std::nullopt;
  return DictionaryView(head.next, head.argument);
}

DictionaryView ValueView::entries() const {
  return dictionary().value_or(DictionaryView(/*first=*/nullptr, /*size=*/0));
}

std::optional<double> ValueView::number() const {
  const Head head = readHead(item_);
  if (head.majorType == kUnsigned || head.majorType == kNegative) {
    return integerAsDouble(head);
  }
  if (auto truth = boolean()) return *truth ? 1.0 : 0.0;
  return doubleOf(head);
}

const std::uint8_t* ValueView::endOfLongItem() const {
  const std::uint8_t* at = item_;
  for (std::uint64_t left = 1; left != 0; --left) {
    const Head head = readHead(at);
    at = head.next;
    switch (head.majorType) {
      case kText:
        at += head.argument;
        break;
      case kArrayType:
        left += head.argument;
        break;
      case kMapType:
        left += 2 * head.argument;
        break;
      case kTag:
        ++left;
        break;
      default:
        break;
    }
  }
  return at;
}

bool operator==(ValueView a, ValueView b) {
  std::vector<std::pair<ValueView, ValueView>> pairs{{a, b}};
  while (!pairs.empty()) {
    const auto [x, y] = pairs.back();
    pairs.pop_back();
    if (x.kind() != y.kind()) return false;
    switch (x.kind()) {
      case ValueKind::kBoolean:
        if (x.boolean() != y.boolean()) return false;
        break;
      case ValueKind::kInteger:
        if (x.signedInteger() != y.signedInteger() ||
            x.unsignedInteger() != y.unsignedInteger()) {
          return false;
        }
        break;
      case ValueKind::kDouble:
        if (*x.floatingPoint() != *y.floatingPoint()) return false;
        break;
      case ValueKind::kDate:
        if (*x.date() != *y.date()) return false;
        break;
      case ValueKind::kString:
        if (*x.string() != *y.string()) return false;
        break;
      case ValueKind::kArray: {
        const ArrayView xs = *x.array();
        const ArrayView ys = *y.array();
        if (xs.size() != ys.size()) return false;
        for (auto i = xs.begin(), j = ys.begin(); i != xs.end(); ++i, ++j) {
          pairs.emplace_back(*i, *j);
        }
        break;
      }
      case ValueKind::kDictionary: {
        const DictionaryView xs = *x.dictionary();
        const DictionaryView ys = *y.dictionary();
        if (xs.size() != ys.size()) return false;
        for (const auto& [key, value] : xs) {
          const auto other = ys.find(key);
          if (!other) return false;
          pairs.emplace_back(value, *other);
        }
        break;
      }
    }
  }
  return true;
}

std::optional<ValueView> DictionaryView::find(std::string_view key) const {
  for (const auto& [entryKey, value] : *this) {
    if (entryKey.string() == key) return value;
  }
  return std::nullopt;
}

std::optional<ValueView> DictionaryView::find(ValueView key) const {
  if (auto text = key.string()) return find(*text);
  for (const auto& [entryKey, value] : *this) {
    if (entryKey.kind() == ValueKind::kInteger && entryKey == key) return value;
  }
  return std::nullopt;
}

Value::Value(std::span<const std::uint8_t> encoded)
    : owner_(ValueBuffer::copyOf(encoded)),
      view_(static_cast<const ValueBuffer&>(owner_).data()) {}

Value::Value(ValueView view) : Value(view.bytes()) {}

Value::Value(bool value)
    : Value(asBytes(encoded([&](ValueEncoder& to) { to.boolean(value); }))) {}
Value::Value(double value)
    : Value(asBytes(encoded([&](ValueEncoder& to) { to.floatingPoint(value); }))) {}
Value::Value(Date value)
    : Value(asBytes(encoded([&](ValueEncoder& to) { to.date(value); }))) {}
Value::Value(std::string_view text)
    : Value(asBytes(encoded([&](ValueEncoder& to) { to.string(text); }))) {}
Value::Value(const Array& array) : owner_(array.owner()), view_(array.value()) {}
Value::Value(const Dictionary& dictionary)
    : owner_(dictionary.owner()), view_(dictionary.value()) {}

Value Value::ofSigned(std::int64_t integer) {
  return Value(asBytes(encoded([&](ValueEncoder& to) { to.signedInteger(integer); })));
}

Value Value::ofUnsigned(std::uint64_t integer) {
  return Value(asBytes(encoded([&](ValueEncoder& to) { to.unsignedInteger(integer); })));
}

Array::Array() : item_(&kEmptyArray) {}

std::optional<Array> Array::from(const Value& value) {
  if (value->kind() != ValueKind::kArray) return std::nullopt;
  return Array(value.owner(), value->data());
}

Dictionary::Dictionary() : item_(&kEmptyMap) {}

Dictionary::Dictionary(std::initializer_list<std::pair<std::string_view, Value>> entries)
    : Dictionary() {
  DictionaryBuilder builder;
  for (const auto& [key, value] : entries) builder.set(key, value);
  *this = builder.build();
}

std::optional<Dictionary> Dictionary::from(const Value& value) {
  if (value->kind() != ValueKind::kDictionary) return std::nullopt;
  return Dictionary(value.owner(), value->data());
}

Dictionary Dictionary::copyOf(std::string_view encoded) {
  const ValueBuffer buffer = ValueBuffer::copyOf(asBytes(encoded));
  return Dictionary(buffer, buffer.data());
}

Dictionary Dictionary::compact() const {
  if (!owner_ || value().bytes().size() == owner_.size()) return *this;
  ValueBuffer buffer = ValueBuffer::copyOf(value().bytes(), owner_.account());
  const std::uint8_t* item = buffer.data();
  return Dictionary(std::move(buffer), item);
}

std::optional<Value> Dictionary::get(std::string_view key) const {
  const auto found = find(key);
  if (!found) return std::nullopt;
  return Value(owner_, *found);
}

Dictionary Dictionary::with(std::string_view key, const Value& value) const {
  const Head head = readHead(item_);
  const std::uint8_t* at = head.next;
  std::span<const std::uint8_t> oldValue;
  for (std::uint64_t left = head.argument; left != 0; --left) {
    // A builder writes keys with their shortest heads.
    if (!isShortest(readHead(at))) {
      return DictionaryBuilder(*this).set(key, value).build();
    }
    const ValueView entryKey(at);
    const ValueView entryValue(entryKey.end());
    at = entryValue.end();
    if (entryKey.string() == key) oldValue = {entryValue.data(), at};
  }
  const std::span<const std::uint8_t> entries(head.next, at);
  if (oldValue.empty()) {
    return joined({EncodedHead(kMapType, head.argument + 1).bytes(), entries,
                   EncodedHead(kText, key.size()).bytes(), asBytes(key), value->bytes()},
                  owner_.account());
  }
  return joined({EncodedHead(kMapType, head.argument).bytes(),
                 {entries.data(), oldValue.data()},
                 value->bytes(),
                 {std::to_address(oldValue.end()), at}},
                owner_.account());
}

void ValueEncoder::head(std::uint8_t majorType, std::uint64_t argument) {
  const EncodedHead head(majorType, argument);
  out_.append(asText(head.bytes()));
}

void ValueEncoder::boolean(bool value) { head(kSimple, value ? kTrue : kFalse); }

void ValueEncoder::signedInteger(std::int64_t value) {
  if (value >= 0) {
    head(kUnsigned, static_cast<std::uint64_t>(value));
  } else {
    head(kNegative, ~static_cast<std::uint64_t>(value));
  }
}

void ValueEncoder::unsignedInteger(std::uint64_t value) { head(kUnsigned, value); }

void ValueEncoder::floatingPoint(double value) {
  const auto bits = __builtin_bswap64(std::bit_cast<std::uint64_t>(value));
  char bytes[9] = {static_cast<char>(kSimple << 5 | kFullDouble)};
  std::memcpy(bytes + 1, &bits, sizeof bits);
  out_.append(bytes, sizeof bytes);
}

void ValueEncoder::date(Date value) {
  head(kTag, 1);
  floatingPoint(value.secondsSince1970);
}

void ValueEncoder::string(std::string_view text) {
  beginString(text.size());
  out_.append(text);
}

void ValueEncoder::beginString(std::size_t bytes) { head(kText, bytes); }

void ValueEncoder::beginArray(std::size_t size) { head(kArrayType, size); }

void ValueEncoder::beginDictionary(std::size_t size) { head(kMapType, size); }

void ValueEncoder::item(ValueView value) { out_.append(asText(value.bytes())); }

ArrayBuilder& ArrayBuilder::append(ValueView value) {
  ValueEncoder(items_).item(value);
  ++size_;
  return *this;
}

Array ArrayBuilder::build() const {
  std::string bytes;
  ValueEncoder(bytes).beginArray(size_);
  bytes += items_;
  const ValueBuffer buffer = ValueBuffer::copyOf(asBytes(bytes));
  return Array(buffer, buffer.data());
}

bool DictionaryBuilder::KeyOrder::operator()(std::size_t a, std::size_t b) const {
  return builder->keyBytes(a) < builder->keyBytes(b);
}
bool DictionaryBuilder::KeyOrder::operator()(std::size_t a, std::string_view b) const {
  return builder->keyBytes(a) < b;
}
bool DictionaryBuilder::KeyOrder::operator()(std::string_view a, std::size_t b) const {
  return a < builder->keyBytes(b);
}

DictionaryBuilder::DictionaryBuilder() : order_(KeyOrder{this}) {}

DictionaryBuilder::DictionaryBuilder(std::shared_ptr<PayloadAccount> account)
    : DictionaryBuilder() {
  account_ = std::move(account);
}

DictionaryBuilder::DictionaryBuilder(const Dictionary& start)
    : DictionaryBuilder(start.owner().account()) {
  for (const auto& [key, value] : start) set(key, value);
}

std::optional<std::size_t> DictionaryBuilder::indexOf(std::string_view encodedKey) const {
  if (!order_.empty()) {
    const auto found = order_.find(encodedKey);
    if (found == order_.end()) return std::nullopt;
    return *found;
  }
  for (std::size_t i = 0; i < entries_.size(); ++i) {
    if (keyBytes(i) == encodedKey) return i;
  }
  return std::nullopt;
}

DictionaryBuilder& DictionaryBuilder::set(std::string_view key, const Value& value) {
  const Value keyValue(key);
  return set(keyValue.view(), value.view());
}

DictionaryBuilder& DictionaryBuilder::set(ValueView key, ValueView value) {
  const std::string encodedKey = canonicalKey(key);
  const auto known = indexOf(encodedKey);
  Entry entry;
  entry.key = scratch_.size();
  scratch_ += encodedKey;
  entry.value = scratch_.size();
  ValueEncoder(scratch_).item(value);
  entry.end = scratch_.size();
  bytes_ += entry.end - entry.key;
  if (known) {
    bytes_ -= entries_[*known].end - entries_[*known].key;
    entries_[*known] = entry;
    return *this;
  }
  entries_.push_back(entry);
  if (!order_.empty()) {
    order_.insert(entries_.size() - 1);
  } else if (entries_.size() > kLinearSearchLimit) {
    for (std::size_t i = 0; i < entries_.size(); ++i) order_.insert(i);
  }
  return *this;
}

DictionaryBuilder& DictionaryBuilder::merge(const Dictionary& other) {
  const std::shared_ptr<PayloadAccount> client = other.owner().account();
  if (client && !account_) account_ = client->accountOfMerged();
  const std::size_t before = bytes_;
  for (const auto& [key, value] : other) {
    if (client) {
      PayloadAccount::Merged merged = with(key, value);
      merged.growth = merged.bytes - std::min(merged.bytes, before);
      if (!client->mayMerge(merged)) continue;
    }
    set(key, value);
  }
  return *this;
}

PayloadAccount::Merged DictionaryBuilder::with(ValueView key, ValueView value) const {
  const std::string encodedKey = canonicalKey(key);
  const std::size_t added = encodedKey.size() + value.bytes().size();
  const auto known = indexOf(encodedKey);
  if (!known) return {entries_.size() + 1, bytes_ + added};
  return {entries_.size(),
          bytes_ + added - (entries_[*known].end - entries_[*known].key)};
}

bool DictionaryBuilder::contains(std::string_view key) const {
  return indexOf(canonicalKey(Value(key).view())).has_value();
}

Dictionary DictionaryBuilder::build() const {
  std::string head;
  ValueEncoder(head).beginDictionary(entries_.size());
  const std::size_t size = head.size() + bytes_;
  ValueBuffer buffer = ValueBuffer::make(size, account_);
  std::uint8_t* at = buffer.data();
  std::memcpy(at, head.data(), head.size());
  at += head.size();
  for (const Entry& entry : entries_) {
    std::memcpy(at, scratch_.data() + entry.key, entry.end - entry.key);
    at += entry.end - entry.key;
  }
  const std::uint8_t* item = buffer.data();
  return Dictionary(std::move(buffer), item);
}

void appendDescription(std::string& out, ValueView value) {
  struct Open {
    const std::uint8_t* next;
    std::size_t left;  // Items still to come: keys and values both count.
    bool isDictionary;
    bool isFirst = true;
  };
  std::vector<Open> open;
  const auto enter = [&](ValueView item) {
    if (auto array = item.array()) {
      out += '[';
      open.push_back({array->empty() ? nullptr : (*array->begin()).data(), array->size(),
                      /*isDictionary=*/false});
    } else if (auto dictionary = item.dictionary()) {
      out += '{';
      open.push_back({dictionary->empty() ? nullptr : (*dictionary->begin()).key.data(),
                      2 * dictionary->size(), /*isDictionary=*/true});
    } else {
      appendScalarDescription(out, item);
    }
  };
  enter(value);
  while (!open.empty()) {
    Open& top = open.back();
    if (top.left == 0) {
      out += top.isDictionary ? '}' : ']';
      open.pop_back();
      continue;
    }
    const bool isValueOfKey = top.isDictionary && top.left % 2 == 1;
    if (isValueOfKey) {
      out += ": ";
    } else if (!top.isFirst) {
      out += ", ";
    }
    top.isFirst = false;
    const ValueView item(top.next);
    if (--top.left != 0) top.next = item.end();
    enter(item);  // Ends the life of `top`.
  }
}

std::string description(ValueView value) {
  std::string text;
  appendDescription(text, value);
  return text;
}

}  // namespace ostrel
