// One pass over the bytes, without recursion: the open arrays and dictionaries
// are a small stack of places. Every count is compared with the bytes that are
// left and with the limits before anything is done with it.
//
// Nearly all entries are a short text and behind it a number, a truth or a short
// text. `passPlainEntries` goes over those with the state of their dictionary in
// registers, reading whole words, while there are as many bytes that it may read as
// the longest of them takes; it leaves all others, wrong ones too, to the general
// check. A payload of ten entries takes 51 ns so, and 75 without.
//
// Repeated keys. A small dictionary keeps a mask of 64 bits, one set by the hash
// of each key; only a key that meets a set bit is compared with the earlier
// ones, first by hash, then byte by byte. A large one has a table of its keys, with a
// hash that the sender cannot know, so that it cannot make the keys meet there; once one
// is repeated nobody looks for more. What is replaced is found by such a table too.
#include "platform/linux/wire/PayloadDecoder.h"

#include <algorithm>
#include <array>
#include <bit>
#include <string>
#include <vector>

#include "platform/SpreadHash.h"
#include "platform/linux/wire/Head.h"

namespace ostrel::wire {
namespace {

constexpr std::size_t kSmallDictionary = 16;
constexpr std::uint64_t kHighBits = 0x8080808080808080;
constexpr std::uint64_t kDateTag = 1;

using Byte = std::uint8_t;
using Bytes = std::span<const Byte>;

constexpr std::string_view kTooDeep = "the payload is nested too deeply";
constexpr std::string_view kTooManyValues = "the payload has too many values";
constexpr std::string_view kKeyTooLong = "a key is too long";
constexpr std::string_view kWrongKey = "a key is neither text nor an integer";
constexpr std::string_view kIntegerTooLow = "an integer is below -9223372036854775808";
constexpr std::string_view kWrongText = "a text is not UTF-8";
constexpr std::string_view kByteStringFound = "a byte string is not allowed";
constexpr std::string_view kWrongTag = "a tag other than 1 is not allowed";
constexpr std::string_view kWrongDate = "a date is not a finite number";
constexpr std::string_view kWrongSimple = "a simple value is neither true nor false";
constexpr std::string_view kNotADictionary = "the payload is not a dictionary";

std::uint64_t loadWord(const Byte* at) {
  std::uint64_t word;
  std::memcpy(&word, at, sizeof word);
  return word;
}

std::uint64_t littleEndian(std::uint64_t word) {
  if constexpr (std::endian::native == std::endian::little) return word;
  return __builtin_bswap64(word);
}

// The words that a short hash of a text is made of, and whether any byte is
// outside ASCII.
struct TextGlance {
  std::uint64_t first;
  std::uint64_t last;
  bool isASCII;
};

// Texts up to this size have it in their first byte.
constexpr std::size_t kShortText = 23;
constexpr Byte kShortTextHead = kTextString << 5;

// Of a text of `size` bytes, `kShortText` at most, behind whose beginning are a word's
// bytes or more.
[[gnu::always_inline]] inline TextGlance glanceAtShort(const Byte* at, std::size_t size) {
  constexpr std::size_t kWord = sizeof(std::uint64_t);
  if (size < kWord) {
    const std::uint64_t word =
        littleEndian(loadWord(at)) & ((std::uint64_t{1} << (8 * size)) - 1);
    return {word, 0, (word & kHighBits) == 0};
  }
  const std::uint64_t first = loadWord(at);
  const std::uint64_t last = loadWord(at + size - kWord);
  const std::uint64_t between = loadWord(at + std::min(kWord, size - kWord));
  return {first, last, ((first | between | last) & kHighBits) == 0};
}

// Of any text: `size` bytes at `at`, `end` the end of all bytes.
[[gnu::always_inline]] inline TextGlance glance(const Byte* at, std::size_t size,
                                                const Byte* end) {
  if (size >= sizeof(std::uint64_t)) {
    const std::uint64_t first = loadWord(at);
    const std::uint64_t last = loadWord(at + size - sizeof last);
    std::uint64_t high = first | last;
    for (std::size_t i = sizeof first; i + sizeof last < size; i += sizeof first) {
      high |= loadWord(at + i);
    }
    return {first, last, (high & kHighBits) == 0};
  }
  if (static_cast<std::size_t>(end - at) >= sizeof(std::uint64_t)) [[likely]] {
    return glanceAtShort(at, size);
  }
  std::uint64_t word = 0;
  for (std::size_t i = 0; i < size; ++i) word |= std::uint64_t{at[i]} << (8 * i);
  return {word, 0, (word & kHighBits) == 0};
}

[[gnu::always_inline]] inline std::uint32_t mix(std::uint64_t a, std::uint64_t b) {
  return static_cast<std::uint32_t>(((a ^ std::rotl(b, 29)) * 0x9E3779B97F4A7C15) >> 32);
}

// The longest plain entry, and the word that is read of a text's last bytes.
constexpr std::size_t kPlainEntryRoom = 2 * (1 + kShortText) + sizeof(std::uint64_t);
constexpr std::size_t kPlainElementRoom = 1 + kShortText + sizeof(std::uint64_t);

// The sizes of items that are right whatever follows their first byte: integers, truths
// and doubles. 0 for all others.
constexpr auto kPlainSizes = [] {
  std::array<std::uint8_t, 256> sizes{};
  for (unsigned i = 0; i < kOneByteFollows; ++i) {
    sizes[kUnsignedInteger << 5 | i] = sizes[kNegativeInteger << 5 | i] = 1;
  }
  for (unsigned i = 0; i < 4; ++i) {
    const auto size = static_cast<std::uint8_t>(1 + (1 << i));
    sizes[kUnsignedInteger << 5 | (kOneByteFollows + i)] = size;
    // Of eight bytes, some are below the least.
    if (i < 3) sizes[kNegativeInteger << 5 | (kOneByteFollows + i)] = size;
    if (i > 0) sizes[kSimpleItem << 5 | (kOneByteFollows + i)] = size;
  }
  sizes[kFalseItem] = sizes[kTrueItem] = 1;
  return sizes;
}();

// The size of the plain item at `at`, behind which there is room for one. 0: another.
[[gnu::always_inline]] inline std::size_t plainSize(const Byte* at) {
  const unsigned head = *at;
  const auto textSize = static_cast<std::uint8_t>(head - kShortTextHead);
  if (textSize <= kShortText) {
    return glanceAtShort(at + 1, textSize).isASCII ? std::size_t{1} + textSize : 0;
  }
  return kPlainSizes[head];
}

// `at` moved on by the size of a plain item. A processor guesses which of the usual sizes
// it is and goes on with the next item; without the barriers the compiler makes one
// addition of all, which waits until this item's first byte has come (a sixth of the
// check).
[[gnu::always_inline]] inline const Byte* behindPlain(const Byte* at, std::size_t size) {
  switch (size) {
    case 1:
      at += 1;
      asm volatile("" : "+r"(at));
      return at;
    case 3:
      at += 3;
      asm volatile("" : "+r"(at));
      return at;
    case 9:
      at += 9;
      asm volatile("" : "+r"(at));
      return at;
    default:
      return at + size;
  }
}

// Reads a key that was checked, and moves `at` behind it.
struct Key {
  std::uint8_t majorType;
  std::uint64_t argument;  // The number, or the size of the text.
  const Byte* text;
};

Key readKey(const Byte*& at, const Byte* end) {
  Head head{};
  readHead(at, end, head);
  const Byte* text = at;
  if (head.majorType == kTextString) at += head.argument;
  return {head.majorType, head.argument, text};
}

Key keyAt(const Byte* at, const Byte* end) { return readKey(at, end); }

bool areEqual(const Key& a, const Key& b) {
  return a.majorType == b.majorType && a.argument == b.argument &&
         (a.majorType != kTextString || std::memcmp(a.text, b.text, a.argument) == 0);
}

std::uint32_t spreadHash(const Key& key) {
  const std::uint64_t hash =
      key.majorType == kTextString
          ? SpreadHash()({reinterpret_cast<const char*>(key.text), key.argument})
          : SpreadHash()(key.argument) + key.majorType;
  return static_cast<std::uint32_t>(hash >> 32);
}

/// Finds keys by their hash: half empty, the next slot where one is taken.
class KeyTable {
 public:
  /// For `keys` keys.
  explicit KeyTable(std::size_t keys) : slots_(std::bit_ceil(2 * keys)) {}

  /// What is noted of the key with this hash that `isEqual` says is the same; none, and
  /// room for it, when it is new. What is noted is never 0.
  template <typename IsEqual>
  std::uint32_t& find(std::uint32_t hash, const IsEqual& isEqual) {
    const std::size_t mask = slots_.size() - 1;
    for (std::size_t i = hash & mask;; i = (i + 1) & mask) {
      Slot& slot = slots_[i];
      if (slot.noted == 0) slot.hash = hash;
      if (slot.noted == 0 || (slot.hash == hash && isEqual(slot.noted))) {
        return slot.noted;
      }
    }
  }

 private:
  struct Slot {
    std::uint32_t hash = 0;
    std::uint32_t noted = 0;
  };
  std::vector<Slot> slots_;
};

class ItemCheck {
 public:
  ItemCheck(Bytes bytes, const PayloadLimits& limits, const Byte* readableEnd)
      : begin_(bytes.data()),
        end_(begin_ + bytes.size()),
        readableEnd_(std::max(end_, readableEnd)),
        keyBytes_(limits.keyBytes),
        nesting_(std::min(limits.nesting, kDeepestNesting)),
        nodesLeft_(limits.nodes) {}

  DecodeError run(std::size_t& size, bool& hasRepeatedKeys);

 private:
  struct Level {
    std::size_t left;  // Elements or entries to come.
    bool isMap;
    bool isLarge;
    struct Keys {
      std::size_t count;   // In the two tables below.
      std::uint64_t bits;  // Of their hashes.
    } keys;  // Of a small dictionary; a large one has the last of `tables_` that is open.
    std::uint32_t hashes[kSmallDictionary];
    std::uint32_t offsets[kSmallDictionary];
  };

  // Each moves `at` on and returns null, or why it cannot.
  const char* checkValue(const Byte*& at, std::size_t& depth);
  const char* checkKey(const Byte*& at, Level& level);
  const char* open(const Byte*& at, const Head& head, std::size_t& depth);
  const char* checkDate(const Byte*& at) const;

  std::size_t bytesFrom(const Byte* at) const {
    return static_cast<std::size_t>(readableEnd_ - at);
  }
  void passPlainItems(const Byte*& at, Level& level);
  void passPlainEntries(const Byte*& at, Level& level);
  void passPlainElements(const Byte*& at, Level& level) const;

  void noteSmallKey(Level::Keys& keys, Level& level, std::uint32_t hash, const Byte* key);
  void noteLargeKey(const Byte* key);

  const Byte* const begin_;
  const Byte* const end_;
  const Byte* const readableEnd_;
  const std::size_t keyBytes_;
  const std::size_t nesting_;
  std::size_t nodesLeft_;
  bool hasRepeatedKeys_ = false;
  std::vector<KeyTable> tables_;  // Of the large dictionaries that are open.
  Level levels_[kDeepestNesting];
};

[[gnu::always_inline]] inline const char* ItemCheck::checkValue(const Byte*& at,
                                                                std::size_t& depth) {
  Head head;
  if (const char* error = readHead(at, end_, head)) return error;
  switch (head.majorType) {
    case kUnsignedInteger:
      return nullptr;
    case kNegativeInteger:
      return head.argument >> 63 ? kIntegerTooLow.data() : nullptr;
    case kTextString: {
      const std::size_t size = head.argument;
      if (size > static_cast<std::size_t>(end_ - at)) return kTruncated.data();
      if (!glance(at, size, end_).isASCII && !isUTF8({at, size})) {
        return kWrongText.data();
      }
      at += size;
      return nullptr;
    }
    case kArrayItem:
    case kMapItem:
      return open(at, head, depth);
    case kTagItem:
      return head.argument == kDateTag ? checkDate(at) : kWrongTag.data();
    case kSimpleItem:
      if (head.additional >= kHalfFloat) return nullptr;
      if (head.additional == (kTrueItem & 0x1F)) return nullptr;
      if (head.additional == (kFalseItem & 0x1F)) return nullptr;
      return kWrongSimple.data();
    default:
      return kByteStringFound.data();
  }
}

[[gnu::always_inline]] inline const char* ItemCheck::checkKey(const Byte*& at,
                                                              Level& level) {
  const Byte* const key = at;
  Head head;
  if (const char* error = readHead(at, end_, head)) return error;
  std::uint32_t hash;
  if (head.majorType == kTextString) [[likely]] {
    const std::size_t size = head.argument;
    if (size > keyBytes_) return kKeyTooLong.data();
    if (size > static_cast<std::size_t>(end_ - at)) return kTruncated.data();
    const TextGlance seen = glance(at, size, end_);
    if (!seen.isASCII && !isUTF8({at, size})) return kWrongText.data();
    at += size;
    hash = mix(seen.first + size, seen.last);
  } else if (head.majorType == kUnsignedInteger || head.majorType == kNegativeInteger) {
    if (head.majorType == kNegativeInteger && head.argument >> 63) {
      return kIntegerTooLow.data();
    }
    hash = mix(head.argument, head.majorType);
  } else {
    return kWrongKey.data();
  }
  if (level.isLarge) [[unlikely]] {
    noteLargeKey(key);
  } else {
    noteSmallKey(level.keys, level, hash, key);
  }
  return nullptr;
}

// `keys` are those of `level`, or a copy of them.
[[gnu::always_inline]] inline void ItemCheck::noteSmallKey(Level::Keys& keys,
                                                           Level& level,
                                                           std::uint32_t hash,
                                                           const Byte* key) {
  const std::uint64_t bit = std::uint64_t{1} << (hash >> 26);
  if (keys.bits & bit) {
    for (std::size_t i = 0; i < keys.count; ++i) {
      if (level.hashes[i] != hash) continue;
      const Byte* const other = begin_ + level.offsets[i];
      if (areEqual(keyAt(other, end_), keyAt(key, end_))) hasRepeatedKeys_ = true;
    }
  }
  keys.bits |= bit;
  level.hashes[keys.count] = hash;
  level.offsets[keys.count] = static_cast<std::uint32_t>(key - begin_);
  ++keys.count;
}

[[gnu::noinline]] void ItemCheck::noteLargeKey(const Byte* key) {
  if (hasRepeatedKeys_) return;
  const Key read = keyAt(key, end_);
  std::uint32_t& offset = tables_.back().find(spreadHash(read), [&](std::uint32_t other) {
    return areEqual(keyAt(begin_ + other, end_), read);
  });
  hasRepeatedKeys_ = offset != 0;
  offset = static_cast<std::uint32_t>(key - begin_);
}

const char* ItemCheck::open(const Byte*& at, const Head& head, std::size_t& depth) {
  const bool isMap = head.majorType == kMapItem;
  if (depth == nesting_) return kTooDeep.data();
  // Each element takes a byte at least, each entry two.
  const auto bytesLeft = static_cast<std::size_t>(end_ - at);
  if (head.argument > (isMap ? bytesLeft / 2 : bytesLeft)) return kTruncated.data();
  const std::size_t values = isMap ? 2 * head.argument : head.argument;
  if (values > nodesLeft_) return kTooManyValues.data();
  nodesLeft_ -= values;
  if (values == 0) return nullptr;
  Level& level = levels_[depth++];
  level.left = head.argument;
  level.isMap = isMap;
  level.isLarge = isMap && level.left > kSmallDictionary;
  level.keys = {};
  if (level.isLarge) tables_.emplace_back(hasRepeatedKeys_ ? 0 : level.left);
  return nullptr;
}

[[gnu::noinline]] const char* ItemCheck::checkDate(const Byte*& at) const {
  Head head;
  if (const char* error = readHead(at, end_, head)) return error;
  switch (head.majorType) {
    case kUnsignedInteger:
      return nullptr;
    case kNegativeInteger:
      return head.argument >> 63 ? kIntegerTooLow.data() : nullptr;
    case kSimpleItem: {
      // Not finite: all bits of the exponent are set.
      std::uint64_t exponent = 1;
      if (head.additional == kTwoBytesFollow) exponent = ~head.argument & 0x7C00;
      if (head.additional == kFourBytesFollow) exponent = ~head.argument & 0x7F800000;
      if (head.additional == kEightBytesFollow) {
        exponent = ~head.argument & 0x7FF0000000000000;
      }
      const bool isFloat = head.additional >= kHalfFloat;
      return isFloat && exponent != 0 ? nullptr : kWrongDate.data();
    }
    default:
      return kWrongDate.data();
  }
}

[[gnu::always_inline]] inline void ItemCheck::passPlainItems(const Byte*& at,
                                                             Level& level) {
  if (!level.isMap) return passPlainElements(at, level);
  if (!level.isLarge && keyBytes_ >= kShortText) passPlainEntries(at, level);
}

[[gnu::always_inline]] inline void ItemCheck::passPlainEntries(const Byte*& at,
                                                               Level& level) {
  Level::Keys keys = level.keys;
  std::size_t left = level.left;
  const Byte* key = at;
  while (left != 0 && bytesFrom(key) >= kPlainEntryRoom) {
    const auto keySize = static_cast<std::uint8_t>(*key - kShortTextHead);
    if (keySize > kShortText) break;
    const TextGlance seen = glanceAtShort(key + 1, keySize);
    const Byte* const value = key + 1 + keySize;
    const std::size_t valueSize = plainSize(value);
    if (!seen.isASCII || valueSize == 0 || value + valueSize > end_) break;
    noteSmallKey(keys, level, mix(seen.first + keySize, seen.last), key);
    key = behindPlain(value, valueSize);
    --left;
  }
  level.keys = keys;
  level.left = left;
  at = key;
}

[[gnu::always_inline]] inline void ItemCheck::passPlainElements(const Byte*& at,
                                                                Level& level) const {
  while (level.left != 0 && bytesFrom(at) >= kPlainElementRoom) {
    const std::size_t size = plainSize(at);
    if (size == 0 || at + size > end_) return;
    at = behindPlain(at, size);
    --level.left;
  }
}

DecodeError ItemCheck::run(std::size_t& size, bool& hasRepeatedKeys) {
  if (begin_ == end_) return kTruncated;
  if (nodesLeft_ == 0) return kTooManyValues;
  --nodesLeft_;
  const Byte* at = begin_;
  std::size_t depth = 0;
  const char* error = checkValue(at, depth);
  while (error == nullptr && depth != 0) {
    Level& level = levels_[depth - 1];
    passPlainItems(at, level);
    if (level.left == 0) {
      if (level.isLarge) tables_.pop_back();
      --depth;
      continue;
    }
    --level.left;
    if (level.isMap) {
      error = checkKey(at, level);
      if (error != nullptr) break;
    }
    error = checkValue(at, depth);
  }
  if (error != nullptr) return error;
  size = static_cast<std::size_t>(at - begin_);
  hasRepeatedKeys = hasRepeatedKeys_;
  return std::nullopt;
}

// Writes a checked item again without the entries that a later one of the same
// key replaces.
class RepeatedKeyRemover {
 public:
  explicit RepeatedKeyRemover(Bytes item)
      : begin_(item.data()), end_(begin_ + item.size()) {}

  std::string run() {
    findEntries();
    markReplaced();
    return write();
  }

 private:
  struct Map {
    std::uint32_t offset;   // Of its head.
    std::uint32_t entries;  // That stay.
    bool isChanged;
  };
  struct Entry {
    std::uint32_t map;  // In `maps_`.
    std::uint32_t begin;
    std::uint32_t end = 0;
    bool isReplaced = false;
  };
  // So that one key of many dictionaries is at as many places of the table.
  static constexpr std::uint32_t kOddFactor = 0x9E3779B9;

  struct Level {
    std::size_t left;
    bool isMap;
    std::uint32_t map;
    std::size_t entry;  // The one that is being read, in `entries_`.
  };

  std::uint32_t offset(const Byte* at) const {
    return static_cast<std::uint32_t>(at - begin_);
  }

  void findEntries() {
    std::vector<Level> open;
    const Byte* at = begin_;
    do {
      // A value begins here, or, within a dictionary, an entry.
      if (!open.empty() && open.back().isMap) {
        Level& level = open.back();
        level.entry = entries_.size();
        entries_.push_back({level.map, offset(at)});
        readKey(at, end_);
      }
      passValue(at, open);
      while (!open.empty() && open.back().left == 0) {
        open.pop_back();
        endEntry(at, open);
      }
      if (!open.empty()) --open.back().left;
    } while (!open.empty());
  }

  void passValue(const Byte*& at, std::vector<Level>& open) {
    const std::uint32_t begin = offset(at);
    Head head{};
    readHead(at, end_, head);
    if (head.majorType == kTagItem) readHead(at, end_, head);
    if (head.majorType == kArrayItem || head.majorType == kMapItem) {
      const bool isMap = head.majorType == kMapItem;
      open.push_back({head.argument, isMap, static_cast<std::uint32_t>(maps_.size()), 0});
      if (isMap) {
        maps_.push_back({begin, static_cast<std::uint32_t>(head.argument), false});
      }
      return;
    }
    if (head.majorType == kTextString) at += head.argument;
    endEntry(at, open);
  }

  void endEntry(const Byte* at, const std::vector<Level>& open) {
    if (!open.empty() && open.back().isMap) {
      entries_[open.back().entry].end = offset(at);
    }
  }

  void markReplaced() {
    KeyTable latest(entries_.size());
    for (std::uint32_t i = 0; i < entries_.size(); ++i) {
      const Entry& entry = entries_[i];
      const Key key = keyAt(begin_ + entry.begin, end_);
      // Counted from 1.
      std::uint32_t& number =
          latest.find(spreadHash(key) + entry.map * kOddFactor, [&](std::uint32_t other) {
            const Entry& earlier = entries_[other - 1];
            return earlier.map == entry.map &&
                   areEqual(keyAt(begin_ + earlier.begin, end_), key);
          });
      if (number != 0) replace(entries_[number - 1]);
      number = i + 1;
    }
  }

  void replace(Entry& entry) {
    entry.isReplaced = true;
    --maps_[entry.map].entries;
    maps_[entry.map].isChanged = true;
  }

  // Entries and maps both stand in the order of their first bytes.
  std::string write() const {
    std::string out;
    out.reserve(static_cast<std::size_t>(end_ - begin_));
    const Byte* at = begin_;
    const auto copyUntil = [&](const Byte* until) {
      out.append(reinterpret_cast<const char*>(at), static_cast<std::size_t>(until - at));
      at = until;
    };
    auto entry = entries_.begin();
    for (const Map& map : maps_) {
      const Byte* const head = begin_ + map.offset;
      for (; entry != entries_.end() && begin_ + entry->begin < head; ++entry) {
        skipIfReplaced(*entry, at, copyUntil);
      }
      if (!map.isChanged || head < at) continue;
      copyUntil(head);
      Head old{};
      readHead(at, end_, old);
      ValueEncoder(out).beginDictionary(map.entries);
    }
    for (; entry != entries_.end(); ++entry) skipIfReplaced(*entry, at, copyUntil);
    copyUntil(end_);
    return out;
  }

  template <typename CopyUntil>
  void skipIfReplaced(const Entry& entry, const Byte*& at,
                      const CopyUntil& copyUntil) const {
    if (!entry.isReplaced || begin_ + entry.begin < at) return;
    copyUntil(begin_ + entry.begin);
    at = begin_ + entry.end;
  }

  const Byte* const begin_;
  const Byte* const end_;
  std::vector<Map> maps_;
  std::vector<Entry> entries_;
};

}  // namespace

bool isUTF8(std::span<const std::uint8_t> text) {
  const auto isContinuation = [](Byte byte) { return (byte & 0xC0) == 0x80; };
  const Byte* at = text.data();
  const Byte* const end = at + text.size();
  while (at != end) {
    const Byte first = *at;
    const auto left = end - at;
    if (first < 0x80) {
      ++at;
    } else if (first < 0xC2) {
      return false;
    } else if (first < 0xE0) {
      if (left < 2 || !isContinuation(at[1])) return false;
      at += 2;
    } else if (first < 0xF0) {
      if (left < 3 || !isContinuation(at[1]) || !isContinuation(at[2])) return false;
      if (first == 0xE0 && at[1] < 0xA0) return false;   // Overlong.
      if (first == 0xED && at[1] >= 0xA0) return false;  // A surrogate.
      at += 3;
    } else {
      if (first > 0xF4 || left < 4 || !isContinuation(at[1]) || !isContinuation(at[2]) ||
          !isContinuation(at[3])) {
        return false;
      }
      if (first == 0xF0 && at[1] < 0x90) return false;   // Overlong.
      if (first == 0xF4 && at[1] >= 0x90) return false;  // Above U+10FFFF.
      at += 4;
    }
  }
  return true;
}

DecodeError checkItem(std::span<const std::uint8_t> bytes, const PayloadLimits& limits,
                      std::size_t& size, bool& hasRepeatedKeys,
                      const std::uint8_t* readableEnd) {
  ItemCheck check(bytes, limits, readableEnd);
  return check.run(size, hasRepeatedKeys);
}

DecodedDictionary decodeDictionary(std::span<const std::uint8_t> bytes,
                                   const PayloadLimits& limits,
                                   const ValueBuffer& owner) {
  if (bytes.empty()) return {std::nullopt, kTruncated};
  if (bytes[0] >> 5 != kMapItem) return {std::nullopt, kNotADictionary};
  std::size_t size = 0;
  bool hasRepeatedKeys = false;
  const Byte* const readableEnd = owner ? owner.data() + owner.size() : nullptr;
  if (auto error = checkItem(bytes, limits, size, hasRepeatedKeys, readableEnd)) {
    return {std::nullopt, error};
  }
  auto item = bytes.first(size);
  if (owner && !hasRepeatedKeys) {
    return {Dictionary(owner, item.data()), std::nullopt, size};
  }
  std::string rewritten;
  if (hasRepeatedKeys) {
    rewritten = RepeatedKeyRemover(item).run();
    item = {reinterpret_cast<const Byte*>(rewritten.data()), rewritten.size()};
  }
  const ValueBuffer copy = ValueBuffer::copyOf(item, owner.account());
  return {Dictionary(copy, copy.data()), std::nullopt, size};
}

}  // namespace ostrel::wire
