#include "Defaults.h"

#include <sys/stat.h>

#include <toml++/toml.h>
#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <vector>

#include <fmt/format.h>

#include "Operations.h"
#include "platform/linux/files/PosixFileSystem.h"
#include "platform/linux/settings/TomlDefaultsDomain.h"

namespace tavrin::ctl {
namespace {

// Directories tavrinctl creates for a defaults file that has none yet: readable by the service
// whatever user it runs as.
constexpr unsigned kDefaultsDirectoryMode = 0755;

struct ParsedToml {
  std::optional<toml::table> table;
  std::string error;
};

ParsedToml ParseToml(std::string_view text, std::string_view name) {
  ParsedToml parsed;
#if TOML_EXCEPTIONS
  try {
    parsed.table = toml::parse(text, std::string(name));
  } catch (const toml::parse_error& error) {
    parsed.error = fmt::format("{}: {} (line {}, column {})", name, error.description(),
                               error.source().begin.line, error.source().begin.column);
  }
#else
  toml::parse_result result = toml::parse(text, std::string(name));
  if (result) {
    parsed.table = std::move(result).table();
  } else {
    parsed.error =
        fmt::format("{}: {} (line {}, column {})", name, result.error().description(),
                    result.error().source().begin.line, result.error().source().begin.column);
  }
#endif
  return parsed;
}

std::vector<std::string> SplitLines(std::string_view text) {
  std::vector<std::string> lines;
  size_t start = 0;
  while (start < text.size()) {
    const size_t end = text.find('\n', start);
    if (end == std::string_view::npos) {
      lines.emplace_back(text.substr(start));
      break;
    }
    lines.emplace_back(text.substr(start, end - start));
    start = end + 1;
  }
  return lines;
}

std::string JoinLines(const std::vector<std::string>& lines) {
  std::string text;
  for (const std::string& line : lines) {
    text += line;
    text += '\n';
  }
  return text;
}

// toml++ counts columns in code points, from 1.
size_t ByteOffsetOfColumn(std::string_view line, size_t column) {
  size_t codePoints = 0;
  for (size_t i = 0; i < line.size(); ++i) {
    if ((static_cast<unsigned char>(line[i]) & 0xC0) == 0x80) continue;
    if (++codePoints == column) return i;
  }
  return line.size();
}

bool IsBlankOrComment(std::string_view line) {
  const size_t first = line.find_first_not_of(" \t\r");
  return first == std::string_view::npos || line[first] == '#';
}

struct TopLevelEntry {
  size_t firstLine = 0;   // 0-based, the key's line
  size_t lastLine = 0;    // 0-based, the value's last line
  size_t endColumn = 0;   // 1-based, just past the value on lastLine
  bool keyValue = false;  // a "key = value" line, not a [table] or dotted keys
};

std::optional<TopLevelEntry> FindEntry(const toml::table& table,
                                       const std::vector<std::string>& lines,
                                       std::string_view key) {
  for (const auto& [name, node] : table) {
    if (name.str() != key) continue;
    TopLevelEntry entry;
    entry.firstLine = size_t(name.source().begin.line) - 1;
    entry.lastLine = size_t(node.source().end.line) - 1;
    entry.endColumn = size_t(node.source().end.column);
    const std::string_view keyLine =
        entry.firstLine < lines.size() ? std::string_view(lines[entry.firstLine]) : "";
    const size_t first = keyLine.find_first_not_of(" \t");
    const bool header = first != std::string_view::npos && keyLine[first] == '[';
    const bool openTable = node.is_table() && !node.as_table()->is_inline();
    entry.keyValue =
        !header && !openTable && entry.lastLine < lines.size() && entry.firstLine <= entry.lastLine;
    return entry;
  }
  return std::nullopt;
}

TomlEdit Refuse(std::string error) {
  TomlEdit edit;
  edit.error = std::move(error);
  return edit;
}

// Checks that the edited text still parses and holds the key (or no longer does).
TomlEdit Verified(std::string text, std::string_view key, bool present, bool found,
                  std::string_view name) {
  const ParsedToml reparsed = ParseToml(text, name);
  if (!reparsed.table) {
    return Refuse(fmt::format("the edit of {} would not parse ({}); the file is left as it is",
                              name, reparsed.error));
  }
  if (reparsed.table->contains(key) != present) {
    return Refuse(fmt::format("the edit of {} did not {} {}; the file is left as it is", name,
                              present ? "set" : "remove", key));
  }
  TomlEdit edit;
  edit.ok = true;
  edit.found = found;
  edit.text = std::move(text);
  return edit;
}

struct FileText {
  enum class Status { kOk, kMissing, kFailed } status = Status::kMissing;
  std::string text;
  std::string error;
};

FileText ReadFileText(const std::string& path) {
  FileText file;
  struct stat info {};
  if (::stat(path.c_str(), &info) != 0) {
    if (errno == ENOENT) return file;
    file.status = FileText::Status::kFailed;
    file.error = fmt::format("cannot read {}: {}", path, std::strerror(errno));
    return file;
  }
  if (!S_ISREG(info.st_mode) || size_t(info.st_size) > kMaxTomlFileBytes) {
    file.status = FileText::Status::kFailed;
    file.error =
        fmt::format("{} is not a regular file of at most {} bytes", path, kMaxTomlFileBytes);
    return file;
  }
  std::ifstream in(path, std::ios::binary);
  std::stringstream text;
  text << in.rdbuf();
  if (!in.good() && !in.eof()) {
    file.status = FileText::Status::kFailed;
    file.error = fmt::format("cannot read {}", path);
    return file;
  }
  file.status = FileText::Status::kOk;
  file.text = text.str();
  return file;
}

// A value for people: strings as they are, everything else as compact JSON.
std::string PlainText(const Json& value) {
  if (value.is_string()) return value.get<std::string>();
  return value.dump(-1, ' ', false, Json::error_handler_t::replace);
}

}  // namespace

TomlishValue ParseTomlishValue(std::string_view text) {
  if (text == "true" || text == "false") return {TomlishKind::kBoolean, std::string(text)};
  const bool hasDigit = text.find_first_of("0123456789") != std::string_view::npos;
  const bool quoted = !text.empty() && (text.front() == '"' || text.front() == '\'');
  if (!text.empty() && text.find('\n') == std::string_view::npos) {
    const ParsedToml parsed = ParseToml(fmt::format("v = {}\n", text), "value");
    if (parsed.table) {
      const toml::node& node = *parsed.table->get("v");
      // inf and nan are floats to TOML, but a person typing them means a word.
      if (node.is_integer()) return {TomlishKind::kInteger, std::string(text)};
      if (node.is_floating_point() && hasDigit) return {TomlishKind::kFloat, std::string(text)};
      if (node.is_array()) return {TomlishKind::kArray, std::string(text)};
      if (node.is_string() && quoted) return {TomlishKind::kString, std::string(text)};
    }
  }
  std::ostringstream quotedText;
  quotedText << toml::value<std::string>(std::string(text));
  return {TomlishKind::kString, quotedText.str()};
}

bool IsEditableKey(std::string_view key) {
  return !key.empty() && std::all_of(key.begin(), key.end(), [](char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_' ||
           c == '-';
  });
}

TomlEdit SetTomlKey(std::string_view text, std::string_view key, std::string_view valueToml,
                    std::string_view name) {
  if (!IsEditableKey(key)) {
    return Refuse(
        fmt::format("'{}' is not a key tavrinctl edits: use a bare top-level key "
                    "(letters, digits, _ and -) such as disable_reporting",
                    key));
  }
  const ParsedToml parsed = ParseToml(text, name);
  if (!parsed.table) {
    return Refuse(fmt::format("{} does not parse, so it is left as it is: {}", name, parsed.error));
  }
  std::vector<std::string> lines = SplitLines(text);
  const std::string newLine = fmt::format("{} = {}", key, valueToml);
  if (const auto entry = FindEntry(*parsed.table, lines, key)) {
    if (!entry->keyValue) {
      return Refuse(
          fmt::format("{} is a table in {}, not a setting; edit the file by hand", key, name));
    }
    // A comment after the value stays.
    const std::string& last = lines[entry->lastLine];
    const std::string suffix = last.substr(ByteOffsetOfColumn(last, entry->endColumn));
    const bool keepSuffix = suffix.find('#') != std::string::npos;
    lines.erase(lines.begin() + long(entry->firstLine), lines.begin() + long(entry->lastLine) + 1);
    lines.insert(lines.begin() + long(entry->firstLine), keepSuffix ? newLine + suffix : newLine);
    return Verified(JoinLines(lines), key, true, true, name);
  }
  // After the last top-level setting; without one, before the first line that is not a comment,
  // which is where the top-level table ends at the latest.
  std::optional<size_t> after;
  for (const auto& [other, node] : *parsed.table) {
    const auto entry = FindEntry(*parsed.table, lines, other.str());
    if (entry && entry->keyValue) after = std::max(after.value_or(0), entry->lastLine + 1);
  }
  size_t at = lines.size();
  if (after) {
    at = *after;
  } else {
    for (size_t i = 0; i < lines.size(); ++i) {
      if (!IsBlankOrComment(lines[i])) {
        at = i;
        break;
      }
    }
  }
  lines.insert(lines.begin() + long(at), newLine);
  return Verified(JoinLines(lines), key, true, false, name);
}

TomlEdit DeleteTomlKey(std::string_view text, std::string_view key, std::string_view name) {
  const ParsedToml parsed = ParseToml(text, name);
  if (!parsed.table) {
    return Refuse(fmt::format("{} does not parse, so it is left as it is: {}", name, parsed.error));
  }
  std::vector<std::string> lines = SplitLines(text);
  const auto entry = FindEntry(*parsed.table, lines, key);
  if (!entry) {
    TomlEdit edit;
    edit.ok = true;
    edit.text = std::string(text);
    return edit;
  }
  if (!entry->keyValue) {
    return Refuse(
        fmt::format("{} is a table in {}, not a setting; edit the file by hand", key, name));
  }
  lines.erase(lines.begin() + long(entry->firstLine), lines.begin() + long(entry->lastLine) + 1);
  return Verified(JoinLines(lines), key, false, true, name);
}

CLI::App* AddDefaultsCommand(CLI::App& app, DefaultsOptions& options) {
  CLI::App* defaults = app.add_subcommand(
      "defaults", "read or edit the service's settings file (takes effect at once)");
  defaults->require_subcommand(1);
  auto* read = defaults->add_subcommand("read", "print one setting, or all");
  read->add_option("KEY", options.key, "the setting");
  auto* write = defaults->add_subcommand("write", "set a setting");
  write->add_option("KEY", options.key, "the setting, e.g. disable_reporting")->required();
  write->add_option("VALUE", options.value, "true/false, an integer, a float, else a string")
      ->required();
  auto* remove = defaults->add_subcommand("delete", "remove a setting (back to its default)");
  remove->add_option("KEY", options.key, "the setting")->required();
  defaults->footer(
      "Settings: device_name, disable_reporting, reporting_server_verbose, "
      "reporting_session_verbose, reporting_driver_verbose, analytics_enabled, "
      "analytics_event_prefixes. Edits keep the rest of the file and replace it in one rename, "
      "so the service re-reads it once.");
  return defaults;
}

int RunDefaults(CLI::App& command, const DefaultsOptions& options, const Context& context) {
  const std::string& path = context.paths.defaults;
  if (command.got_subcommand("read")) {
    TomlFileLoad load = LoadTomlFile(path);
    if (load.status == TomlFileLoad::Status::kFailed) return Fail(kExitFailed, load.error);
    if (load.status == TomlFileLoad::Status::kMissing) {
      std::fprintf(stderr,
                   "tavrinctl: %s does not exist: no settings, the service's defaults "
                   "apply\n",
                   path.c_str());
    }
    const Json values = load.values;
    if (!options.key.empty()) {
      if (!values.contains(options.key)) {
        return Fail(kExitFailed, fmt::format("{} is not set in {}", options.key, path));
      }
      const Json& value = values[options.key];
      if (context.json) {
        PrintJsonLine(value);
      } else {
        std::printf("%s\n", PlainText(value).c_str());
      }
      return kExitOk;
    }
    if (context.json) {
      PrintJsonLine(values);
    } else {
      for (const auto& [key, value] : values.items()) {
        std::printf("%s = %s\n", key.c_str(),
                    value.dump(-1, ' ', false, Json::error_handler_t::replace).c_str());
      }
    }
    return kExitOk;
  }

  const bool writing = command.got_subcommand("write");
  FileText file = ReadFileText(path);
  if (file.status == FileText::Status::kFailed) return Fail(kExitFailed, file.error);
  const TomlEdit edit =
      writing ? SetTomlKey(file.text, options.key, ParseTomlishValue(options.value).toml, path)
              : DeleteTomlKey(file.text, options.key, path);
  if (!edit.ok) return Fail(kExitFailed, edit.error);
  // A delete that finds nothing leaves the file (or its absence) alone.
  if (writing || edit.found) {
    PosixFileSystem fileSystem;
    const std::string directory = std::filesystem::path(path).parent_path().string();
    if (writing && !directory.empty()) {
      if (OptionalError error = fileSystem.CreateDirectories(directory, kDefaultsDirectoryMode)) {
        return Fail(kExitFailed, error->LocalizedDescription());
      }
    }
    if (OptionalError error = fileSystem.WriteFileAtomically(path, edit.text)) {
      return Fail(kExitFailed, error->LocalizedDescription());
    }
  }

  if (writing) {
    // What the service will read: the file as it now is.
    TomlFileLoad load = LoadTomlFile(path);
    const Json value = load.values.contains(options.key) ? Json(load.values[options.key]) : Json();
    if (context.json) {
      PrintJsonLine({{"key", options.key}, {"value", value}, {"file", path}});
    } else {
      std::printf("%s = %s in %s\n", options.key.c_str(),
                  value.dump(-1, ' ', false, Json::error_handler_t::replace).c_str(), path.c_str());
    }
  } else if (context.json) {
    PrintJsonLine({{"key", options.key}, {"deleted", edit.found}, {"file", path}});
  } else if (edit.found) {
    std::printf("deleted %s from %s\n", options.key.c_str(), path.c_str());
  } else {
    std::printf("%s was not set in %s\n", options.key.c_str(), path.c_str());
  }
  return kExitOk;
}

}  // namespace tavrin::ctl
