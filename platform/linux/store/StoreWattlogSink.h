#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "platform/WattlogSink.h"
#include "platform/linux/store/Store.h"

namespace ostrel {

/// Keeps power events in the store. Events beyond a bound are dropped and counted.
class StoreWattlogSink final : public WattlogSink {
 public:
  explicit StoreWattlogSink(std::shared_ptr<Store> store) : store_(std::move(store)) {}

  void logRegisteredEvent(std::int32_t clientID, std::string_view name,
                          const Dictionary& event,
                          const std::optional<Dictionary>& attachment) override {
    store_->addPowerEvent({clientID, std::string(name), event, attachment});
  }

 private:
  const std::shared_ptr<Store> store_;
};

}  // namespace ostrel
