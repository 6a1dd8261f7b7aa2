#include "platform/linux/WaylandInterfaceOrientation.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <wayland-client.h>

#include <algorithm>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <memory>

#include "platform/Logging.h"
#include "platform/linux/FileDescriptor.h"

namespace ostrel {
namespace {

// Outputs have had "done", after which a change is whole, since this version.
constexpr std::uint32_t kOutputVersion = 2;

std::string socketPath() {
  const char* display = std::getenv("WAYLAND_DISPLAY");
  if (display == nullptr || *display == '\0') return {};
  if (*display == '/') return display;
  const char* directory = std::getenv("XDG_RUNTIME_DIR");
  if (directory == nullptr || *directory == '\0') return {};
  return std::string(directory) + "/" + display;
}

// Connects without waiting for a compositor that does not accept.
FileDescriptor connectTo(const std::string& path) {
  FileDescriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) return FileDescriptor();
  std::memcpy(address.sun_path, path.data(), path.size());
  if (!socket || ::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address),
                           sizeof address) != 0) {
    return FileDescriptor();
  }
  return socket;
}

[[gnu::format(printf, 1, 0)]] void logLine(const char* format, va_list arguments) {
  char text[512];
  std::vsnprintf(text, sizeof text, format, arguments);
  OSTREL_LOG_INFO(processLogScope, "compositor: %@", std::string(text));
}

class CompositorConnection {
 public:
  explicit CompositorConnection(const OrientationSource::Report& report)
      : report_(report) {}
  ~CompositorConnection() {
    for (auto& [name, output] : outputs_) wl_output_destroy(output->proxy);
    if (registry_ != nullptr) wl_registry_destroy(registry_);
    if (display_ != nullptr) wl_display_disconnect(display_);
  }
  CompositorConnection(const CompositorConnection&) = delete;
  CompositorConnection& operator=(const CompositorConnection&) = delete;

  // Runs until the stop or the end of the connection. True: the stop. Sets
  // `wasReady` once there was an output.
  bool run(int stopDescriptor, bool& wasReady) {
    if (!open()) return false;
    for (;;) {
      while (wl_display_prepare_read(display_) != 0) {
        if (wl_display_dispatch_pending(display_) < 0) return false;
      }
      wasReady = wasReady || hasReported_;
      short events = POLLIN;
      if (wl_display_flush(display_) < 0) {
        if (errno != EAGAIN) {
          wl_display_cancel_read(display_);
          return false;
        }
        events |= POLLOUT;
      }
      pollfd descriptors[] = {{stopDescriptor, POLLIN, 0},
                              {wl_display_get_fd(display_), events, 0}};
      ::poll(descriptors, std::size(descriptors), /*timeout=*/-1);
      if (descriptors[0].revents != 0) {
        wl_display_cancel_read(display_);
        return true;
      }
      if (wl_display_read_events(display_) < 0 ||
          wl_display_dispatch_pending(display_) < 0) {
        return false;
      }
    }
  }

 private:
  struct Output {
    CompositorConnection* connection;
    wl_output* proxy;
    std::int32_t pending = 0;   // Of an event that is not whole yet.
    std::int32_t current = -1;  // None yet.
  };

  bool open() {
    FileDescriptor socket = connectTo(socketPath());
    if (!socket) return false;
    display_ = wl_display_connect_to_fd(socket.release());
    if (display_ == nullptr) return false;
    registry_ = wl_display_get_registry(display_);
    if (registry_ == nullptr) return false;
    static constexpr wl_registry_listener kListener = {&announced, &withdrawn};
    return wl_registry_add_listener(registry_, &kListener, this) == 0;
  }

  // By the oldest output that has said how it is turned.
  void report() {
    for (const auto& [name, output] : outputs_) {
      if (output->current < 0) continue;
      hasReported_ = true;
      report_(WaylandInterfaceOrientation::kFirstCode + output->current);
      return;
    }
  }

  static void announced(void* data, wl_registry* registry, std::uint32_t name,
                        const char* interface, std::uint32_t version) {
    auto& self = *static_cast<CompositorConnection*>(data);
    if (std::strcmp(interface, wl_output_interface.name) != 0 ||
        version < kOutputVersion || self.outputs_.contains(name)) {
      return;
    }
    auto output = std::make_unique<Output>();
    output->connection = &self;
    output->proxy = static_cast<wl_output*>(
        wl_registry_bind(registry, name, &wl_output_interface, kOutputVersion));
    if (output->proxy == nullptr) return;
    static const wl_output_listener kListener = makeOutputListener();
    wl_output_add_listener(output->proxy, &kListener, output.get());
    self.outputs_.emplace(name, std::move(output));
  }

  static void withdrawn(void* data, wl_registry*, std::uint32_t name) {
    auto& self = *static_cast<CompositorConnection*>(data);
    const auto found = self.outputs_.find(name);
    if (found == self.outputs_.end()) return;
    wl_output_destroy(found->second->proxy);
    self.outputs_.erase(found);
    self.report();
  }

  static wl_output_listener makeOutputListener() {
    wl_output_listener listener{};
    listener.geometry = [](void* data, wl_output*, std::int32_t, std::int32_t,
                           std::int32_t, std::int32_t, std::int32_t, const char*,
                           const char*, std::int32_t transform) {
      static_cast<Output*>(data)->pending = transform;
    };
    listener.mode = [](void*, wl_output*, std::uint32_t, std::int32_t, std::int32_t,
                       std::int32_t) {};
    listener.done = [](void* data, wl_output*) {
      auto& output = *static_cast<Output*>(data);
      const auto most =
          static_cast<std::int32_t>(std::size(WaylandInterfaceOrientation::kNames));
      if (output.pending < 0 || output.pending >= most) return;
      output.current = output.pending;
      output.connection->report();
    };
    listener.scale = [](void*, wl_output*, std::int32_t) {};
    return listener;
  }

  const OrientationSource::Report& report_;
  wl_display* display_ = nullptr;
  wl_registry* registry_ = nullptr;
  std::map<std::uint32_t, std::unique_ptr<Output>> outputs_;
  bool hasReported_ = false;
};

}  // namespace

bool WaylandInterfaceOrientation::isConfigured() const { return !socketPath().empty(); }

void WaylandInterfaceOrientation::run(int stopDescriptor, const Report& report) {
  wl_log_set_handler_client(&logLine);
  BackOff backOff(firstBackOff_);
  do {
    CompositorConnection connection(report);
    bool wasReady = false;
    if (connection.run(stopDescriptor, wasReady)) return;
    if (wasReady) backOff.reset();
  } while (!waitForStop(stopDescriptor, backOff.next()));
}

}  // namespace ostrel
