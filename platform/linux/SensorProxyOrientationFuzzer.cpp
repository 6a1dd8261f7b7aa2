// Whatever a bus and a sensor service answer and announce, orientations that are known
// are reported and nothing else, and the watch goes on and ends when it is told to.
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <systemd/sd-bus.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <thread>

#include "fuzz/Fuzzing.h"
#include "platform/linux/SensorProxyOrientation.h"
#include "platform/linux/TestSockets.h"
#include "platform/linux/TestSupport.h"

namespace {

using namespace ostrel;
using fuzzing::expect;
using fuzzing::Input;

constexpr char kName[] = "net.hadess.SensorProxy";
constexpr char kPath[] = "/net/hadess/SensorProxy";
constexpr char kProperties[] = "org.freedesktop.DBus.Properties";
constexpr char kProperty[] = "AccelerometerOrientation";
constexpr int kPatience = 20'000;  // Milliseconds.

/// Letters, so that it is a text.
std::string textFrom(Input& input) {
  constexpr const char* kKnown[] = {"undefined", "normal",     "bottom-up", "left-up",
                                    "right-up",  "LightLevel", kProperty,   ""};
  const std::uint8_t which = input.byte();
  if (which < std::size(kKnown)) return kKnown[which];
  std::string text = input.bytes(which);
  std::ranges::transform(text, text.begin(), [](char c) {
    return static_cast<char>('A' + static_cast<unsigned char>(c) % 58);
  });
  return text;
}

/// Appends values of any type, one after the other and within one another. What the
/// library refuses is left out.
void appendAnything(sd_bus_message* message, Input& input, int depth) {
  constexpr int kMostDepth = 4;
  switch (input.byte() % (depth < kMostDepth ? 10 : 6)) {
    case 0:
      sd_bus_message_append(message, "s", textFrom(input).c_str());
      return;
    case 1:
      sd_bus_message_append(message, "i", int{input.byte()});
      return;
    case 2:
      sd_bus_message_append(message, "d", input.byte() / 3.0);
      return;
    case 3:
      sd_bus_message_append(message, "o", kPath);
      return;
    case 4:
      sd_bus_message_append(message, "as", 2, "left-up", textFrom(input).c_str());
      return;
    case 5:
      sd_bus_message_append(message, "v", "s", textFrom(input).c_str());
      return;
    case 6:
      sd_bus_message_append(message, "v", "v", "i", int{input.byte()});
      return;
    case 7:
      if (sd_bus_message_open_container(message, 'r', "ss") >= 0) {
        sd_bus_message_append(message, "ss", "a", textFrom(input).c_str());
        sd_bus_message_close_container(message);
      }
      return;
    case 8:
      sd_bus_message_append(message, "a{sv}", 1, textFrom(input).c_str(), "s",
                            textFrom(input).c_str());
      return;
    default:
      appendAnything(message, input, depth + 1);
      appendAnything(message, input, depth + 1);
      return;
  }
}

/// The bus and the sensors behind one connection.
class ScriptedBus {
 public:
  ScriptedBus(FileDescriptor socket, Input& input) : input_(input) {
    expect(sd_bus_new(&bus_) >= 0);
    const int descriptor = socket.release();
    expect(sd_bus_set_fd(bus_, descriptor, descriptor) >= 0);
    expect(sd_bus_set_server(bus_, /*b=*/1, sd_id128_t{}) >= 0);
    expect(sd_bus_set_anonymous(bus_, /*b=*/1) >= 0);
    // Fails when the other end has given up already.
    sd_bus_start(bus_);
  }
  ~ScriptedBus() { sd_bus_flush_close_unref(bus_); }
  ScriptedBus(const ScriptedBus&) = delete;
  ScriptedBus& operator=(const ScriptedBus&) = delete;

  void run() {
    while (!input_.isOver()) {
      sd_bus_message* message = nullptr;
      const int result = sd_bus_process(bus_, &message);
      if (result < 0) return;
      if (message != nullptr) {
        answer(message);
      } else if (result == 0) {
        // The other end waits, for a reply that never comes or for a signal.
        if (hasGreeted_) announce();
        if (!hasGreeted_) sd_bus_wait(bus_, kPatience * 1000ULL);
      }
      sd_bus_message_unref(message);
    }
  }

 private:
  void answer(sd_bus_message* call) {
    if (sd_bus_message_is_method_call(call, nullptr, "Hello") > 0) {
      sd_bus_reply_method_return(call, "s", ":1.7");
      hasGreeted_ = true;
      return;
    }
    switch (input_.byte() % 5) {
      case 0:
        sd_bus_reply_method_errorf(call, SD_BUS_ERROR_FAILED, "%s",
                                   textFrom(input_).c_str());
        return;
      case 1:
        return;  // Never.
      case 2: {
        sd_bus_message* reply = nullptr;
        // Fails when the other end has gone meanwhile.
        if (sd_bus_message_new_method_return(call, &reply) < 0) return;
        sd_bus_message_set_sender(reply, kName);
        appendAnything(reply, input_, /*depth=*/0);
        sd_bus_send(bus_, reply, nullptr);
        sd_bus_message_unref(reply);
        return;
      }
      default:
        if (sd_bus_message_is_method_call(call, kProperties, "Get") > 0) {
          sd_bus_reply_method_return(call, "v", "s", textFrom(input_).c_str());
        } else {
          sd_bus_reply_method_return(call, "");
        }
        return;
    }
  }

  void announce() {
    sd_bus_message* signal = nullptr;
    const bool isOwner = input_.byte() % 4 == 0;
    if (isOwner) {
      if (sd_bus_message_new_signal(bus_, &signal, "/org/freedesktop/DBus",
                                    "org.freedesktop.DBus", "NameOwnerChanged") < 0) {
        return;
      }
      sd_bus_message_set_sender(signal, "org.freedesktop.DBus");
      sd_bus_message_append(signal, "s", kName);
    } else {
      if (sd_bus_message_new_signal(bus_, &signal, kPath, kProperties,
                                    "PropertiesChanged") < 0) {
        return;
      }
      sd_bus_message_set_sender(signal, kName);
      sd_bus_message_append(signal, "s", kName);
    }
    const std::uint8_t shape = input_.byte() % 3;
    if (shape == 0) {
      appendAnything(signal, input_, /*depth=*/0);
    } else if (isOwner) {
      sd_bus_message_append(signal, "ss", "", shape == 1 ? ":1.9" : "");
    } else {
      sd_bus_message_open_container(signal, 'a', "{sv}");
      sd_bus_message_append(signal, "{sv}", textFrom(input_).c_str(), "i", 3);
      sd_bus_message_append(signal, "{sv}", kProperty, shape == 1 ? "s" : "o",
                            shape == 1 ? textFrom(input_).c_str() : kPath);
      sd_bus_message_close_container(signal);
      sd_bus_message_append(signal, "as", 0);
    }
    sd_bus_send(bus_, signal, nullptr);
    sd_bus_message_unref(signal);
  }

  Input& input_;
  sd_bus* bus_ = nullptr;
  bool hasGreeted_ = false;
};

FileDescriptor listenAt(const std::string& path) {
  ::setenv("DBUS_SYSTEM_BUS_ADDRESS", ("unix:path=" + path).c_str(), /*replace=*/1);
  fuzzing::silenceLog();
  FileDescriptor listener = testing_support::listeningSocket(path);
  expect(static_cast<bool>(listener));
  return listener;
}

FileDescriptor accept(const FileDescriptor& listener, int patience) {
  pollfd waiting{listener.get(), POLLIN, /*revents=*/0};
  int ready = -1;
  while (ready < 0) ready = ::poll(&waiting, 1, patience);  // The fuzzer's alarm.
  if (ready == 0) return {};
  return FileDescriptor(::accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const testing_support::TemporaryDirectory directory;
  static const FileDescriptor listener = listenAt(directory / "bus");

  const FileDescriptor stop(::eventfd(0, EFD_CLOEXEC));
  std::thread watch([&stop] {
    SensorProxyOrientation source(/*firstBackOff=*/std::chrono::milliseconds(1));
    source.run(stop.get(), [](OrientationSource::Code code) {
      expect(code >= 0 &&
             code < static_cast<int>(std::size(SensorProxyOrientation::kNames)));
    });
  });
  Input input(data, size);
  {
    FileDescriptor first = accept(listener, kPatience);
    expect(static_cast<bool>(first));
    ScriptedBus(std::move(first), input).run();
  }
  // It comes again when it has had all that was said.
  const FileDescriptor second = accept(listener, kPatience);
  expect(static_cast<bool>(second));
  const std::uint64_t one = 1;
  expect(::write(stop.get(), &one, sizeof one) == sizeof one);
  watch.join();
  while (accept(listener, /*patience=*/0)) {
  }
  return 0;
}
