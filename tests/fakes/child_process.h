// A child process started with its own environment and stdout+stderr in a file, for
// the tests that run the programs this tree builds (and the servers they talk to).
#pragma once

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <map>
#include <optional>
#include <string>
#include <thread>
#include <vector>

extern char** environ;

namespace vireo::itest {

using namespace std::chrono_literals;

class ChildProcess {
 public:
  ChildProcess() = default;
  ~ChildProcess() { stop(); }

  // env adds to this process's environment; an empty value removes the variable.
  bool start(const std::vector<std::string>& argv, const std::map<std::string, std::string>& env,
             const std::string& outputFile, int* stdoutPipe = nullptr) {
    // Built before the fork: the child only calls what is safe after forking a threaded process.
    std::map<std::string, std::string> merged;
    for (char** e = environ; *e; ++e)
      if (const char* eq = std::strchr(*e, '=')) merged.emplace(std::string(*e, eq - *e), eq + 1);
    for (const auto& [k, v] : env)
      if (v.empty()) merged.erase(k);
      else merged[k] = v;
    std::vector<std::string> argvCopy = argv, envStrings;
    for (const auto& [k, v] : merged) envStrings.push_back(k + "=" + v);
    std::vector<char*> args, envp;
    for (auto& s : argvCopy) args.push_back(s.data());
    for (auto& s : envStrings) envp.push_back(s.data());
    args.push_back(nullptr);
    envp.push_back(nullptr);

    int pipeFds[2] = {-1, -1};
    if (stdoutPipe && pipe2(pipeFds, O_CLOEXEC) != 0) return false;
    int out = ::open(outputFile.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    if (out < 0) return false;
    pid_ = fork();
    if (pid_ == 0) {
      dup2(out, STDERR_FILENO);
      dup2(stdoutPipe ? pipeFds[1] : out, STDOUT_FILENO);
      int devnull = ::open("/dev/null", O_RDONLY);
      dup2(devnull, STDIN_FILENO);
      execve(args[0], args.data(), envp.data());
      _exit(127);
    }
    ::close(out);
    if (stdoutPipe) {
      ::close(pipeFds[1]);
      *stdoutPipe = pipeFds[0];
    }
    status_.reset();
    return pid_ > 0;
  }

  bool running() { return pid_ > 0 && !waitExit(0ms).has_value(); }

  // Exit status (WEXITSTATUS, or 128+signal), nothing when it did not end in time.
  std::optional<int> waitExit(std::chrono::milliseconds timeout) {
    if (status_) return status_;
    if (pid_ <= 0) return std::nullopt;
    auto until = std::chrono::steady_clock::now() + timeout;
    for (;;) {
      int st = 0;
      pid_t r = waitpid(pid_, &st, WNOHANG);
      if (r == pid_) return status_ = WIFEXITED(st) ? WEXITSTATUS(st) : 128 + WTERMSIG(st);
      if (r < 0 || std::chrono::steady_clock::now() >= until) return std::nullopt;
      std::this_thread::sleep_for(5ms);
    }
  }

  void signal(int sig) {
    if (pid_ > 0 && !status_) ::kill(pid_, sig);
  }

  // SIGTERM, then SIGKILL after a grace period.
  void stop() {
    if (pid_ <= 0 || status_) return;
    signal(SIGTERM);
    if (!waitExit(10s)) {
      signal(SIGKILL);
      waitExit(5s);
    }
  }

 private:
  pid_t pid_ = -1;
  std::optional<int> status_;
};

}  // namespace vireo::itest
