#pragma once

#include <stdlib.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <stdexcept>
#include <string>

namespace tavrin::testing {

// A counters tree in a fresh temporary directory, removed with everything in it at the end.
// Layout: <base>/tree is the root; <base>/outside is a sibling for links that lead out of it.
class TempCountersTree {
 public:
  TempCountersTree() {
    char pattern[] = "/tmp/tavrin-counters-XXXXXX";
    if (::mkdtemp(pattern) == nullptr) throw std::runtime_error("mkdtemp failed");
    base_ = pattern;
    std::filesystem::create_directories(base_ / "tree");
    std::filesystem::create_directories(base_ / "outside");
  }
  ~TempCountersTree() {
    std::error_code ignored;
    std::filesystem::remove_all(base_, ignored);
  }
  TempCountersTree(const TempCountersTree&) = delete;
  TempCountersTree& operator=(const TempCountersTree&) = delete;

  std::string root() const { return (base_ / "tree").string(); }
  std::string outside() const { return (base_ / "outside").string(); }
  std::string path(const std::string& rel) const { return (base_ / "tree" / rel).string(); }

  // Writes `text` to <root>/<rel> the way exporters do: a dot-named temporary file in the same
  // directory, renamed over the counter.
  void write(const std::string& rel, const std::string& text) const {
    const std::filesystem::path target = path(rel);
    std::filesystem::create_directories(target.parent_path());
    const auto temp = target.parent_path() / ("." + target.filename().string() + ".tmp");
    std::ofstream(temp, std::ios::binary | std::ios::trunc) << text;  // closed before the rename
    std::filesystem::rename(temp, target);
  }
  void write(const std::string& rel, long long value) const {
    write(rel, std::to_string(value) + "\n");
  }
  void remove(const std::string& rel) const { std::filesystem::remove_all(path(rel)); }
  // A symbolic link at <root>/<rel> holding `target` as given (relative or absolute).
  void link(const std::string& target, const std::string& rel) const {
    std::filesystem::create_directories(std::filesystem::path(path(rel)).parent_path());
    std::filesystem::create_symlink(target, path(rel));
  }

 private:
  std::filesystem::path base_;
};

}  // namespace tavrin::testing
