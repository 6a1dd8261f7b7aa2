#include "platform/fake/FakeUserDefaults.h"

#include <algorithm>
#include <cstdlib>
#include <utility>

namespace ostrel {
namespace {

bool readsAsTrue(std::string text) {
  std::transform(text.begin(), text.end(), text.begin(), [](char c) {
    return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
  });
  if (text == "yes" || text == "true") return true;
  char* end = nullptr;
  const double number = std::strtod(text.c_str(), &end);
  return !text.empty() && *end == '\0' && number != 0;
}

class Suite final : public UserDefaultsSuite {
 public:
  explicit Suite(Dictionary values) : values_(std::move(values)) {}

  std::optional<Value> objectForKey(std::string_view key) const override {
    return values_.get(key);
  }

  std::optional<std::string> stringForKey(std::string_view key) const override {
    const auto value = values_.find(key);
    if (!value) return std::nullopt;
    switch (value->kind()) {
      case ValueKind::kString:
      case ValueKind::kInteger:
      case ValueKind::kDouble:
        return description(*value);
      default:
        return std::nullopt;
    }
  }

  bool boolForKey(std::string_view key) const override {
    const auto value = values_.find(key);
    if (!value) return false;
    if (const auto number = value->number()) return *number != 0;
    if (const auto text = value->string()) return readsAsTrue(std::string(*text));
    return false;
  }

 private:
  const Dictionary values_;
};

}  // namespace

FakeUserDefaults::FakeUserDefaults(SharedEventLog events) : events_(std::move(events)) {}

std::unique_ptr<UserDefaultsSuite> FakeUserDefaults::openSuite(std::string_view name) {
  events_->add("defaults.openSuite " + std::string(name));
  const std::lock_guard lock(mutex_);
  const auto found = suites_.find(name);
  return std::make_unique<Suite>(found == suites_.end() ? Dictionary() : found->second);
}

void FakeUserDefaults::setSuite(std::string_view name, Dictionary values) {
  const std::lock_guard lock(mutex_);
  suites_.insert_or_assign(std::string(name), std::move(values));
}

void FakeUserDefaults::removeSuite(std::string_view name) {
  const std::lock_guard lock(mutex_);
  const auto found = suites_.find(name);
  if (found != suites_.end()) suites_.erase(found);
}

}  // namespace ostrel
