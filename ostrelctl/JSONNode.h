#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/Outcome.h"
#include "platform/Value.h"

namespace ostrel {

struct JSONMember;
using JSONArray = std::vector<struct JSONNode>;
using JSONObject = std::vector<JSONMember>;

/// JSON as it was written: integers apart from doubles, members in their order.
struct JSONNode {
  std::variant<std::nullptr_t, bool, std::int64_t, std::uint64_t, double, std::string,
               JSONArray, JSONObject>
      value;  // Null unless made otherwise.

  bool isNull() const { return std::holds_alternative<std::nullptr_t>(value); }
  // Each is none when the node is of another kind.
  const std::string* string() const { return std::get_if<std::string>(&value); }
  const JSONArray* array() const { return std::get_if<JSONArray>(&value); }
  const JSONObject* object() const { return std::get_if<JSONObject>(&value); }
  /// An integer within the range of int64.
  std::optional<std::int64_t> signedInteger() const;
  /// An integer within the range of uint64.
  std::optional<std::uint64_t> unsignedInteger() const;
  /// An integer or a double.
  std::optional<double> number() const;
};

struct JSONMember {
  std::string key;
  JSONNode node;
};

/// The member of that key, or none.
const JSONNode* find(const JSONObject& object, std::string_view key);

/// Nesting beyond which a text is refused.
inline constexpr int kJSONNesting = 1000;

/// Reads one JSON text (RFC 8259). The error is a phrase for people, without a
/// stop: for text that is no JSON, a key that stands twice in one object, an
/// integer beyond the two 64-bit ranges, a double beyond the finite ones, and
/// nesting beyond `kJSONNesting`.
Outcome<JSONNode> parseJSON(std::string_view text);

/// The value that a node stands for. An object whose one key is "$date" is a
/// date; its text is ISO 8601 with a time zone. The error is a phrase for
/// people: for null, which no value is, and for a date that is none.
Outcome<Value> valueFrom(const JSONNode& node);

/// As `valueFrom`, for what must be a dictionary.
Outcome<Dictionary> dictionaryFrom(const JSONNode& node);

enum class JSONSpacing { kCompact, kPretty };

/// Appends the node as JSON: `parseJSON` reads the same back. Text that is not
/// UTF-8 gets replacement characters.
void appendJSON(std::string& out, const JSONNode& node, JSONSpacing spacing);

/// Appends `text` as a JSON string.
void appendQuoted(std::string& out, std::string_view text);
std::string inQuotes(std::string_view text);

}  // namespace ostrel
