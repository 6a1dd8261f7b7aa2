#include "platform/linux/Places.h"

#include <unistd.h>

#include <cstdlib>

namespace ostrel {
namespace {

std::string fromEnvironment(const char* name) {
  const char* value = std::getenv(name);
  std::string text = value != nullptr ? value : "";
  // systemd separates several directories by colons; the first is ours.
  if (const auto colon = text.find(':'); colon != std::string::npos) {
    text.resize(colon);
  }
  while (text.size() > 1 && text.back() == '/') text.pop_back();
  return text;
}

bool isRoot() { return ::geteuid() == 0; }

}  // namespace

std::string runtimeDirectory() {
  if (auto named = fromEnvironment("RUNTIME_DIRECTORY"); !named.empty()) return named;
  if (isRoot()) return "/run/ostrel";
  if (auto base = fromEnvironment("XDG_RUNTIME_DIR"); !base.empty()) {
    return base + "/ostrel";
  }
  return "/tmp/ostrel-" + std::to_string(::geteuid());
}

std::string stateDirectory() {
  if (auto named = fromEnvironment("STATE_DIRECTORY"); !named.empty()) return named;
  if (isRoot()) return "/var/lib/ostrel";
  if (auto base = fromEnvironment("XDG_STATE_HOME"); !base.empty()) {
    return base + "/ostrel";
  }
  return fromEnvironment("HOME") + "/.local/state/ostrel";
}

std::string diagnosticLogRoot() {
  if (auto named = fromEnvironment("LOGS_DIRECTORY"); !named.empty()) return named;
  if (isRoot()) return "/var/log/ostrel";
  return stateDirectory() + "/log";
}

std::string reportingSocketPath() { return runtimeDirectory() + "/reporting.sock"; }

std::string storePath() { return stateDirectory() + "/reports.db"; }

}  // namespace ostrel
