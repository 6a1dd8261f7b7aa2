// For the tests of the Linux bindings.
#pragma once

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <string_view>
#include <vector>

namespace ostrel::testing_support {

/// Another program, ended and waited for with this object. Its input is empty, and
/// what it prints goes to a file, or nowhere without one.
class ChildProcess {
 public:
  explicit ChildProcess(std::vector<std::string> command,
                        const std::string& output = "/dev/null",
                        const std::vector<std::string>& environment = {}) {
    std::vector<char*> arguments = pointersTo(command);
    std::vector<std::string> variables = withInherited(environment);
    posix_spawn_file_actions_t files;
    ::posix_spawn_file_actions_init(&files);
    ::posix_spawn_file_actions_addopen(&files, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
    ::posix_spawn_file_actions_addopen(&files, STDOUT_FILENO, output.c_str(),
                                       O_WRONLY | O_CREAT | O_APPEND, 0600);
    ::posix_spawn_file_actions_adddup2(&files, STDOUT_FILENO, STDERR_FILENO);
    // A copy of a process with threads must not do more than this before it becomes
    // another program: a lock that another thread held would never be free.
    if (::posix_spawnp(&pid_, arguments.front(), &files, /*attributes=*/nullptr,
                       arguments.data(), pointersTo(variables).data()) != 0) {
      pid_ = 0;
    }
    ::posix_spawn_file_actions_destroy(&files);
  }
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;
  ~ChildProcess() {
    if (pid_ <= 0) return;
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
  }

  pid_t pid() const { return pid_; }

  /// Waits for its end by itself; the exit status, or -1 for another end and for a
  /// program that could not be started.
  int wait() {
    int status = -1;
    if (pid_ > 0) ::waitpid(pid_, &status, 0);
    pid_ = 0;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

 private:
  static std::vector<char*> pointersTo(std::vector<std::string>& texts) {
    std::vector<char*> pointers;
    for (std::string& text : texts) pointers.push_back(text.data());
    pointers.push_back(nullptr);
    return pointers;
  }

  // `variables`, and those of this process that are not among them.
  static std::vector<std::string> withInherited(
      const std::vector<std::string>& variables) {
    std::vector<std::string> all = variables;
    for (char** inherited = environ; *inherited != nullptr; ++inherited) {
      const std::string_view variable(*inherited);
      const std::string_view name = variable.substr(0, variable.find('=') + 1);
      const bool isOverridden = std::ranges::any_of(
          variables, [&](const std::string& own) { return own.starts_with(name); });
      if (!isOverridden) all.emplace_back(variable);
    }
    return all;
  }

  pid_t pid_ = 0;
};

}  // namespace ostrel::testing_support
