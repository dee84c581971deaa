#pragma once

// `tavrinctl summaries`: the summary files sessions leave on internal builds, in
// <diagnostic-dir>/Audio/Reporting.

#include <cstdint>
#include <string>
#include <vector>

#include <CLI/CLI.hpp>

#include "Common.h"

namespace tavrin::ctl {

struct SummaryFile {
  std::string name;
  std::string path;
  uintmax_t size = 0;
  double time = 0;  // last modification, seconds since the epoch
};

// The finished summary files of `directory` (no temporary files of a write under way), oldest
// first. A missing directory has none; `error` is set when it cannot be read.
std::vector<SummaryFile> ListSummaries(const std::string& directory, std::string* error);

struct SummariesOptions {
  std::string name;
};

CLI::App* AddSummariesCommand(CLI::App& app, SummariesOptions& options);
int RunSummaries(CLI::App& command, const SummariesOptions& options, const Context& context);

}  // namespace tavrin::ctl
