#include <algorithm>

#include "ostrelctl/Commands.h"
#include "ostrelctl/DefaultsFile.h"

namespace ostrel {
namespace {

int report(const Tool& tool, const Success& success) {
  return success.succeeded ? Tool::kDone : tool.fail(success.error->description);
}

}  // namespace

int runDefaultsRead(const Tool& tool, const std::optional<std::string>& key, bool json) {
  const auto object = DefaultsFile(tool.defaultsPath).read();
  if (!object.value) return tool.fail(object.error->description);
  JSONNode node{*object.value};
  if (key) {
    const JSONNode* found = find(*object.value, *key);
    if (found == nullptr) return tool.fail("there is no default " + inQuotes(*key));
    node = *found;
  }
  std::string text;
  if (node.string() != nullptr && !json) {
    text = *node.string();
  } else {
    const bool pretty = !key && !json;
    appendJSON(text, node, pretty ? JSONSpacing::kPretty : JSONSpacing::kCompact);
  }
  tool.out << text << std::endl;
  return Tool::kDone;
}

int runDefaultsWrite(const Tool& tool, const std::string& key, const std::string& value) {
  auto parsed = parseJSON(value);
  if (parsed.value && parsed.value->isNull()) {
    tool.fail("null is no value of a default; delete the key instead");
    return Tool::kWrongUsage;
  }
  const JSONNode node = parsed.value ? std::move(*parsed.value) : JSONNode{value};
  return report(tool, DefaultsFile(tool.defaultsPath).change([&](JSONObject& object) {
    const auto found =
        std::find_if(object.begin(), object.end(),
                     [&key](const JSONMember& member) { return member.key == key; });
    if (found != object.end()) {
      found->node = node;
    } else {
      object.push_back({key, node});
    }
    return true;
  }));
}

int runDefaultsDelete(const Tool& tool, const std::string& key) {
  bool wasThere = false;
  const Success success = DefaultsFile(tool.defaultsPath).change([&](JSONObject& object) {
    wasThere = std::erase_if(object, [&key](const JSONMember& member) {
                 return member.key == key;
               }) != 0;
    return wasThere;
  });
  if (success.succeeded && !wasThere) {
    return tool.fail("there is no default " + inQuotes(key));
  }
  return report(tool, success);
}

int runNotify(const Tool& tool) {
  return report(tool, postNotification(tool.notificationPath));
}

}  // namespace ostrel
