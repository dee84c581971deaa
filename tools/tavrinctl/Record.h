#pragma once

// `tavrinctl record`: one session on one connection, fed one message per line of input.

#include <cstdio>
#include <string>

#include <CLI/CLI.hpp>

#include "Common.h"

namespace tavrin::ctl {

struct RecordOptions {
  std::string reporter;       // empty: a fresh random ID
  std::string serviceType;    // empty: the service's default
  std::string configuration;  // empty: none
  std::string category = "1";
  std::string type = "0";
};

// Registers the subcommand; its values land in `options`.
CLI::App* AddRecordCommand(CLI::App& app, RecordOptions& options);

// Creates, types, configures and starts a session, sends every non-blank line of `in` (a JSON
// object each) as a message, then stops and destroys the session, all on one connection. Stops
// at the first line that is not a JSON object or the first refused message, still stopping the
// session. Prints what it did; answers the exit status.
int RunRecord(const RecordOptions& options, const Context& context, std::FILE* in);

}  // namespace tavrin::ctl
