#include "platform/linux/files/PosixFileSystem.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

namespace tavrin {
namespace {

namespace fs = std::filesystem;

class PosixFileSystemTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (fs::temp_directory_path() / "tavrin-fs-XXXXXX").string();
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    dir_ = pattern;
  }
  void TearDown() override { fs::remove_all(dir_); }

  static unsigned Mode(const fs::path& path) {
    struct stat info {};
    EXPECT_EQ(::stat(path.c_str(), &info), 0) << path;
    return info.st_mode & 07777;
  }
  static std::string Contents(const fs::path& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
  }
  std::vector<std::string> Entries(const fs::path& directory) const {
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator(directory)) {
      names.push_back(entry.path().filename().string());
    }
    std::sort(names.begin(), names.end());
    return names;
  }

  PosixFileSystem fileSystem_;
  fs::path dir_;
};

// Restores the process umask when a test ends, however it ends.
class ScopedUmask {
 public:
  explicit ScopedUmask(mode_t mask) : previous_(::umask(mask)) {}
  ~ScopedUmask() { ::umask(previous_); }

 private:
  mode_t previous_;
};

TEST_F(PosixFileSystemTest, CreatesNestedDirectoriesWithTheExactModeDespiteTheUmask) {
  ScopedUmask mask(022);
  const fs::path leaf = dir_ / "Audio" / "Reporting" / "deep";
  EXPECT_EQ(fileSystem_.CreateDirectories(leaf.string(), 0777), std::nullopt);
  EXPECT_EQ(Mode(dir_ / "Audio"), 0777u);
  EXPECT_EQ(Mode(dir_ / "Audio" / "Reporting"), 0777u);
  EXPECT_EQ(Mode(leaf), 0777u);
  EXPECT_EQ(Mode(dir_), 0700u) << "an existing parent keeps its mode";

  // Existing directories stay as they are; only the missing ones are made.
  ASSERT_EQ(::chmod((dir_ / "Audio").c_str(), 0750), 0);
  EXPECT_EQ(fileSystem_.CreateDirectories((dir_ / "Audio" / "Other").string() + "/", 0700),
            std::nullopt);
  EXPECT_EQ(Mode(dir_ / "Audio"), 0750u);
  EXPECT_EQ(Mode(dir_ / "Audio" / "Other"), 0700u);
  EXPECT_EQ(fileSystem_.CreateDirectories(leaf.string(), 0700), std::nullopt);
  EXPECT_EQ(Mode(leaf), 0777u);
}

TEST_F(PosixFileSystemTest, CreatingThroughARegularFileFails) {
  { std::ofstream(dir_ / "plain") << "x"; }
  const OptionalError below =
      fileSystem_.CreateDirectories((dir_ / "plain" / "sub").string(), 0755);
  ASSERT_TRUE(below.has_value());
  EXPECT_EQ(below->domain, kPosixErrorDomain);
  EXPECT_EQ(below->code, ENOTDIR);
  EXPECT_NE(below->description.find(std::strerror(ENOTDIR)), std::string::npos)
      << below->description;

  const OptionalError itself = fileSystem_.CreateDirectories((dir_ / "plain").string(), 0755);
  ASSERT_TRUE(itself.has_value());
  EXPECT_EQ(itself->code, ENOTDIR) << "a file where the directory should be is not success";

  const OptionalError empty = fileSystem_.CreateDirectories("", 0755);
  ASSERT_TRUE(empty.has_value());
  EXPECT_EQ(empty->code, EINVAL);
}

TEST_F(PosixFileSystemTest, WritesAndReplacesAFileByRenaming) {
  const fs::path target = dir_ / "summary.json";
  ASSERT_EQ(fileSystem_.WriteFileAtomically(target.string(), "{\"old\":1}"), std::nullopt);
  EXPECT_EQ(Contents(target), "{\"old\":1}");
  struct stat before {};
  ASSERT_EQ(::stat(target.c_str(), &before), 0);

  std::string large(1 << 20, '\0');
  for (size_t i = 0; i < large.size(); ++i) large[i] = char(i * 31);
  ASSERT_EQ(fileSystem_.WriteFileAtomically(target.string(), large), std::nullopt);
  EXPECT_EQ(Contents(target), large);
  struct stat after {};
  ASSERT_EQ(::stat(target.c_str(), &after), 0);
  EXPECT_NE(before.st_ino, after.st_ino) << "the file was rewritten in place, not replaced";

  ASSERT_EQ(fileSystem_.WriteFileAtomically(target.string(), ""), std::nullopt);
  EXPECT_EQ(Contents(target), "");
  EXPECT_EQ(Entries(dir_), std::vector<std::string>{"summary.json"}) << "a temp file was left";
}

TEST_F(PosixFileSystemTest, ReadersSeeTheOldOrTheWholeNewFile) {
  const fs::path target = dir_ / "state.json";
  const std::string first(16 * 1024, 'a');
  const std::string second(24 * 1024, 'b');
  ASSERT_EQ(fileSystem_.WriteFileAtomically(target.string(), first), std::nullopt);
  std::atomic<bool> done{false};
  std::atomic<int> torn{0};
  std::atomic<int> reads{0};
  std::thread reader([&] {
    while (!done.load()) {
      const std::string seen = Contents(target);
      reads.fetch_add(1);
      if (seen != first && seen != second) torn.fetch_add(1);
    }
  });
  for (int i = 0; i < 30; ++i) {
    ASSERT_EQ(fileSystem_.WriteFileAtomically(target.string(), i % 2 ? first : second),
              std::nullopt);
  }
  done = true;
  reader.join();
  EXPECT_EQ(torn.load(), 0);
  EXPECT_GT(reads.load(), 0);
}

TEST_F(PosixFileSystemTest, FailedWriteRemovesTheTemporaryAndKeepsTheOldFile) {
  // A file-size limit makes write() fail half way, for root too. Set in a child so the limit
  // cannot touch anything else in this process.
  const fs::path target = dir_ / "summary.json";
  ASSERT_EQ(fileSystem_.WriteFileAtomically(target.string(), "old"), std::nullopt);
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    ::signal(SIGXFSZ, SIG_IGN);
    const rlimit limit{4096, 4096};
    ::setrlimit(RLIMIT_FSIZE, &limit);
    const OptionalError error =
        fileSystem_.WriteFileAtomically(target.string(), std::string(64 * 1024, 'n'));
    ::_exit(!error ? 10 : error->code == EFBIG ? 0 : 11);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0) << "10: write succeeded; 11: another error than EFBIG";
  EXPECT_EQ(Contents(target), "old");
  EXPECT_EQ(Entries(dir_), std::vector<std::string>{"summary.json"});
}

TEST_F(PosixFileSystemTest, NewFilesFollowTheUmask) {
  ScopedUmask mask(027);
  const fs::path target = dir_ / "summary.json";
  ASSERT_EQ(fileSystem_.WriteFileAtomically(target.string(), "x"), std::nullopt);
  EXPECT_EQ(Mode(target), 0640u);
}

}  // namespace
}  // namespace tavrin
