// A client that misbehaves, as many ways as it is told, each in a process of its own.
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

#include "platform/linux/Places.h"
#include "tests/hostile/Behaviours.h"

namespace {

using namespace ostrel::hostile;

constexpr int kWrongUsage = 2;

struct Arguments {
  std::vector<const Behaviour*> behaviours;
  Attack::Target target;
  double seconds = 1;
  std::uint64_t seed = 1;
};

[[noreturn]] void explain() {
  std::fputs(
      "usage: hostile_client --list\n"
      "       hostile_client NAME... --socket PATH [--seconds N] [--seed N]\n"
      "                      [--logs DIRECTORY]\n"
      "NAME is one of the list, or \"all\": all but those that end the service.\n",
      stderr);
  std::exit(kWrongUsage);
}

void list() {
  for (const Behaviour& each : behaviours()) {
    std::printf("%-22s %.*s%s\n", std::string(each.name).c_str(),
                static_cast<int>(each.sentence.size()), each.sentence.data(),
                each.endsTheService ? " (ends the service)" : "");
  }
}

void addBehaviours(std::string_view name, std::vector<const Behaviour*>& found) {
  const std::size_t before = found.size();
  for (const Behaviour& each : behaviours()) {
    if (each.name == name || (name == "all" && !each.endsTheService)) {
      found.push_back(&each);
    }
  }
  if (found.size() == before) {
    std::fprintf(stderr, "hostile_client: no behaviour is called \"%s\"\n",
                 std::string(name).c_str());
    std::exit(kWrongUsage);
  }
}

Arguments parse(int argc, char** argv) {
  Arguments arguments;
  for (int i = 1; i < argc; ++i) {
    const std::string_view argument = argv[i];
    if (argument == "--list") {
      list();
      std::exit(EXIT_SUCCESS);
    }
    if (!argument.starts_with("--")) {
      addBehaviours(argument, arguments.behaviours);
      continue;
    }
    if (++i == argc) explain();
    if (argument == "--socket") {
      arguments.target.socketPath = argv[i];
    } else if (argument == "--logs") {
      arguments.target.logDirectory = argv[i];
    } else if (argument == "--seconds") {
      arguments.seconds = std::atof(argv[i]);
    } else if (argument == "--seed") {
      arguments.seed = std::strtoull(argv[i], nullptr, 10);
    } else {
      explain();
    }
  }
  if (arguments.behaviours.empty() || arguments.target.socketPath.empty()) explain();
  return arguments;
}

int run(const Behaviour& behaviour, const Arguments& arguments) {
  Attack attack(arguments.target,
                std::chrono::milliseconds(static_cast<int>(arguments.seconds * 1000)),
                arguments.seed);
  behaviour.run(attack);
  std::printf("%s: %llu steps\n", std::string(behaviour.name).c_str(),
              static_cast<unsigned long long>(attack.steps()));
  for (const std::string& failure : attack.failures()) {
    std::printf("%s: FAILED: %s\n", std::string(behaviour.name).c_str(), failure.c_str());
  }
  return attack.failures().empty() ? EXIT_SUCCESS : EXIT_FAILURE;
}

}  // namespace

int main(int argc, char** argv) {
  const Arguments arguments = parse(argc, argv);
  // As many connections as the system lets one process have.
  rlimit most{};
  ::getrlimit(RLIMIT_NOFILE, &most);
  most.rlim_cur = most.rlim_max;
  ::setrlimit(RLIMIT_NOFILE, &most);

  std::vector<pid_t> children;
  for (const Behaviour* behaviour : arguments.behaviours) {
    const pid_t child = ::fork();
    if (child == 0) {
      const int status = run(*behaviour, arguments);
      std::fflush(stdout);
      ::_exit(status);
    }
    children.push_back(child);
  }
  int result = EXIT_SUCCESS;
  for (const pid_t child : children) {
    int status = 0;
    ::waitpid(child, &status, 0);
    if (WIFEXITED(status) && WEXITSTATUS(status) == 0) continue;
    result = EXIT_FAILURE;
    if (WIFSIGNALED(status)) std::printf("a behaviour crashed\n");
  }
  return result;
}
