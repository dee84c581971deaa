#include <csignal>
#include <cstdio>

#include <CLI/CLI.hpp>

#include "platform/SystemLog.h"

// Entry point of tavrind. The front end (listener and client instances) is not built yet: for now
// the process parses its flags, says what is missing and waits for SIGINT or SIGTERM.
int main(int argc, char** argv) {
  CLI::App app{"tavrind: the audio reporting service"};
  std::string root;
  app.add_option("--root", root, "put every path under DIR")->envname("TAVRIN_ROOT");
  CLI11_PARSE(app, argc, argv);

  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGINT);
  sigaddset(&signals, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &signals, nullptr);
  TLOG_DEFAULT(nullptr, "tavrind started (root {}); the client front end is not available yet",
               root.empty() ? "/" : root);
  int received = 0;
  sigwait(&signals, &received);
  TLOG_DEFAULT(nullptr, "tavrind stopping on signal {}", received);
  return 0;
}
