#include "ostrelctl/JSONNode.h"

#include <algorithm>
#include <limits>
#include <nlohmann/json.hpp>
#include <set>
#include <utility>

#include "platform/linux/ValueJSONReader.h"

namespace ostrel {
namespace {

constexpr std::int64_t kInt64Max = std::numeric_limits<std::int64_t>::max();

template <typename T>
Outcome<T> failure(std::string phrase) {
  return {std::nullopt,
          ErrorObject{std::string(kGeneralErrorDomain), 1, std::move(phrase)}};
}

/// Builds a node from the parser's events; returns false to end the parse, with
/// the reason in `error`.
class NodeBuilder final : public nlohmann::json_sax<nlohmann::json> {
 public:
  JSONNode root;
  std::string error;

  bool null() override { return add({nullptr}); }
  bool boolean(bool value) override { return add({value}); }
  bool number_integer(number_integer_t value) override {
    return add({std::int64_t{value}});
  }
  bool number_unsigned(number_unsigned_t value) override {
    if (value > static_cast<std::uint64_t>(kInt64Max)) {
      return add({std::uint64_t{value}});
    }
    return add({static_cast<std::int64_t>(value)});
  }
  bool number_float(number_float_t value, const string_t& written) override {
    if (written.find_first_of(".eE") == std::string::npos) {
      return fail("the integer " + written + " is out of range");
    }
    return add({double{value}});
  }
  bool string(string_t& value) override { return add({std::move(value)}); }
  bool binary(binary_t&) override { return fail("it holds binary data"); }

  bool start_object(std::size_t) override { return open({JSONObject{}}); }
  bool key(string_t& value) override {
    if (!keys_.back().insert(value).second) {
      return fail("the key " + inQuotes(value) + " stands twice in one object");
    }
    std::get<JSONObject>(open_.back()->value).push_back({std::move(value), {}});
    return true;
  }
  bool end_object() override { return close(); }
  bool start_array(std::size_t) override { return open({JSONArray{}}); }
  bool end_array() override { return close(); }

  bool parse_error(std::size_t position, const std::string&,
                   const nlohmann::json::exception& exception) override {
    // 406: a number whose double would be infinite.
    if (exception.id == 406) return fail("a number is out of range");
    return fail("it is not JSON from character " + std::to_string(position) + " on");
  }

 private:
  bool fail(std::string phrase) {
    error = std::move(phrase);
    return false;
  }
  JSONNode* place(JSONNode node) {
    if (open_.empty()) {
      root = std::move(node);
      return &root;
    }
    auto& parent = open_.back()->value;
    if (auto* array = std::get_if<JSONArray>(&parent)) {
      return &array->emplace_back(std::move(node));
    }
    JSONNode& slot = std::get<JSONObject>(parent).back().node;
    slot = std::move(node);
    return &slot;
  }
  bool add(JSONNode node) {
    place(std::move(node));
    return true;
  }
  bool open(JSONNode node) {
    if (open_.size() == kJSONNesting) return fail("it nests too deeply");
    // Only the innermost container grows, so the pointers to the others hold.
    open_.push_back(place(std::move(node)));
    keys_.emplace_back();
    return true;
  }
  bool close() {
    open_.pop_back();
    keys_.pop_back();
    return true;
  }

  std::vector<JSONNode*> open_;
  std::vector<std::set<std::string>> keys_;
};

/// The text under "$date" when that is the object's one key.
const JSONNode* dateMember(const JSONObject& object) {
  return object.size() == 1 && object[0].key == "$date" ? &object[0].node : nullptr;
}

struct NodeEncoder {
  ValueEncoder encoder;
  std::string error;

  bool fail(std::string phrase) {
    error = std::move(phrase);
    return false;
  }
  bool encode(const JSONNode& node) {
    return std::visit([this](const auto& value) { return put(value); }, node.value);
  }
  bool put(std::nullptr_t) { return fail("null stands where a value must"); }
  bool put(bool value) { return encoder.boolean(value), true; }
  bool put(std::int64_t value) { return encoder.signedInteger(value), true; }
  bool put(std::uint64_t value) { return encoder.unsignedInteger(value), true; }
  bool put(double value) { return encoder.floatingPoint(value), true; }
  bool put(const std::string& value) { return encoder.string(value), true; }
  bool put(const JSONArray& array) {
    encoder.beginArray(array.size());
    return std::all_of(array.begin(), array.end(),
                       [this](const JSONNode& element) { return encode(element); });
  }
  bool put(const JSONObject& object) {
    if (const JSONNode* date = dateMember(object)) return putDate(*date);
    encoder.beginDictionary(object.size());
    return std::all_of(object.begin(), object.end(), [this](const JSONMember& member) {
      encoder.string(member.key);
      return encode(member.node);
    });
  }
  bool putDate(const JSONNode& node) {
    const std::string* text = node.string();
    const auto date = text != nullptr ? dateFromISO8601(*text) : std::nullopt;
    if (!date) return fail("the text under \"$date\" is not an ISO 8601 date and time");
    encoder.date(*date);
    return true;
  }
};

void appendNode(std::string& out, const JSONNode& node, JSONSpacing spacing,
                std::size_t indent);

void appendBreak(std::string& out, JSONSpacing spacing, std::size_t indent) {
  if (spacing == JSONSpacing::kCompact) return;
  out += '\n';
  out.append(2 * indent, ' ');
}

void appendArray(std::string& out, const JSONArray& array, JSONSpacing spacing,
                 std::size_t indent) {
  out += '[';
  for (std::size_t i = 0; i < array.size(); ++i) {
    if (i != 0) out += ',';
    appendBreak(out, spacing, indent + 1);
    appendNode(out, array[i], spacing, indent + 1);
  }
  if (!array.empty()) appendBreak(out, spacing, indent);
  out += ']';
}

void appendObject(std::string& out, const JSONObject& object, JSONSpacing spacing,
                  std::size_t indent) {
  out += '{';
  for (std::size_t i = 0; i < object.size(); ++i) {
    if (i != 0) out += ',';
    appendBreak(out, spacing, indent + 1);
    appendQuoted(out, object[i].key);
    out += spacing == JSONSpacing::kPretty ? ": " : ":";
    appendNode(out, object[i].node, spacing, indent + 1);
  }
  if (!object.empty()) appendBreak(out, spacing, indent);
  out += '}';
}

void appendNode(std::string& out, const JSONNode& node, JSONSpacing spacing,
                std::size_t indent) {
  struct Writer {
    std::string& out;
    JSONSpacing spacing;
    std::size_t indent;

    void operator()(std::nullptr_t) { out += "null"; }
    void operator()(bool value) { out += value ? "true" : "false"; }
    void operator()(std::int64_t value) { out += std::to_string(value); }
    void operator()(std::uint64_t value) { out += std::to_string(value); }
    void operator()(double value) { out += nlohmann::json(value).dump(); }
    void operator()(const std::string& value) { appendQuoted(out, value); }
    void operator()(const JSONArray& value) { appendArray(out, value, spacing, indent); }
    void operator()(const JSONObject& value) {
      appendObject(out, value, spacing, indent);
    }
  };
  std::visit(Writer{out, spacing, indent}, node.value);
}

}  // namespace

std::optional<std::int64_t> JSONNode::signedInteger() const {
  const auto* integer = std::get_if<std::int64_t>(&value);
  return integer != nullptr ? std::optional(*integer) : std::nullopt;
}

std::optional<std::uint64_t> JSONNode::unsignedInteger() const {
  if (const auto* big = std::get_if<std::uint64_t>(&value)) return *big;
  const auto small = signedInteger();
  if (!small || *small < 0) return std::nullopt;
  return static_cast<std::uint64_t>(*small);
}

std::optional<double> JSONNode::number() const {
  if (const auto* floating = std::get_if<double>(&value)) return *floating;
  if (const auto* big = std::get_if<std::uint64_t>(&value)) {
    return static_cast<double>(*big);
  }
  if (const auto small = signedInteger()) return static_cast<double>(*small);
  return std::nullopt;
}

const JSONNode* find(const JSONObject& object, std::string_view key) {
  for (const JSONMember& member : object) {
    if (member.key == key) return &member.node;
  }
  return nullptr;
}

Outcome<JSONNode> parseJSON(std::string_view text) {
  NodeBuilder builder;
  if (!nlohmann::json::sax_parse(text.begin(), text.end(), &builder)) {
    return failure<JSONNode>(std::move(builder.error));
  }
  return {std::move(builder.root), std::nullopt};
}

Outcome<Value> valueFrom(const JSONNode& node) {
  std::string bytes;
  NodeEncoder encoder{ValueEncoder(bytes), {}};
  if (!encoder.encode(node)) return failure<Value>(std::move(encoder.error));
  const ValueBuffer buffer = ValueBuffer::copyOf(
      {reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size()});
  return {Value(buffer, ValueView(buffer.data())), std::nullopt};
}

Outcome<Dictionary> dictionaryFrom(const JSONNode& node) {
  const JSONObject* object = node.object();
  if (object == nullptr || dateMember(*object) != nullptr) {
    return failure<Dictionary>("it is not an object");
  }
  auto value = valueFrom(node);
  if (!value.value) return {std::nullopt, std::move(value.error)};
  return {Dictionary::from(*value.value), std::nullopt};
}

void appendJSON(std::string& out, const JSONNode& node, JSONSpacing spacing) {
  appendNode(out, node, spacing, 0);
}

void appendQuoted(std::string& out, std::string_view text) {
  out +=
      nlohmann::json(text).dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
}

std::string inQuotes(std::string_view text) {
  std::string out;
  appendQuoted(out, text);
  return out;
}

}  // namespace ostrel
