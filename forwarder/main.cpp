#include <cstdlib>
#include <optional>

#include "forwarder/ForwarderProgram.h"

int main(int argc, char** argv) {
  const auto environment = [](const std::string& name) -> std::optional<std::string> {
    const char* value = std::getenv(name.c_str());
    if (value == nullptr) return std::nullopt;
    return value;
  };
  return ostrel::runForwarder({argv + 1, argv + argc}, environment);
}
