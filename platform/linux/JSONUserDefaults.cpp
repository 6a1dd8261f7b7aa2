#include "platform/linux/JSONUserDefaults.h"

#include <cerrno>
#include <charconv>
#include <map>
#include <nlohmann/json.hpp>
#include <optional>

#include "platform/Logging.h"
#include "platform/linux/Limits.h"
#include "platform/linux/Places.h"
#include "platform/linux/SmallFile.h"
#include "platform/linux/ValueJSONReader.h"

namespace ostrel {
namespace {

using nlohmann::json;
using Entries = std::map<std::string, Value, std::less<>>;

bool readsAsTrue(std::string text) {
  for (char& c : text) {
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  }
  if (text == "yes" || text == "true") return true;
  double number = 0;
  const auto [end, error] =
      std::from_chars(text.data(), text.data() + text.size(), number);
  return error == std::errc() && end == text.data() + text.size() && number != 0;
}

class JSONSuite final : public UserDefaultsSuite {
 public:
  explicit JSONSuite(Entries entries) : entries_(std::move(entries)) {}

  std::optional<Value> objectForKey(std::string_view key) const override {
    const auto found = entries_.find(key);
    if (found == entries_.end()) return std::nullopt;
    return found->second;
  }

  std::optional<std::string> stringForKey(std::string_view key) const override {
    const auto value = objectForKey(key);
    if (!value) return std::nullopt;
    switch ((*value)->kind()) {
      case ValueKind::kString:
        return std::string(*(*value)->string());
      case ValueKind::kInteger:
      case ValueKind::kDouble:
        return description(*value);
      default:
        return std::nullopt;
    }
  }

  bool boolForKey(std::string_view key) const override {
    const auto value = objectForKey(key);
    if (!value) return false;
    if (const auto text = (*value)->string()) return readsAsTrue(std::string(*text));
    return (*value)->number().value_or(0) != 0;
  }

 private:
  const Entries entries_;
};

// None with a sentence in `error` when `text` is not one JSON object that nests
// as payloads may.
std::optional<json> parseObject(const std::string& text, std::string& error) {
  bool isTooDeep = false;
  const auto watchDepth = [&](int depth, json::parse_event_t, json&) {
    isTooDeep = isTooDeep || depth > static_cast<int>(limits::kNesting);
    return !isTooDeep;
  };
  json object = json::parse(text, watchDepth, /*allow_exceptions=*/false);
  if (isTooDeep) {
    error = "it nests too deeply";
  } else if (!object.is_object()) {
    error = "it is not a JSON object";
  }
  if (!error.empty()) return std::nullopt;
  return object;
}

Entries entriesOf(const json& object, const std::string& path) {
  Entries entries;
  for (const auto& [key, member] : object.items()) {
    if (member.is_null()) continue;
    std::string error;
    auto value = valueFromJSON(member.dump(), JSONDates::kPlain, error);
    if (value && (*value)->string() &&
        (*value)->string()->size() > JSONUserDefaults::kMostTextBytes) {
      value.reset();
      error = "it is too long";
    }
    if (value) {
      entries.emplace(key, *value);
    } else {
      OSTREL_LOG_ERROR(processLogScope, "cannot use %@ of %@: %@", key, path, error);
    }
  }
  return entries;
}

}  // namespace

std::string JSONUserDefaults::systemDirectory() { return stateDirectory() + "/defaults"; }

std::unique_ptr<UserDefaultsSuite> JSONUserDefaults::openSuite(std::string_view name) {
  const auto none = [] { return std::make_unique<JSONSuite>(Entries()); };
  const std::string path = directory_ + "/" + std::string(name) + ".json";
  if (name.empty() || name.find('/') != std::string_view::npos ||
      name.find('\0') != std::string_view::npos) {
    OSTREL_LOG_ERROR(processLogScope, "there can be no defaults suite %@", name);
    return none();
  }
  const auto text = readSmallFile(path, kMostFileBytes, FileLinks::kRefuse);
  if (!text.value) {
    if (text.error->code != ENOENT) {
      OSTREL_LOG_ERROR(processLogScope, "cannot read the defaults: %@", *text.error);
    }
    return none();
  }
  std::string error;
  const auto object = parseObject(*text.value, error);
  if (!object) {
    OSTREL_LOG_ERROR(processLogScope, "cannot read the defaults in %@: %@", path, error);
    return none();
  }
  return std::make_unique<JSONSuite>(entriesOf(*object, path));
}

}  // namespace ostrel
