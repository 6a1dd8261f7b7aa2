#include "forwarder/MarkFile.h"

#include <cerrno>
#include <optional>
#include <utility>

#include "ostrelctl/JSONNode.h"
#include "platform/Logging.h"
#include "platform/linux/SmallFile.h"

namespace ostrel {
namespace {

constexpr std::size_t kMostBytes = 4096;
constexpr std::uint32_t kDirectoryMode = 0700;

constexpr std::pair<const char*, std::int64_t ForwardMark::*> kNumbers[] = {
    {"through", &ForwardMark::through}, {"forwarded", &ForwardMark::forwarded},
    {"parked", &ForwardMark::parked},   {"rejected", &ForwardMark::rejected},
    {"dropped", &ForwardMark::dropped},
};

std::optional<ForwardMark> markOf(const std::string& text) {
  const auto parsed = parseJSON(text);
  if (!parsed.value || parsed.value->object() == nullptr) return std::nullopt;
  const JSONObject& object = *parsed.value->object();
  ForwardMark mark;
  const JSONNode* store = find(object, "store");
  if (store == nullptr || store->string() == nullptr) return std::nullopt;
  mark.store = *store->string();
  for (const auto& [name, number] : kNumbers) {
    const JSONNode* node = find(object, name);
    const auto value = node != nullptr ? node->signedInteger() : std::nullopt;
    if (!value || *value < 0) return std::nullopt;
    mark.*number = *value;
  }
  return mark;
}

std::string textOf(const ForwardMark& mark) {
  JSONObject object{{"store", {mark.store}}};
  for (const auto& [name, number] : kNumbers) object.push_back({name, {mark.*number}});
  std::string text;
  appendJSON(text, {std::move(object)}, JSONSpacing::kPretty);
  return text + '\n';
}

}  // namespace

MarkFile::MarkFile(std::string directory, std::string name)
    : directory_(std::move(directory)), name_(std::move(name)), files_(directory_) {}

Outcome<ForwardMark> MarkFile::load() const {
  const std::string path = directory_ + '/' + name_;
  const auto text = readSmallFile(path, kMostBytes, FileLinks::kFollow);
  if (!text.value && text.error->code == ENOENT) return {ForwardMark{}, {}};
  if (!text.value && text.error->code != EFBIG) return {{}, text.error};
  auto mark = text.value ? markOf(*text.value) : std::nullopt;
  if (!mark) {
    OSTREL_LOG_ERROR(processLogScope,
                     "%@ is no mark: what the store holds is forwarded again", path);
    return {ForwardMark{}, {}};
  }
  return {*std::move(mark), {}};
}

Success MarkFile::save(const ForwardMark& mark) {
  if (auto made = files_.createDirectory(directory_, kDirectoryMode); !made.succeeded) {
    return made;
  }
  const std::string text = textOf(mark);
  return files_.writeFileAtomically(
      directory_, name_, TextSource([&text](const auto& append) { append(text); }));
}

}  // namespace ostrel
