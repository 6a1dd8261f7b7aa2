#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <utility>

#include "platform/AnalyticsSink.h"
#include "platform/linux/store/Store.h"

namespace ostrel {

/// Keeps the analytics events whose names match a pattern of the store's table
/// `analytics_interest`; only for these is the provider called, on the writer's
/// thread. Events beyond a bound are dropped and counted.
class StoreAnalyticsSink final : public AnalyticsSink {
 public:
  explicit StoreAnalyticsSink(std::shared_ptr<Store> store) : store_(std::move(store)) {}

  void sendEventLazy(std::string_view name, PayloadProvider provider) override {
    store_->addAnalyticsEvent(std::string(name), std::move(provider));
  }

 private:
  const std::shared_ptr<Store> store_;
};

}  // namespace ostrel
