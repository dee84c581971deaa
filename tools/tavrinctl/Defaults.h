#pragma once

// `tavrinctl defaults`: reads and edits the service's defaults file (TOML). Edits keep the rest of
// the file as it is (comments, order, other keys) and replace the file atomically, so the
// service's watch sees one change and re-reads its settings once.

#include <optional>
#include <string>
#include <string_view>

#include <CLI/CLI.hpp>

#include "Common.h"

namespace tavrin::ctl {

// A value typed on the command line, as TOML text: true/false, integers and floats as they are
// ("42", "0x10", "2.5"), arrays and quoted strings when they are valid TOML, anything else as a
// string ("speaker" becomes "'speaker'" or an escaped basic string).
enum class TomlishKind { kBoolean, kInteger, kFloat, kArray, kString };
struct TomlishValue {
  TomlishKind kind = TomlishKind::kString;
  std::string toml;
};
TomlishValue ParseTomlishValue(std::string_view text);

// Keys tavrinctl edits: bare TOML keys (letters, digits, "_" and "-") at the top level, which is
// where the service reads its settings.
bool IsEditableKey(std::string_view key);

// The file text after an edit, or why the edit cannot be made (the file is then left alone).
struct TomlEdit {
  bool ok = false;
  bool found = false;  // the key was in the file before
  std::string text;
  std::string error;
};
// Sets `key` to `valueToml` in place when the key exists, else adds it after the last top-level
// value. `name` names the file in errors.
TomlEdit SetTomlKey(std::string_view text, std::string_view key, std::string_view valueToml,
                    std::string_view name);
// Removes `key`'s lines; a missing key is no error (found is false).
TomlEdit DeleteTomlKey(std::string_view text, std::string_view key, std::string_view name);

struct DefaultsOptions {
  std::string key;
  std::string value;
};

CLI::App* AddDefaultsCommand(CLI::App& app, DefaultsOptions& options);
// Runs the parsed `defaults` subcommand of `command`.
int RunDefaults(CLI::App& command, const DefaultsOptions& options, const Context& context);

}  // namespace tavrin::ctl
