// The values that cross the service: payloads, configurations, infos.
//
// A value is immutable and kept as its CBOR encoding (RFC 8949) in one shared
// buffer; a message is decoded by checking its bytes once and pointing at them.
// Copying a value copies a reference. Everything here walks the bytes without
// recursion, so nesting costs no stack.
//
// What the encoding may hold: booleans, integers from INT64_MIN to UINT64_MAX,
// doubles, text (UTF-8), dates (tag 1), arrays, and dictionaries whose keys are
// distinct and are text or integers. Lengths are definite. Whoever takes bytes
// from outside checks them before they become a value
// (`platform/linux/wire/PayloadDecoder.h`).
#pragma once

#include <cstdint>
#include <iterator>
#include <memory>
#include <optional>
#include <set>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <vector>

#include "platform/Date.h"
#include "platform/ValueBuffer.h"

namespace ostrel {

enum class ValueKind : std::uint8_t {
  kBoolean,
  kInteger,
  kDouble,
  kDate,
  kString,
  kArray,
  kDictionary,
};

class ArrayView;
class DictionaryView;

/// A look at a value that something else keeps alive. Cheap to copy.
class ValueView {
 public:
  /// `item` is the first byte of a checked item.
  explicit ValueView(const std::uint8_t* item) : item_(item) {}

  ValueKind kind() const;

  // Each is none when the value is of another kind.
  std::optional<bool> boolean() const;
  /// None too when the integer is above INT64_MAX.
  std::optional<std::int64_t> signedInteger() const;
  /// None too when the integer is below 0.
  std::optional<std::uint64_t> unsignedInteger() const;
  std::optional<double> floatingPoint() const;
  std::optional<Date> date() const;
  std::optional<std::string_view> string() const {
    const unsigned head = *item_;
    if (head >= kShortTexts && head < kLongTexts) {
      return std::string_view(reinterpret_cast<const char*>(item_ + 1),
                              head - kShortTexts);
    }
    return longString();
  }
  std::optional<ArrayView> array() const;
  std::optional<DictionaryView> dictionary() const;

  /// What `dictionary` holds, for a loop over it; nothing for the other kinds.
  DictionaryView entries() const;

  /// A boolean, integer or double as a double; none for the other kinds.
  std::optional<double> number() const;

  /// The encoding, from the first byte to the last.
  std::span<const std::uint8_t> bytes() const { return {item_, end()}; }
  /// The first byte of the encoding.
  const std::uint8_t* data() const { return item_; }
  /// One past the last byte of the encoding. Numbers and short texts, nearly all
  /// there are, are found by their first byte.
  const std::uint8_t* end() const {
    const unsigned head = *item_;
    if (head >= kShortTexts && head < kLongTexts) return item_ + 1 + (head - kShortTexts);
    if (head < kAfterIntegers || head >= kSimpleValues) {
      return item_ + 1 + kArgumentBytes[head & 0x1F];
    }
    return endOfLongItem();
  }

  /// Numbers are equal when their values are (1 and 1.0 are not: kinds
  /// differ); dictionaries are whatever the order of their entries.
  friend bool operator==(ValueView a, ValueView b);

 private:
  // First bytes of encodings.
  static constexpr unsigned kAfterIntegers = 0x40;
  static constexpr unsigned kShortTexts = 0x60;
  static constexpr unsigned kLongTexts = 0x78;
  static constexpr unsigned kSimpleValues = 0xE0;  // Booleans, doubles.
  // By the low 5 bits of the first byte.
  static constexpr std::uint8_t kArgumentBytes[32] = {0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0,
                                                      0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0,
                                                      0, 0, 1, 2, 4, 8, 0, 0, 0, 0};

  const std::uint8_t* endOfLongItem() const;
  std::optional<std::string_view> longString() const;

  const std::uint8_t* item_;
};

/// The elements of an array, in order.
class ArrayView {
 public:
  class Iterator {
   public:
    using value_type = ValueView;
    using difference_type = std::ptrdiff_t;
    using iterator_category = std::input_iterator_tag;
    using pointer = void;
    using reference = ValueView;

    Iterator(const std::uint8_t* at, std::size_t left) : at_(at), left_(left) {}
    ValueView operator*() const { return ValueView(at_); }
    Iterator& operator++() {
      if (--left_ != 0) at_ = ValueView(at_).end();
      return *this;
    }
    Iterator operator++(int) {
      Iterator before = *this;
      ++*this;
      return before;
    }
    friend bool operator==(const Iterator& a, const Iterator& b) {
      return a.left_ == b.left_;
    }

   private:
    const std::uint8_t* at_;
    std::size_t left_;
  };

  ArrayView(const std::uint8_t* first, std::size_t size) : first_(first), size_(size) {}
  std::size_t size() const { return size_; }
  bool empty() const { return size_ == 0; }
  Iterator begin() const { return {first_, size_}; }
  Iterator end() const { return {/*at=*/nullptr, /*left=*/0}; }

 private:
  const std::uint8_t* first_;
  std::size_t size_;
};

/// The entries of a dictionary, in the order in which they were built.
class DictionaryView {
 public:
  struct Entry {
    ValueView key;
    ValueView value;
  };

  class Iterator {
   public:
    using value_type = Entry;
    using difference_type = std::ptrdiff_t;
    using iterator_category = std::input_iterator_tag;
    using pointer = void;
    using reference = Entry;

    Iterator(const std::uint8_t* at, std::size_t left) : left_(left) { moveTo(at); }
    Entry operator*() const { return {ValueView(at_), ValueView(value_)}; }
    Iterator& operator++() {
      --left_;
      moveTo(left_ != 0 ? ValueView(value_).end() : nullptr);
      return *this;
    }
    Iterator operator++(int) {
      Iterator before = *this;
      ++*this;
      return before;
    }
    friend bool operator==(const Iterator& a, const Iterator& b) {
      return a.left_ == b.left_;
    }

   private:
    void moveTo(const std::uint8_t* at) {
      at_ = at;
      value_ = left_ != 0 ? ValueView(at).end() : nullptr;
    }
    const std::uint8_t* at_ = nullptr;
    const std::uint8_t* value_ = nullptr;
    std::size_t left_;
  };

  DictionaryView(const std::uint8_t* first, std::size_t size)
      : first_(first), size_(size) {}
  std::size_t size() const { return size_; }
  bool empty() const { return size_ == 0; }
  Iterator begin() const { return {first_, size_}; }
  Iterator end() const { return {/*at=*/nullptr, /*left=*/0}; }

  /// The value of a text key; a walk over the entries.
  std::optional<ValueView> find(std::string_view key) const;
  /// The value of a key of any kind.
  std::optional<ValueView> find(ValueView key) const;

 private:
  const std::uint8_t* first_;
  std::size_t size_;
};

class Array;
class Dictionary;

/// A value that keeps itself alive.
class Value {
 public:
  Value(bool value);
  Value(double value);
  Value(Date value);
  Value(std::string_view text);  // Must be UTF-8.
  Value(const char* text) : Value(std::string_view(text)) {}
  Value(const std::string& text) : Value(std::string_view(text)) {}
  template <typename T>
  requires(std::is_integral_v<T> && !std::is_same_v<T, bool>) Value(T integer)
      : Value(makeInteger(integer)) {}
  Value(const Array& array);
  Value(const Dictionary& dictionary);
  /// A copy of what the view shows.
  explicit Value(ValueView view);
  /// What `view` shows, kept alive by the buffer that it points into.
  Value(ValueBuffer owner, ValueView view) : owner_(std::move(owner)), view_(view) {}

  ValueView view() const { return view_; }
  operator ValueView() const { return view_; }
  const ValueView* operator->() const { return &view_; }
  const ValueBuffer& owner() const { return owner_; }

  friend bool operator==(const Value& a, const Value& b) { return a.view_ == b.view_; }

 private:
  explicit Value(std::span<const std::uint8_t> encoded);
  template <typename T>
  static Value makeInteger(T integer) {
    if constexpr (std::is_signed_v<T>) {
      return ofSigned(integer);
    } else {
      return ofUnsigned(integer);
    }
  }
  static Value ofSigned(std::int64_t integer);
  static Value ofUnsigned(std::uint64_t integer);

  ValueBuffer owner_;
  ValueView view_;
};

/// An array that keeps itself alive; empty unless made otherwise.
class Array {
 public:
  Array();
  /// None when the value is not an array.
  static std::optional<Array> from(const Value& value);

  ArrayView view() const { return *ValueView(item_).array(); }
  ValueView value() const { return ValueView(item_); }
  const ValueBuffer& owner() const { return owner_; }
  std::size_t size() const { return view().size(); }
  bool empty() const { return size() == 0; }
  auto begin() const { return view().begin(); }
  auto end() const { return view().end(); }

  friend bool operator==(const Array& a, const Array& b) {
    return a.value() == b.value();
  }

 private:
  friend class ArrayBuilder;
  Array(ValueBuffer owner, const std::uint8_t* item)
      : owner_(std::move(owner)), item_(item) {}

  ValueBuffer owner_;
  const std::uint8_t* item_;
};

/// A dictionary that keeps itself alive; empty unless made otherwise.
class Dictionary {
 public:
  Dictionary();
  /// `owner`'s bytes from `item` on are a checked dictionary.
  Dictionary(ValueBuffer owner, const std::uint8_t* item)
      : owner_(std::move(owner)), item_(item) {}
  Dictionary(std::initializer_list<std::pair<std::string_view, Value>> entries);
  /// None when the value is not a dictionary.
  static std::optional<Dictionary> from(const Value& value);
  /// A copy of a dictionary that a `ValueEncoder` wrote.
  static Dictionary copyOf(std::string_view encoded);

  DictionaryView view() const { return *ValueView(item_).dictionary(); }
  ValueView value() const { return ValueView(item_); }
  const ValueBuffer& owner() const { return owner_; }
  std::size_t size() const { return view().size(); }
  bool empty() const { return size() == 0; }
  auto begin() const { return view().begin(); }
  auto end() const { return view().end(); }

  /// Valid as long as this dictionary.
  std::optional<ValueView> find(std::string_view key) const { return view().find(key); }
  /// As `find`, kept alive.
  std::optional<Value> get(std::string_view key) const;
  bool contains(std::string_view key) const { return find(key).has_value(); }

  /// This dictionary, which no longer keeps more alive than itself: a copy when it
  /// shares its buffer with other values. For those that are kept for long.
  Dictionary compact() const;

  /// This dictionary with `value` under `key`, in the place of what was there or as
  /// the last entry: what a builder makes of it, in one allocation.
  Dictionary with(std::string_view key, const Value& value) const;

  friend bool operator==(const Dictionary& a, const Dictionary& b) {
    return a.value() == b.value();
  }

 private:
  ValueBuffer owner_;
  const std::uint8_t* item_;
};

/// Writes the encoding of values one after the other. The items and the counts
/// given must fit together.
class ValueEncoder {
 public:
  explicit ValueEncoder(std::string& out) : out_(out) {}

  void boolean(bool value);
  void signedInteger(std::int64_t value);
  void unsignedInteger(std::uint64_t value);
  void floatingPoint(double value);
  void date(Date value);
  void string(std::string_view text);
  /// The head of a text of so many bytes, which the caller adds.
  void beginString(std::size_t bytes);
  void beginArray(std::size_t size);
  void beginDictionary(std::size_t size);
  void item(ValueView value);

 private:
  void head(std::uint8_t majorType, std::uint64_t argument);

  std::string& out_;
};

class ArrayBuilder {
 public:
  ArrayBuilder& append(const Value& value) { return append(value.view()); }
  ArrayBuilder& append(ValueView value);
  Array build() const;

 private:
  std::string items_;
  std::size_t size_ = 0;
};

/// A dictionary in the making. A later value replaces an earlier one under the
/// same key, in the earlier one's place.
class DictionaryBuilder {
 public:
  DictionaryBuilder();
  /// Empty; what is built is charged to `account`, which may be none.
  explicit DictionaryBuilder(std::shared_ptr<PayloadAccount> account);
  /// Begins with the entries of `start` and bears its account.
  explicit DictionaryBuilder(const Dictionary& start);
  DictionaryBuilder(const DictionaryBuilder&) = delete;
  DictionaryBuilder& operator=(const DictionaryBuilder&) = delete;

  DictionaryBuilder& set(std::string_view key, const Value& value);
  DictionaryBuilder& set(ValueView key, ValueView value);
  /// Adds the entries of `other`, all that their client may; equal keys are replaced.
  /// What is built is borne by who bears the first that is merged, unless somebody does.
  DictionaryBuilder& merge(const Dictionary& other);

  bool contains(std::string_view key) const;
  std::size_t size() const { return entries_.size(); }
  bool empty() const { return entries_.empty(); }

  /// What has been set so far; the builder may go on.
  Dictionary build() const;

 private:
  struct Entry {
    std::size_t key;
    std::size_t value;
    std::size_t end;
  };
  struct KeyOrder {
    using is_transparent = void;
    const DictionaryBuilder* builder;
    bool operator()(std::size_t a, std::size_t b) const;
    bool operator()(std::size_t a, std::string_view b) const;
    bool operator()(std::string_view a, std::size_t b) const;
  };

  std::string_view keyBytes(std::size_t index) const {
    return std::string_view(scratch_).substr(entries_[index].key,
                                             entries_[index].value - entries_[index].key);
  }
  std::optional<std::size_t> indexOf(std::string_view encodedKey) const;
  PayloadAccount::Merged with(ValueView key, ValueView value) const;

  std::size_t bytes_ = 0;                  // Of what is not replaced.
  std::string scratch_;                    // Encoded keys and values, replaced ones too.
  std::vector<Entry> entries_;             // Offsets into `scratch_`.
  std::set<std::size_t, KeyOrder> order_;  // Filled once a walk would be slow.
  std::shared_ptr<PayloadAccount> account_;
};

/// Appends the text that stands for a value in log lines, summaries and
/// comparison keys: text as it is, "true" and "false", numbers in decimal, dates as
/// ISO 8601, "[a, b]" and "{key: value}" in the order of the entries. The same for the
/// same value in one process.
void appendDescription(std::string& out, ValueView value);
std::string description(ValueView value);
inline std::string description(const Dictionary& value) {
  return description(value.value());
}

}  // namespace ostrel
