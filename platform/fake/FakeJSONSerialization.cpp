#include "platform/fake/FakeJSONSerialization.h"

#include <cmath>
#include <utility>
#include <vector>

namespace ostrel {
namespace {

// What of `value` JSON cannot say; none when it can say all of it.
std::optional<std::string> unspeakable(ValueView value) {
  std::vector<ValueView> left{value};
  while (!left.empty()) {
    const ValueView item = left.back();
    left.pop_back();
    if (const auto number = item.floatingPoint(); number && !std::isfinite(*number)) {
      return "a number is not finite";
    }
    if (const auto array = item.array()) {
      for (const ValueView element : *array) left.push_back(element);
    }
    if (const auto dictionary = item.dictionary()) {
      for (const auto& [key, entry] : *dictionary) {
        if (!key.string()) return "a key is not a string";
        left.push_back(entry);
      }
    }
  }
  return std::nullopt;
}

}  // namespace

FakeJSONSerialization::FakeJSONSerialization(SharedEventLog events)
    : events_(std::move(events)) {}

Outcome<TextSource> FakeJSONSerialization::prettyPrintedArray(ElementSource elements) {
  events_->add("json.prettyPrintedArray");
  {
    const std::lock_guard lock(mutex_);
    if (result_) return *result_;
  }
  std::optional<std::string> reason;
  elements([&reason](ValueView element) {
    if (!reason) reason = unspeakable(element);
  });
  if (reason) {
    return {std::nullopt,
            ErrorObject{std::string(kGeneralErrorDomain), /*code=*/1, *reason}};
  }
  return {[elements = std::move(elements)](const TextWriter& write) {
            write("[\n");
            elements([&write](ValueView element) { write(description(element) + '\n'); });
            write("]\n");
          },
          std::nullopt};
}

void FakeJSONSerialization::setResult(std::optional<Outcome<TextSource>> result) {
  const std::lock_guard lock(mutex_);
  result_ = std::move(result);
}

}  // namespace ostrel
