#pragma once

#include <map>
#include <mutex>
#include <string>

#include "platform/UserDefaults.h"
#include "platform/fake/EventLog.h"

namespace ostrel {

/// Suites in memory. Adds "defaults.openSuite NAME" to the events.
class FakeUserDefaults final : public UserDefaults {
 public:
  explicit FakeUserDefaults(SharedEventLog events);

  std::unique_ptr<UserDefaultsSuite> openSuite(std::string_view name) override;

  void setSuite(std::string_view name, Dictionary values);
  void removeSuite(std::string_view name);

 private:
  const SharedEventLog events_;
  std::mutex mutex_;
  std::map<std::string, Dictionary, std::less<>> suites_;
};

}  // namespace ostrel
