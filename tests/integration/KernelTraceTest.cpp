// A debugger attached to the real service sees its trace points.
#include <gtest/gtest.h>
#include <signal.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "platform/linux/ChildProcess.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using testing_support::ChildProcess;
using testing_support::eventually;
using testing_support::TemporaryDirectory;

/// A program of this build: they stand side by side.
std::string program(const std::string& name) {
  return std::filesystem::read_symlink("/proc/self/exe").parent_path() / name;
}

std::vector<std::string> linesOf(const std::string& path) {
  std::vector<std::string> lines;
  std::ifstream file(path);
  for (std::string line; std::getline(file, line);) lines.push_back(line);
  return lines;
}

const std::string kCommands = R"(set pagination off
handle SIGTERM nostop noprint pass
break -probe-stap ostrel:kernel_trace
commands
silent
printf "trace %x %d %d %d %d\n", $_probe_arg0, \
  $_probe_arg1, $_probe_arg2, $_probe_arg3, $_probe_arg4
continue
end
)";

TEST(KernelTrace, ShowsADebuggerTheStepsOfASession) {
  const TemporaryDirectory directory;
  const std::vector<std::string> environment = {"RUNTIME_DIRECTORY=" + directory / "run",
                                                "STATE_DIRECTORY=" + directory / "state",
                                                "LOGS_DIRECTORY=" + directory / "log"};
  ChildProcess service({program("ostrelreportingd")}, directory / "service.log",
                       environment);
  ASSERT_TRUE(eventually(
      [&] { return std::filesystem::exists(directory / "run/reporting.sock"); }));

  const std::string commands =
      directory.write("commands.gdb", kCommands + "shell touch " +
                                          directory / "attached" + "\ncontinue\n");
  ChildProcess debugger(
      {"gdb", "--batch", "--nx", "-p", std::to_string(service.pid()), "-x", commands},
      directory / "gdb.log");
  ASSERT_TRUE(
      eventually([&] { return std::filesystem::exists(directory / "attached"); }));

  const std::string script =
      directory.write("script.jsonl",
                      R"({"op": "createReportingSession", "reporterID": 7}
{"wait": 60}
{"op": "startReportingSessionForID", "reporterID": 7}
{"op": "getServiceNameForReporterID", "reporterID": 7}
{"sleep": 1}
{"op": "sendMessage", "message": {"a": 1}, "category": 3, "type": 1, "reporterIDs": [7]}
{"sleep": 1}
{"op": "stopReportingSessionForID", "reporterID": 7}
{"wait": 60}
{"op": "destroyReportingSession", "reporterID": 7}
{"wait": 60}
{"sleep": 1}
)");
  ASSERT_EQ(ChildProcess({program("ostrelctl"), "script", script},
                         directory / "script.log", environment)
                .wait(),
            0);
  ASSERT_EQ(::kill(service.pid(), SIGTERM), 0);
  EXPECT_EQ(service.wait(), 0);
  debugger.wait();

  std::vector<std::string> traces;
  for (const std::string& line : linesOf(directory / "gdb.log")) {
    if (line.rfind("trace ", 0) == 0) traces.push_back(line);
  }
  EXPECT_EQ(traces, (std::vector<std::string>{
                        "trace 21042814 0 0 0 0",    // The create request,
                        "trace 21042828 0 0 0 0",    // the session made.
                        "trace 21042818 0 0 0 0",    // The start request,
                        "trace 2104282c 0 0 0 0",    // the session started.
                        "trace 21042824 0 0 0 0",    // The send request,
                        "trace 21042838 0 0 0 0",    // the message delivered.
                        "trace 2104281c 0 0 0 0",    // The stop request,
                        "trace 21042830 0 0 0 0",    // the session stopped,
                        "trace 21042838 0 0 0 0",    // its summary delivered.
                        "trace 21042820 0 0 0 0",    // The destroy request,
                        "trace 21042834 0 0 0 0"}))  // the session torn down.
      << "the debugger said in "
      << testing::PrintToString(linesOf(directory / "gdb.log"));
}

}  // namespace
}  // namespace ostrel
