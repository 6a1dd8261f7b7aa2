// One connection to the bus is one `SensorConnection`. Everything is asynchronous:
// the claim and the matches are queued before the bus has answered the greeting,
// and each reply or its absence is an event of the loop, which otherwise sleeps.
//
//   claim --ok--> read the property --> report, and every change of it
//     |                                   |
//     +--error, or the sensor service comes back: claim again
#include "platform/linux/SensorProxyOrientation.h"

#include <poll.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>
#include <optional>
#include <string_view>

#include "platform/Logging.h"
#include "platform/linux/SdBusLibrary.h"

namespace ostrel {
namespace {

using std::chrono::microseconds;
using std::chrono::milliseconds;
using std::chrono::steady_clock;
using Code = OrientationSource::Code;

constexpr char kService[] = "net.hadess.SensorProxy";
constexpr char kPath[] = "/net/hadess/SensorProxy";
constexpr char kProperties[] = "org.freedesktop.DBus.Properties";
constexpr char kProperty[] = "AccelerometerOrientation";
constexpr char kUsualAddress[] = "unix:path=/run/dbus/system_bus_socket";

constexpr char kChangesMatch[] =
    "type='signal',sender='net.hadess.SensorProxy',path='/net/hadess/SensorProxy',"
    "interface='org.freedesktop.DBus.Properties',member='PropertiesChanged',"
    "arg0='net.hadess.SensorProxy'";
constexpr char kOwnerMatch[] =
    "type='signal',sender='org.freedesktop.DBus',path='/org/freedesktop/DBus',"
    "interface='org.freedesktop.DBus',member='NameOwnerChanged',"
    "arg0='net.hadess.SensorProxy'";

// None for a name that is not one of the sensor's.
std::optional<Code> codeOf(std::string_view name) {
  Code code = 0;
  for (const char* known : SensorProxyOrientation::kNames) {
    if (name == known) return code;
    ++code;
  }
  return std::nullopt;
}

class SensorConnection {
 public:
  SensorConnection(const SdBusLibrary& library, const OrientationSource::Report& report,
                   milliseconds firstBackOff)
      : sd_(library), report_(report), claimBackOff_(firstBackOff) {}
  ~SensorConnection() {
    if (bus_ == nullptr) return;
    if (hasClaimed_) {
      sd_.sd_bus_call_method_async(bus_, nullptr, kService, kPath, kService,
                                   "ReleaseAccelerometer", nullptr, nullptr, "");
    }
    // Writes what the socket takes at once.
    sd_.sd_bus_process(bus_, nullptr);
    sd_.sd_bus_close_unref(bus_);
  }
  SensorConnection(const SensorConnection&) = delete;
  SensorConnection& operator=(const SensorConnection&) = delete;

  // Runs until the stop or an error of the connection. True: the stop. Sets
  // `wasReady` once the bus has let this process in.
  bool run(int stopDescriptor, bool& wasReady) {
    if (open() < 0) return false;
    const auto begin = steady_clock::now();
    for (;;) {
      int more = 0;
      // Not more at a time, so that a flood does not keep the stop from being seen.
      for (int i = 0; i < 64 && (more = sd_.sd_bus_process(bus_, nullptr)) > 0; ++i) {
      }
      if (more < 0) return false;
      wasReady = wasReady || sd_.sd_bus_is_ready(bus_) > 0;
      const auto now = steady_clock::now();
      if (!wasReady && now - begin > SensorProxyOrientation::kMostWait) return false;
      if (claimAt_ && now >= *claimAt_ && claim() < 0) return false;
      auto wait = more > 0 ? microseconds(0) : untilDue(now);
      if (!wasReady)
        wait = std::min(wait, microseconds(SensorProxyOrientation::kMostWait));
      if (sleep(stopDescriptor, wait)) return true;
    }
  }

 private:
  static constexpr microseconds kForever = microseconds::max();

  int open() {
    const char* address = std::getenv("DBUS_SYSTEM_BUS_ADDRESS");
    int error = sd_.sd_bus_new(&bus_);
    if (error >= 0) {
      error = sd_.sd_bus_set_address(bus_, address != nullptr ? address : kUsualAddress);
    }
    if (error >= 0) error = sd_.sd_bus_set_bus_client(bus_, /*b=*/1);
    if (error >= 0) {
      error = sd_.sd_bus_set_method_call_timeout(
          bus_, microseconds(SensorProxyOrientation::kMostWait).count());
    }
    if (error >= 0) error = sd_.sd_bus_start(bus_);
    if (error >= 0) {
      error = sd_.sd_bus_add_match_async(bus_, nullptr, kChangesMatch, &changed,
                                         /*install_callback=*/nullptr, this);
    }
    if (error >= 0) {
      error = sd_.sd_bus_add_match_async(bus_, nullptr, kOwnerMatch, &ownerChanged,
                                         /*install_callback=*/nullptr, this);
    }
    if (error >= 0) error = claim();
    return error;
  }

  // Until the next timeout of the bus or the next claim.
  microseconds untilDue(steady_clock::time_point now) const {
    microseconds wait = kForever;
    std::uint64_t due = UINT64_MAX;  // Of the monotonic clock.
    if (sd_.sd_bus_get_timeout(bus_, &due) >= 0 && due != UINT64_MAX) {
      const auto sinceStart =
          std::chrono::duration_cast<microseconds>(now.time_since_epoch());
      wait = std::max(microseconds(due) - sinceStart, microseconds(0));
    }
    if (claimAt_) {
      const auto left = std::chrono::ceil<microseconds>(*claimAt_ - now);
      wait = std::min(wait, std::max(left, microseconds(0)));
    }
    return wait;
  }

  // True when the stop is there.
  bool sleep(int stopDescriptor, microseconds wait) const {
    pollfd descriptors[] = {
        {stopDescriptor, POLLIN, 0},
        {sd_.sd_bus_get_fd(bus_), static_cast<short>(sd_.sd_bus_get_events(bus_)), 0}};
    const timespec time = {
        static_cast<time_t>(std::min<std::int64_t>(wait.count() / 1000000, 86400)),
        static_cast<long>(wait.count() % 1000000 * 1000)};
    ::ppoll(descriptors, std::size(descriptors), wait == kForever ? nullptr : &time,
            /*ss=*/nullptr);
    return descriptors[0].revents != 0;
  }

  int claim() {
    claimAt_.reset();
    return sd_.sd_bus_call_method_async(bus_, nullptr, kService, kPath, kService,
                                        "ClaimAccelerometer", &claimed, this, "");
  }

  void claimLater() { claimAt_ = steady_clock::now() + claimBackOff_.next(); }

  void read() {
    sd_.sd_bus_call_method_async(bus_, nullptr, kService, kPath, kProperties, "Get",
                                 &propertyRead, this, "ss", kService, kProperty);
  }

  void take(const char* name) {
    const auto code = codeOf(name);
    if (code) report_(*code);
  }

  // The handlers of the bus. What a hostile sender wrote wrongly is passed over.

  static int claimed(sd_bus_message* reply, void* userData, sd_bus_error*) {
    auto& self = *static_cast<SensorConnection*>(userData);
    if (self.sd_.sd_bus_message_is_method_error(reply, nullptr) > 0) {
      OSTREL_LOG_DEBUG(processLogScope, "the accelerometer cannot be claimed: %@",
                       std::string(self.sd_.sd_bus_message_get_error(reply)->name));
      self.claimLater();
      return 0;
    }
    self.hasClaimed_ = true;
    self.claimBackOff_.reset();
    self.read();
    return 0;
  }

  static int propertyRead(sd_bus_message* reply, void* userData, sd_bus_error*) {
    auto& self = *static_cast<SensorConnection*>(userData);
    const char* name = nullptr;
    if (self.sd_.sd_bus_message_is_method_error(reply, nullptr) <= 0 &&
        self.sd_.sd_bus_message_read(reply, "v", "s", &name) > 0) {
      self.take(name);
    }
    return 0;
  }

  static int changed(sd_bus_message* signal, void* userData, sd_bus_error*) {
    auto& self = *static_cast<SensorConnection*>(userData);
    if (!self.hasClaimed_) return 0;
    if (self.sd_.sd_bus_message_skip(signal, "s") < 0) return 0;
    if (self.sd_.sd_bus_message_enter_container(signal, SD_BUS_TYPE_ARRAY, "{sv}") < 0)
      return 0;
    while (self.sd_.sd_bus_message_enter_container(signal, SD_BUS_TYPE_DICT_ENTRY, "sv") >
           0) {
      const char* name = nullptr;
      const char* orientation = nullptr;
      if (self.sd_.sd_bus_message_read(signal, "s", &name) < 0) return 0;
      const char* contents = nullptr;
      char type = 0;
      if (self.sd_.sd_bus_message_peek_type(signal, &type, &contents) < 0) return 0;
      if (std::strcmp(name, kProperty) == 0 && std::strcmp(contents, "s") == 0) {
        if (self.sd_.sd_bus_message_read(signal, "v", "s", &orientation) < 0) return 0;
        self.take(orientation);
      } else if (self.sd_.sd_bus_message_skip(signal, "v") < 0) {
        return 0;
      }
      if (self.sd_.sd_bus_message_exit_container(signal) < 0) return 0;
    }
    return 0;
  }

  static int ownerChanged(sd_bus_message* signal, void* userData, sd_bus_error*) {
    auto& self = *static_cast<SensorConnection*>(userData);
    const char* name = nullptr;
    const char* before = nullptr;
    const char* now = nullptr;
    if (self.sd_.sd_bus_message_read(signal, "sss", &name, &before, &now) < 0) return 0;
    self.hasClaimed_ = false;
    if (*now != '\0') {
      self.claimBackOff_.reset();
      return self.claim() < 0 ? -EIO : 0;
    }
    return 0;
  }

  const SdBusLibrary& sd_;
  const OrientationSource::Report& report_;
  BackOff claimBackOff_;
  sd_bus* bus_ = nullptr;
  bool hasClaimed_ = false;
  std::optional<steady_clock::time_point> claimAt_;
};

}  // namespace

void SensorProxyOrientation::run(int stopDescriptor, const Report& report) {
  const SdBusLibrary* const library = SdBusLibrary::load();
  if (library == nullptr) {
    waitForStop(stopDescriptor, /*time=*/milliseconds(-1));
    return;
  }
  BackOff backOff(firstBackOff_);
  bool isKnown = false;
  const Report reportKnown = [&](Code code) {
    if (isKnown && code == kUndefined) return;
    isKnown = true;
    report(code);
  };
  do {
    SensorConnection connection(*library, reportKnown, firstBackOff_);
    bool wasReady = false;
    if (connection.run(stopDescriptor, wasReady)) return;
    if (wasReady) backOff.reset();
  } while (!waitForStop(stopDescriptor, backOff.next()));
}

}  // namespace ostrel
