// libsystemd's bus, loaded when it is first needed: with what it needs itself the
// library takes 1 MiB of memory, and most runs never look at the orientation.
#pragma once

#include <systemd/sd-bus.h>

namespace ostrel {

#define OSTREL_SD_BUS_FUNCTIONS(FUNCTION)  \
  FUNCTION(sd_bus_new)                     \
  FUNCTION(sd_bus_set_address)             \
  FUNCTION(sd_bus_set_bus_client)          \
  FUNCTION(sd_bus_set_method_call_timeout) \
  FUNCTION(sd_bus_start)                   \
  FUNCTION(sd_bus_close_unref)             \
  FUNCTION(sd_bus_is_ready)                \
  FUNCTION(sd_bus_process)                 \
  FUNCTION(sd_bus_get_fd)                  \
  FUNCTION(sd_bus_get_events)              \
  FUNCTION(sd_bus_get_timeout)             \
  FUNCTION(sd_bus_add_match_async)         \
  FUNCTION(sd_bus_call_method_async)       \
  FUNCTION(sd_bus_message_is_method_error) \
  FUNCTION(sd_bus_message_get_error)       \
  FUNCTION(sd_bus_message_read)            \
  FUNCTION(sd_bus_message_skip)            \
  FUNCTION(sd_bus_message_peek_type)       \
  FUNCTION(sd_bus_message_enter_container) \
  FUNCTION(sd_bus_message_exit_container)

/// The functions by their names.
struct SdBusLibrary {
#define OSTREL_SD_BUS_MEMBER(name) decltype(&::name) name = nullptr;
  OSTREL_SD_BUS_FUNCTIONS(OSTREL_SD_BUS_MEMBER)
#undef OSTREL_SD_BUS_MEMBER

  /// Loads the library, once. None, with an error logged, when it is not there or
  /// lacks a function. Blocks on the disk.
  static const SdBusLibrary* load();
};

}  // namespace ostrel
