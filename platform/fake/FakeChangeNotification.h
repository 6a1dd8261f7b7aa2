#pragma once

#include <mutex>
#include <string>
#include <vector>

#include "platform/ChangeNotification.h"
#include "platform/fake/EventLog.h"

namespace ostrel {

/// Posts when the test says so; a post is queued on the registration's queue
/// and not run. Tokens count from 1. Adds "notify.registerDispatch NAME" to the
/// events.
class FakeChangeNotification final : public ChangeNotification {
 public:
  explicit FakeChangeNotification(SharedEventLog events);

  Registration registerDispatch(std::string_view name, std::shared_ptr<WorkQueue> queue,
                                Handler handler) override;

  /// Queues every handler of `name` with its own token. Each post arrives.
  void post(std::string_view name);
  /// The same, with another token than the handler's own.
  void postWithToken(std::string_view name, int token);
  /// Registrations from now on fail with `status`; 0 ends that.
  void failRegistrations(int status);

  std::size_t registrationCount() const;
  void releaseCallbacks();

 private:
  struct Observer {
    std::string name;
    int token;
    std::shared_ptr<WorkQueue> queue;
    Handler handler;
  };

  std::vector<Observer> observers(std::string_view name) const;

  const SharedEventLog events_;
  mutable std::mutex mutex_;
  int failure_ = 0;
  std::vector<Observer> observers_;
};

}  // namespace ostrel
