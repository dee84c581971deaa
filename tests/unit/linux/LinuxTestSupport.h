#pragma once

// What the platform tests share: a temporary directory, bounded waiting, file bytes, thread names.

#include <pthread.h>
#include <stdlib.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "tests/fakes/GuardedState.h"

namespace tavrin::testing {

// Generous: the machine is shared with compilers; a healthy wait takes milliseconds.
inline constexpr std::chrono::seconds kWaitLimit{20};

// Polls `done` until it holds or kWaitLimit passes.
inline bool WaitFor(const std::function<bool()>& done) {
  const auto deadline = std::chrono::steady_clock::now() + kWaitLimit;
  while (!done()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return true;
}

// A fresh directory, removed with everything in it at the end.
class TempDir {
 public:
  TempDir() {
    std::string pattern = (std::filesystem::temp_directory_path() / "tavrin-XXXXXX").string();
    if (::mkdtemp(pattern.data()) == nullptr) ADD_FAILURE() << "mkdtemp failed";
    path_ = pattern;
  }
  ~TempDir() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  const std::filesystem::path& path() const { return path_; }
  std::string operator/(const std::string& name) const { return (path_ / name).string(); }

 private:
  std::filesystem::path path_;
};

inline std::string ReadBytes(const std::filesystem::path& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

inline void WriteBytes(const std::filesystem::path& path, const std::string& bytes) {
  std::ofstream(path, std::ios::binary | std::ios::trunc) << bytes;
}

// Notes written from any thread, read by the test.
class Notes : GuardedState {
 public:
  void Add(const std::string& note) {
    std::lock_guard lock(mutex_);
    notes_.push_back(note);
  }
  std::vector<std::string> Get() const { return Locked(notes_); }
  size_t Size() const { return Get().size(); }
  bool WaitSize(size_t n) const {
    return WaitFor([&] { return Size() >= n; });
  }

 private:
  std::vector<std::string> notes_;  // guarded by mutex_
};

inline std::string ThreadName() {
  char name[16] = {};
  pthread_getname_np(pthread_self(), name, sizeof name);
  return name;
}

}  // namespace tavrin::testing
