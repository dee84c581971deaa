#include "Summaries.h"

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <sstream>

#include <fmt/format.h>

#include "Operations.h"

namespace tavrin::ctl {
namespace {

std::string SummaryDirectory(const Context& context) {
  return (std::filesystem::path(context.paths.diagnosticDir) / kSummarySubdirectory).string();
}

bool IsSummaryName(const std::string& name) {
  // Atomic writes go through ".<name>.<pid>...tmp" beside the file.
  return name.size() > 5 && name.front() != '.' && name.ends_with(".json");
}

}  // namespace

std::vector<SummaryFile> ListSummaries(const std::string& directory, std::string* error) {
  std::vector<SummaryFile> files;
  std::error_code failure;
  if (!std::filesystem::exists(directory, failure)) return files;
  std::filesystem::directory_iterator entries(directory, failure);
  if (failure) {
    *error = fmt::format("cannot list {}: {}", directory, failure.message());
    return files;
  }
  for (const auto& entry : entries) {
    const std::string name = entry.path().filename().string();
    std::error_code ignored;
    if (!IsSummaryName(name) || !entry.is_regular_file(ignored)) continue;
    SummaryFile file;
    file.name = name;
    file.path = entry.path().string();
    file.size = entry.file_size(ignored);
    const auto modified = entry.last_write_time(ignored);
    const auto system = std::chrono::file_clock::to_sys(modified);
    file.time = std::chrono::duration<double>(system.time_since_epoch()).count();
    files.push_back(std::move(file));
  }
  // Names begin with the stop time to the second; the modification time orders within it.
  std::sort(files.begin(), files.end(), [](const SummaryFile& a, const SummaryFile& b) {
    if (a.time != b.time) return a.time < b.time;
    return a.name < b.name;
  });
  return files;
}

CLI::App* AddSummariesCommand(CLI::App& app, SummariesOptions& options) {
  CLI::App* summaries = app.add_subcommand(
      "summaries", "list the sessions' summary files (name, size, time), or show one");
  auto* show = summaries->add_subcommand("show", "print one summary file");
  show->add_option("NAME", options.name, "a file name from the list, or 'latest'")->required();
  summaries->footer(
      "A session writes a summary file when it stops, on internal builds only (InternalBuild = "
      "true in the service's device.toml), into <diagnostic-dir>/Audio/Reporting.");
  return summaries;
}

int RunSummaries(CLI::App& command, const SummariesOptions& options, const Context& context) {
  const std::string directory = SummaryDirectory(context);
  std::string error;
  const std::vector<SummaryFile> files = ListSummaries(directory, &error);
  if (!error.empty()) return Fail(kExitFailed, error);

  if (!command.got_subcommand("show")) {
    if (files.empty() && !context.json) {
      std::fprintf(stderr,
                   "tavrinctl: no summary files in %s yet. Sessions write one when they stop, on "
                   "internal builds (InternalBuild = true in the service's device.toml).\n",
                   directory.c_str());
    }
    for (const SummaryFile& file : files) {
      if (context.json) {
        PrintJsonLine(
            {{"name", file.name}, {"size", file.size}, {"time", file.time}, {"path", file.path}});
      } else {
        std::printf("%s %8ju %s\n", FormatLocalTime(file.time, false).c_str(), file.size,
                    file.name.c_str());
      }
    }
    return kExitOk;
  }

  std::string path;
  if (options.name == "latest") {
    if (files.empty()) {
      return Fail(kExitFailed, fmt::format("no summary files in {} yet", directory));
    }
    path = files.back().path;
  } else {
    if (options.name.find('/') != std::string::npos) {
      return Fail(kExitUsage, fmt::format("'{}': give a file name from 'tavrinctl summaries', not "
                                          "a path",
                                          options.name));
    }
    const auto found = std::find_if(files.begin(), files.end(), [&](const SummaryFile& file) {
      return file.name == options.name;
    });
    if (found == files.end()) {
      return Fail(kExitFailed, fmt::format("no summary file {} in {} (see tavrinctl summaries)",
                                           options.name, directory));
    }
    path = found->path;
  }
  std::ifstream in(path, std::ios::binary);
  if (!in) return Fail(kExitFailed, fmt::format("cannot read {}", path));
  std::stringstream text;
  text << in.rdbuf();
  std::string contents = text.str();
  if (!contents.empty() && contents.back() != '\n') contents += '\n';
  std::fwrite(contents.data(), 1, contents.size(), stdout);
  return kExitOk;
}

}  // namespace tavrin::ctl
