#include "platform/linux/SdBusLibrary.h"

#include <dlfcn.h>

#include <optional>
#include <string>

#include "platform/Logging.h"

namespace ostrel {
namespace {

template <typename Function>
bool find(void* library, const char* name, Function& function) {
  function = reinterpret_cast<Function>(::dlsym(library, name));
  return function != nullptr;
}

std::optional<SdBusLibrary> loadOnce() {
  SdBusLibrary functions;
  void* const library = ::dlopen("libsystemd.so.0", RTLD_NOW | RTLD_LOCAL);
  bool isWhole = library != nullptr;
#define OSTREL_SD_BUS_FIND(name) \
  isWhole = isWhole && find(library, #name, functions.name);
  OSTREL_SD_BUS_FUNCTIONS(OSTREL_SD_BUS_FIND)
#undef OSTREL_SD_BUS_FIND
  if (isWhole) return functions;
  const char* const error = ::dlerror();
  OSTREL_LOG_ERROR(processLogScope, "the bus library is of no use: %@",
                   std::string(error != nullptr ? error : "unknown"));
  return std::nullopt;
}

}  // namespace

const SdBusLibrary* SdBusLibrary::load() {
  static const std::optional<SdBusLibrary> kLoaded = loadOnce();
  return kLoaded ? &*kLoaded : nullptr;
}

}  // namespace ostrel
