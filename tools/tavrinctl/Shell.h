#pragma once

// `tavrinctl shell`: the remote operations typed a line at a time on one connection, so the
// sessions created in it live until they are stopped or the shell ends.

#include <cstdio>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include <CLI/CLI.hpp>

#include "Common.h"

namespace tavrin::ctl {

// Splits a shell line into words: blanks separate them, '...' and "..." quote (with \ escapes in
// "..." and outside quotes), and a word that starts with { or [ runs to its matching bracket, so
// a JSON argument needs no quotes. Nothing, with `error` set, on an unfinished quote or bracket.
std::optional<std::vector<std::string>> SplitShellWords(std::string_view line, std::string* error);

CLI::App* AddShellCommand(CLI::App& app);

// Reads commands from `in`: with line editing and history when it is a terminal, plain lines
// otherwise (scripts, pipes). Answers 0 when every command succeeded, else the status of the last
// one that failed.
int RunShell(const Context& context, std::FILE* in);

}  // namespace tavrin::ctl
