#pragma once

// Starts the real tavrind in a temporary --root, for end-to-end tests. Header-only so that each
// e2e test executable can use it without another library.

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include "tests/support/TestClient.h"

namespace tavrin::testing {

#ifndef TAVRIND_PATH
#error "TAVRIND_PATH must name the tavrind binary"
#endif

// One tavrind process in its own root. Stopped with SIGTERM on destruction.
class TavrindProcess {
 public:
  explicit TavrindProcess(std::vector<std::string> extraArguments = {},
                          std::string root = MakeTempDirectory("tavrin-e2e-"))
      : root_(std::move(root)), arguments_(std::move(extraArguments)) {}

  ~TavrindProcess() {
    if (pid_ > 0) {
      ::kill(pid_, SIGKILL);
      ::waitpid(pid_, nullptr, 0);
    }
    std::error_code ignored;
    std::filesystem::remove_all(root_, ignored);
  }

  // Starts the service the way socket activation does: `listeningFd` (bound to `socketPath` and
  // listening) becomes descriptor 3 with LISTEN_FDS=1 and LISTEN_PID set to the child.
  bool StartActivated(int listeningFd, std::string socketPath) {
    activationFd_ = listeningFd;
    socketPath_ = std::move(socketPath);
    return Start();
  }

  // Starts the service and waits until its socket accepts connections. False on failure.
  bool Start() {
    logPath_ = root_ + "/tavrind.log";
    std::vector<std::string> argv{TAVRIND_PATH, "--root", root_};
    argv.insert(argv.end(), arguments_.begin(), arguments_.end());
    pid_ = ::fork();
    if (pid_ == 0) {
      const int log = ::open(logPath_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
      ::dup2(log, STDOUT_FILENO);
      ::dup2(log, STDERR_FILENO);
      if (activationFd_ >= 0) {
        ::dup2(activationFd_, 3);
        ::setenv("LISTEN_FDS", "1", 1);
        ::setenv("LISTEN_PID", std::to_string(::getpid()).c_str(), 1);
      }
      std::vector<char*> raw;
      for (auto& argument : argv) raw.push_back(argument.data());
      raw.push_back(nullptr);
      ::execv(raw[0], raw.data());
      ::_exit(127);
    }
    return WaitUntil([&] { return Exited() || TestClient(SocketPath()).connected(); }) && pid_ > 0;
  }

  // Sends `signal` and waits for the exit status (nullopt when it did not exit in time).
  std::optional<int> Stop(int signal = SIGTERM) {
    if (pid_ <= 0) return exitStatus_;
    ::kill(pid_, signal);
    return WaitForExit();
  }

  std::optional<int> WaitForExit() {
    return WaitUntil([&] { return Exited(); }) ? exitStatus_ : std::nullopt;
  }

  std::string Log() const { return ReadFile(logPath_); }
  size_t LogCount(const std::string& needle) const { return Occurrences(Log(), needle); }
  // Waits until the log holds `needle` at least `count` times.
  bool WaitForLog(const std::string& needle, size_t count = 1) const {
    return WaitUntil([&] { return LogCount(needle) >= count; });
  }

  const std::string& root() const { return root_; }
  std::string SocketPath() const {
    return socketPath_.empty() ? root_ + "/run/reporting.sock" : socketPath_;
  }
  std::string DatabasePath() const { return root_ + "/lib/tavrin.db"; }
  std::string DefaultsPath() const { return root_ + "/etc/com.quorvex.tavrin.toml"; }
  pid_t pid() const { return pid_; }

 private:
  bool Exited() {
    if (pid_ <= 0) return true;
    int status = 0;
    if (::waitpid(pid_, &status, WNOHANG) == pid_) {
      exitStatus_ = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
      pid_ = -1;
      return true;
    }
    return false;
  }

  std::string root_;
  std::vector<std::string> arguments_;
  std::string logPath_;
  std::string socketPath_;
  int activationFd_ = -1;
  pid_t pid_ = -1;
  std::optional<int> exitStatus_;
};

}  // namespace tavrin::testing
