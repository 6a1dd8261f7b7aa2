// For the tests of the Linux bindings.
#pragma once

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <string>
#include <vector>

namespace ostrel::testing_support {

/// Another program, ended and waited for with this object. Its input is empty, and
/// what it prints goes to a file, or nowhere without one.
class ChildProcess {
 public:
  explicit ChildProcess(std::vector<std::string> command,
                        const std::string& output = "/dev/null",
                        const std::vector<std::string>& environment = {}) {
    std::vector<char*> arguments;
    for (std::string& argument : command) arguments.push_back(argument.data());
    arguments.push_back(nullptr);
    pid_ = ::fork();
    if (pid_ == 0) {
      const int in = ::open("/dev/null", O_RDONLY);
      const int out = ::open(output.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
      ::dup2(in, STDIN_FILENO);
      ::dup2(out, STDOUT_FILENO);
      ::dup2(out, STDERR_FILENO);
      for (const std::string& variable : environment) {
        ::putenv(const_cast<char*>(variable.c_str()));
      }
      ::execvp(arguments.front(), arguments.data());
      ::_exit(127);
    }
  }
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;
  ~ChildProcess() {
    if (pid_ <= 0) return;
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
  }

  pid_t pid() const { return pid_; }

  /// Waits for its end by itself; the exit status, or -1 for another end.
  int wait() {
    int status = 0;
    ::waitpid(pid_, &status, 0);
    pid_ = 0;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

 private:
  pid_t pid_ = 0;
};

}  // namespace ostrel::testing_support
