#pragma once

#include <functional>
#include <memory>
#include <string_view>

#include "platform/WorkQueue.h"

namespace ostrel {

/// Named notifications that any process of the machine may post. Posts that
/// come close together may arrive as one.
class ChangeNotification {
 public:
  using Handler = std::function<void(int token)>;

  struct Registration {
    int status = 0;  // 0: registered.
    int token = -1;  // Handed to the handler; meaningless unless registered.
  };

  virtual ~ChangeNotification() = default;

  /// Queues `handler` on `queue` for each post of `name` from now on, for the
  /// rest of the process.
  virtual Registration registerDispatch(std::string_view name,
                                        std::shared_ptr<WorkQueue> queue,
                                        Handler handler) = 0;
};

}  // namespace ostrel
