// The payload check beside three other decoders, over generated items and damaged
// copies of them. Each decoder gives a text for a value, the same for the same value,
// so that the texts can be compared.
//
// The other decoders take more than a payload may hold. libcbor keeps everything that
// the item says, so that the payload's own rules can be applied to what it read:
// it must agree on every item. The others lose some of it, and each difference that
// is left is named where it is allowed.
#include <cbor.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <bit>
#include <cmath>
#include <cstdio>
#include <fstream>
#include <map>
#include <nlohmann/json.hpp>
#include <random>
#include <set>
#include <string>
#include <vector>

#include "platform/linux/TestSupport.h"
#include "platform/linux/wire/PayloadDecoder.h"
#include "platform/linux/wire/WireTesting.h"

namespace ostrel::wire {
namespace {

using Random = std::mt19937_64;
using Text = std::optional<std::string>;  // None: rejected.

constexpr std::size_t kItems = 4000;
constexpr PayloadLimits kLimits = kTestLimits;

std::uint64_t below(Random& random, std::uint64_t bound) { return random() % bound; }
bool oneIn(Random& random, std::uint64_t count) { return below(random, count) == 0; }

// --- Items ---

/// Items of every kind, shortest heads and longer ones, and now and then something
/// that no payload may hold.
class ItemMaker {
 public:
  explicit ItemMaker(Random& random) : random_(random) {}

  std::string make() {
    out_.clear();
    dictionary(/*depth=*/0);
    return out_;
  }

 private:
  void head(unsigned majorType, std::uint64_t argument) {
    unsigned width = argument < 24            ? 0
                     : argument < 0x100       ? 1
                     : argument < 0x10000     ? 2
                     : argument < 0x100000000 ? 3
                                              : 4;
    if (oneIn(random_, 8)) width += static_cast<unsigned>(below(random_, 5 - width));
    const std::uint64_t additional = width == 0 ? argument : 23 + width;
    byte(majorType << 5 | additional);
    if (width != 0) bigEndian(argument, std::size_t{1} << (width - 1));
  }

  void byte(std::uint64_t value) { out_.push_back(static_cast<char>(value)); }

  void bigEndian(std::uint64_t value, std::size_t size) {
    while (size-- != 0) byte(value >> (8 * size) & 0xFF);
  }

  std::uint64_t number() { return random_() >> below(random_, 64); }

  void integer() {
    if (oneIn(random_, 2)) return head(kPositive, number());
    head(kNegative, oneIn(random_, 40) ? number() : number() >> 1);
  }

  void text() {
    static constexpr std::array<std::string_view, 8> kPieces = {
        "a",
        "b",
        "route",
        "\xC3\xA9",
        "\xE2\x82\xAC",
        "\xF0\x9F\x8E\xB5",
        "a piece of more than eight bytes",
        "\xED\x9F\xBF"};
    std::string text;
    for (auto pieces = below(random_, 4); pieces != 0; --pieces) {
      text += kPieces[below(random_, kPieces.size())];
    }
    if (oneIn(random_, 60)) text += static_cast<char>(below(random_, 256));
    head(kText, text.size());
    out_ += text;
  }

  void floating() {
    const auto width = below(random_, 3);
    byte(0xF9 + width);
    const auto size = std::size_t{2} << width;
    static constexpr std::array<std::uint64_t, 3> kInfinity = {0x7C00, 0x7F800000,
                                                               0x7FF0000000000000};
    bigEndian(oneIn(random_, 10) ? kInfinity[width] : random_(), size);
  }

  void date() {
    head(kTag, 1);
    oneIn(random_, 2) ? integer() : floating();
  }

  void forbidden() {
    static constexpr std::array<std::string_view, 9> kForbidden = {
        "\xF6",         "\xF7",      "\xE5",         "\xF8\x20",
        "\x41x",        "\xC2\x41x", "\x9F\x01\xFF", "\xBF\x61x\x01\xFF",
        "\x7F\x61x\xFF"};
    out_ += kForbidden[below(random_, kForbidden.size())];
  }

  void key() {
    if (oneIn(random_, 200)) return value(kDeepest);
    oneIn(random_, 4) ? integer() : text();
  }

  void dictionary(int depth) {
    const auto size = oneIn(random_, 10) ? below(random_, 40) : below(random_, 5);
    head(kMap, size);
    for (std::uint64_t i = 0; i < size; ++i) {
      key();
      value(depth + 1);
    }
  }

  void value(int depth) {
    if (oneIn(random_, 150)) return forbidden();
    switch (below(random_, depth < kDeepest ? 8 : 5)) {
      case 0:
        return integer();
      case 1:
        return text();
      case 2:
        return floating();
      case 3:
        return date();
      case 4:
        return byte(0xF4 + below(random_, 2));
      case 5: {
        const auto size = below(random_, 6);
        head(kArray, size);
        for (std::uint64_t i = 0; i < size; ++i) value(depth + 1);
        return;
      }
      default:
        return dictionary(depth);
    }
  }

  static constexpr int kDeepest = 5;
  static constexpr unsigned kPositive = 0;
  static constexpr unsigned kNegative = 1;
  static constexpr unsigned kText = 3;
  static constexpr unsigned kArray = 4;
  static constexpr unsigned kMap = 5;
  static constexpr unsigned kTag = 6;

  Random& random_;
  std::string out_;
};

std::string damaged(Random& random, std::string item) {
  for (auto times = 1 + below(random, 3); times != 0 && !item.empty(); --times) {
    const auto at = below(random, item.size());
    switch (below(random, 5)) {
      case 0:
        item[at] = static_cast<char>(random());
        break;
      case 1:
        item[at] = static_cast<char>(item[at] ^ 1 << below(random, 8));
        break;
      case 2:
        item.resize(at);
        break;
      case 3:
        item.insert(at, 1, static_cast<char>(random()));
        break;
      default:
        item.insert(at, item.substr(below(random, item.size()), below(random, 12)));
    }
  }
  return item;
}

const std::vector<std::string>& items() {
  static const std::vector<std::string> all = [] {
    Random random(20260117);
    ItemMaker maker(random);
    std::vector<std::string> made;
    while (made.size() < kItems) {
      made.push_back(maker.make());
      made.push_back(damaged(random, made.back()));
    }
    return made;
  }();
  return all;
}

std::string hex(std::string_view bytes) {
  static constexpr char kDigits[] = "0123456789abcdef";
  std::string text;
  for (const char byte : bytes) {
    text += kDigits[static_cast<unsigned char>(byte) >> 4];
    text += kDigits[static_cast<unsigned char>(byte) & 15];
  }
  return text;
}

// --- Texts for values ---

std::string textOfDouble(char kind, double value) {
  if (std::isnan(value)) return std::string(1, kind) + "nan";
  char bits[24];
  std::snprintf(bits, sizeof bits, "%c%016llx", kind,
                static_cast<unsigned long long>(std::bit_cast<std::uint64_t>(value)));
  return bits;
}

std::string textOfString(std::string_view text) { return "s" + hex(text); }

std::string textOfList(const std::vector<std::string>& elements) {
  std::string text = "[";
  for (const std::string& element : elements) text += element + ",";
  return text + "]";
}

std::string textOfMap(const std::map<std::string, std::string>& entries) {
  std::string text = "{";
  for (const auto& [key, value] : entries) text += key + ":" + value + ",";
  return text + "}";
}

/// `areDatesNumbers`: a date looks like the number that it holds.
std::string textOf(ValueView value, bool areDatesNumbers) {
  switch (value.kind()) {
    case ValueKind::kBoolean:
      return *value.boolean() ? "true" : "false";
    case ValueKind::kInteger:
      if (const auto number = value.unsignedInteger()) return std::to_string(*number);
      return std::to_string(*value.signedInteger());
    case ValueKind::kDouble:
      return textOfDouble('d', *value.floatingPoint());
    case ValueKind::kDate: {
      if (!areDatesNumbers) return textOfDouble('D', value.date()->secondsSince1970);
      // What follows the tag's head, of one byte or, when it is longer, up to nine.
      const std::uint8_t first = *value.data() & 0x1F;
      return textOf(ValueView(value.data() + (first < 24 ? 1 : 1 + (1 << (first - 24)))),
                    areDatesNumbers);
    }
    case ValueKind::kString:
      return textOfString(*value.string());
    case ValueKind::kArray: {
      std::vector<std::string> elements;
      const ArrayView array = *value.array();
      for (const ValueView element : array) {
        elements.push_back(textOf(element, areDatesNumbers));
      }
      return textOfList(elements);
    }
    case ValueKind::kDictionary: {
      std::map<std::string, std::string> entries;
      for (const auto [key, held] : value.entries()) {
        EXPECT_TRUE(
            entries.emplace(textOf(key, areDatesNumbers), textOf(held, areDatesNumbers))
                .second)
            << "a key is there twice";
      }
      return textOfMap(entries);
    }
  }
  return "?";
}

struct Ours {
  Text text;
  Text textWithNumbers;  // Dates as numbers.
  std::string error;
};

Ours ours(const std::string& item) {
  const ExactBytes exact(item);
  const auto decoded = decodeWhole(exact.span(), kLimits);
  EXPECT_FALSE(decoded.dictionary && check(item, kLimits).error);
  if (!decoded.dictionary) return {{}, {}, std::string(*decoded.error)};
  const ValueView value = decoded.dictionary->value();
  return {textOf(value, /*areDatesNumbers=*/false),
          textOf(value, /*areDatesNumbers=*/true), ""};
}

// --- libcbor ---

/// Applies the payload's rules to what libcbor read.
class LibcborReader {
 public:
  Text read(const std::string& item) {
    cbor_load_result result;
    const auto bytes = spanOf(item);
    cbor_item_t* root = cbor_load(bytes.data(), bytes.size(), &result);
    if (root == nullptr) return std::nullopt;
    const bool isWhole = result.read == bytes.size() && cbor_isa_map(root);
    Text text;
    if (isWhole) text = textOfItem(root);
    cbor_decref(&root);
    return text;
  }

 private:
  static std::optional<std::string> textOfInteger(const cbor_item_t* item) {
    const std::uint64_t argument = cbor_get_int(item);
    if (cbor_isa_uint(item)) return std::to_string(argument);
    if (argument >> 63) return std::nullopt;
    return std::to_string(-1 - static_cast<std::int64_t>(argument));
  }

  static Text textOfText(const cbor_item_t* item) {
    if (!cbor_string_is_definite(item)) return std::nullopt;
    const std::string_view text(reinterpret_cast<const char*>(cbor_string_handle(item)),
                                cbor_string_length(item));
    // libcbor says "no characters" of a text that is not UTF-8.
    if (!text.empty() && cbor_string_codepoint_count(item) == 0) return std::nullopt;
    return textOfString(text);
  }

  static Text textOfDate(const cbor_item_t* item) {
    if (cbor_tag_value(item) != 1) return std::nullopt;
    cbor_item_t* content = cbor_tag_item(item);
    double seconds = NAN;
    if (cbor_is_float(content)) {
      seconds = cbor_float_get_float(content);
    } else if (cbor_is_int(content)) {
      const auto integer = textOfInteger(content);
      if (integer) seconds = std::stod(*integer);
    }
    cbor_decref(&content);
    if (!std::isfinite(seconds)) return std::nullopt;
    return textOfDouble('D', seconds);
  }

  static Text textOfItem(const cbor_item_t* item) {
    switch (cbor_typeof(item)) {
      case CBOR_TYPE_UINT:
      case CBOR_TYPE_NEGINT:
        return textOfInteger(item);
      case CBOR_TYPE_STRING:
        return textOfText(item);
      case CBOR_TYPE_ARRAY: {
        if (!cbor_array_is_definite(item)) return std::nullopt;
        std::vector<std::string> elements;
        for (std::size_t i = 0; i < cbor_array_size(item); ++i) {
          const auto element = textOfItem(cbor_array_handle(item)[i]);
          if (!element) return std::nullopt;
          elements.push_back(*element);
        }
        return textOfList(elements);
      }
      case CBOR_TYPE_MAP: {
        if (!cbor_map_is_definite(item)) return std::nullopt;
        std::map<std::string, std::string> entries;
        for (std::size_t i = 0; i < cbor_map_size(item); ++i) {
          const cbor_pair& pair = cbor_map_handle(item)[i];
          if (!cbor_is_int(pair.key) && !cbor_isa_string(pair.key)) return std::nullopt;
          const auto key = textOfItem(pair.key);
          const auto value = textOfItem(pair.value);
          if (!key || !value) return std::nullopt;
          entries[*key] = *value;
        }
        return textOfMap(entries);
      }
      case CBOR_TYPE_TAG:
        return textOfDate(item);
      case CBOR_TYPE_FLOAT_CTRL:
        if (cbor_is_float(item)) return textOfDouble('d', cbor_float_get_float(item));
        if (cbor_is_bool(item)) return cbor_get_bool(item) ? "true" : "false";
        return std::nullopt;
      default:
        return std::nullopt;
    }
  }
};

/// Whether a head claims more elements than there are bytes. libcbor would take, and
/// fill, that much memory.
bool claimsTooMuch(const std::string& item) {
  std::size_t most = 0;
  cbor_callbacks callbacks = cbor_empty_callbacks;
  callbacks.array_start = [](void* context, auto size) {
    auto& largest = *static_cast<std::size_t*>(context);
    largest = std::max<std::size_t>(largest, size);
  };
  callbacks.map_start = callbacks.array_start;
  const auto bytes = spanOf(item);
  for (std::size_t at = 0; at < bytes.size();) {
    const auto result =
        cbor_stream_decode(bytes.data() + at, bytes.size() - at, &callbacks, &most);
    if (result.status != CBOR_DECODER_FINISHED) break;
    at += result.read;
  }
  return most > item.size();
}

TEST(PayloadAgreement, WithLibcborOnEveryItem) {
  std::size_t accepted = 0;
  std::size_t compared = 0;
  for (const std::string& item : items()) {
    const Ours mine = ours(item);
    if (claimsTooMuch(item)) {
      ASSERT_FALSE(mine.text) << hex(item);
      continue;
    }
    ++compared;
    ASSERT_EQ(mine.text, LibcborReader().read(item)) << hex(item) << "\n" << mine.error;
    accepted += mine.text.has_value();
  }
  // Both outcomes are common, or the comparison says little.
  EXPECT_GT(accepted, kItems / 4);
  EXPECT_GT(compared - accepted, kItems / 10);
}

// --- nlohmann::json ---

std::string textOf(const nlohmann::json& value) {
  if (value.is_boolean()) return value.get<bool>() ? "true" : "false";
  if (value.is_number_unsigned()) return std::to_string(value.get<std::uint64_t>());
  if (value.is_number_integer()) return std::to_string(value.get<std::int64_t>());
  if (value.is_number_float()) return textOfDouble('d', value.get<double>());
  if (value.is_string()) return textOfString(value.get_ref<const std::string&>());
  if (value.is_array()) {
    std::vector<std::string> elements;
    for (const auto& element : value) elements.push_back(textOf(element));
    return textOfList(elements);
  }
  if (value.is_object()) {
    std::map<std::string, std::string> entries;
    for (const auto& [key, held] : value.items()) {
      entries[textOfString(key)] = textOf(held);
    }
    return textOfMap(entries);
  }
  return value.is_null() ? "null" : "binary";
}

bool holdsWhatJSONDoesNot(ValueView value) {
  if (value.kind() == ValueKind::kDate) return true;
  if (const auto array = value.array()) {
    return std::any_of(array->begin(), array->end(), holdsWhatJSONDoesNot);
  }
  for (const auto [key, held] : value.entries()) {
    if (key.kind() == ValueKind::kInteger || holdsWhatJSONDoesNot(held)) return true;
  }
  return false;
}

nlohmann::json jsonOf(const std::string& item) {
  try {
    return nlohmann::json::from_cbor(item, /*strict=*/true, /*allow_exceptions=*/true,
                                     nlohmann::json::cbor_tag_handler_t::ignore);
  } catch (const nlohmann::json::exception&) {
    return nlohmann::json(nlohmann::json::value_t::discarded);
  }
}

// It takes no integer as a key, nor a date, but for one whose tag has a longer head:
// that is a number to it. (An entry that a later one replaced may have held them.) It
// takes byte strings, null,
// indefinite lengths, any tag, any bytes as text, integers that are too low, and
// dates that are not finite. (A payload must be a dictionary besides.)
TEST(PayloadAgreement, WithJSONFromCBORUpToItsOwnRules) {
  const std::set<std::string> stricter = {
      "a byte string is not allowed",  "a simple value is neither true nor false",
      "a length is indefinite",        "a tag other than 1 is not allowed",
      "a text is not UTF-8",           "an integer is below -9223372036854775808",
      "a date is not a finite number", "the payload is not a dictionary",
  };
  std::size_t compared = 0;
  for (const std::string& item : items()) {
    const Ours mine = ours(item);
    const nlohmann::json json = jsonOf(item);
    if (json.is_discarded()) {
      if (!mine.text) continue;
      const auto decoded = decodeWhole(spanOf(item), kLimits);
      ASSERT_TRUE(holdsWhatJSONDoesNot(decoded.dictionary->value()) ||
                  check(item, kLimits).hasRepeatedKeys)
          << hex(item);
    } else if (!mine.text) {
      ASSERT_TRUE(stricter.contains(mine.error)) << hex(item) << "\n" << mine.error;
    } else {
      ASSERT_EQ(*mine.textWithNumbers, textOf(json)) << hex(item);
      ++compared;
    }
  }
  EXPECT_GT(compared, kItems / 8);
}

// --- Python's cbor2 ---

// Reads items in hexadecimal, one a line, and prints the text of each, or "rejected".
// Tags are left alone: cbor2 would make moments of the dates, to the microsecond.
constexpr std::string_view kPythonReader = R"(
import io, math, struct, sys
from cbor2 import decoder

decoder.semantic_decoders.clear()

class Rejected(Exception):
    pass

def text_of_double(kind, value):
    if math.isnan(value):
        return kind + 'nan'
    return kind + struct.pack('>d', value).hex()

def text_of(value):
    if value is True or value is False:
        return 'true' if value else 'false'
    if type(value) is int:
        if not -2**63 <= value < 2**64:
            raise Rejected()
        return str(value)
    if type(value) is float:
        return text_of_double('d', value)
    if type(value) is str:
        return 's' + value.encode().hex()
    if type(value) is decoder.CBORTag:
        content = value.value
        if value.tag != 1 or type(content) not in (int, float):
            raise Rejected()
        text_of(content)
        if not math.isfinite(content):
            raise Rejected()
        return text_of_double('D', float(content))
    if type(value) is list:
        return '[' + ''.join(text_of(each) + ',' for each in value) + ']'
    if type(value) is dict:
        if any(type(key) not in (int, str) for key in value):
            raise Rejected()
        entries = sorted((text_of(key), text_of(held)) for key, held in value.items())
        return '{' + ''.join(key + ':' + held + ',' for key, held in entries) + '}'
    raise Rejected()

for line in sys.stdin:
    stream = io.BytesIO(bytes.fromhex(line))
    try:
        value = decoder.CBORDecoder(stream).decode()
        if stream.read() or type(value) is not dict:
            raise Rejected()
        print(text_of(value))
    except Exception:
        print('rejected')
)";

// It takes indefinite lengths. In its dictionaries 1, 1.0 and true are one key, and
// what an entry held that a later one replaced is gone: a payload may be rejected for
// what it no longer shows.
TEST(PayloadAgreement, WithPythonUpToItsOwnRules) {
  const testing_support::TemporaryDirectory directory;
  const std::string script = directory.write("reader.py", kPythonReader);
  std::string lines;
  for (const std::string& item : items()) lines += hex(item) + "\n";
  const std::string input = directory.write("items", lines);
  const std::string output = directory / "texts";
  const std::string command =
      "/usr/bin/python3 '" + script + "' < '" + input + "' > '" + output + "'";
  ASSERT_EQ(std::system(command.c_str()), 0);

  const std::set<std::string> lost = {
      "a length is indefinite",
      "a key is neither text nor an integer",
      "a simple value is neither true nor false",
      "a byte string is not allowed",
      "a tag other than 1 is not allowed",
      "a date is not a finite number",
      "an integer is below -9223372036854775808",
  };
  std::ifstream texts(output);
  std::size_t compared = 0;
  std::size_t lenient = 0;
  for (const std::string& item : items()) {
    std::string theirs;
    ASSERT_TRUE(std::getline(texts, theirs));
    const Ours mine = ours(item);
    if (mine.text) {
      ASSERT_EQ(*mine.text, theirs) << hex(item);
      ++compared;
    } else if (theirs != "rejected") {
      ASSERT_TRUE(lost.contains(mine.error)) << hex(item) << "\n" << mine.error;
      ++lenient;
    }
  }
  EXPECT_GT(compared, kItems / 4);
  EXPECT_LT(lenient, kItems / 8);
}

}  // namespace
}  // namespace ostrel::wire
