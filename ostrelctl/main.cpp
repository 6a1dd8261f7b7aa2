#include <unistd.h>

#include <cstdlib>
#include <iostream>
#include <string_view>

#include "client/ServiceConnection.h"
#include "ostrelctl/Tool.h"
#include "platform/linux/Places.h"

namespace {

bool wantsColours() {
  const char* noColour = std::getenv("NO_COLOR");
  if (noColour != nullptr && *noColour != '\0') return false;
  const char* terminal = std::getenv("TERM");
  return ::isatty(STDOUT_FILENO) != 0 && terminal != nullptr &&
         std::string_view(terminal) != "dumb";
}

}  // namespace

int main(int argc, char** argv) {
  // Reads of a pipe return with what is there.
  std::ios::sync_with_stdio(/*sync=*/false);
  // Replies are written by other threads; nothing else flushes the output.
  std::cin.tie(/*tiestr=*/nullptr);
  std::cerr.tie(/*tiestr=*/nullptr);
  const std::string socketPath = ostrel::serviceSocketPath();
  const ostrel::Tool tool{
      std::cin,
      std::cout,
      std::cerr,
      ostrel::realToolClock(),
      [&socketPath] { return ostrel::ServiceConnection::connect(socketPath); },
      socketPath,
      ostrel::storePath(),
      ostrel::stateDirectory() + "/defaults/com.orbisk.ostrel.json",
      ostrel::runtimeDirectory() + "/notify/com.orbisk.ostrel.reporting",
      ostrel::runtimeDirectory() + "/channels",
      wantsColours()};
  return ostrel::runTool(tool, argc, argv);
}
