#include "platform/linux/files/PosixFileSystem.h"

#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
#include <filesystem>
#include <thread>

#include <gtest/gtest.h>

#include "tests/unit/linux/LinuxTestSupport.h"

namespace tavrin {
namespace {

using testing::ReadBytes;

unsigned Mode(const std::string& path) {
  struct stat info {};
  EXPECT_EQ(stat(path.c_str(), &info), 0) << path;
  return info.st_mode & 07777;
}

class PosixFileSystemTest : public ::testing::Test {
 protected:
  void SetUp() override { umask_ = umask(022); }
  void TearDown() override { umask(umask_); }
  // The names in the directory: a temporary file left behind shows here.
  size_t Entries() const {
    return std::distance(std::filesystem::directory_iterator(dir_.path()), {});
  }

  mode_t umask_ = 0;
  PosixFileSystem files_;
  testing::TempDir dir_;
};

TEST_F(PosixFileSystemTest, CreatesMissingDirectoriesWithTheExactModeAndLeavesOthersAlone) {
  EXPECT_EQ(files_.CreateDirectories(dir_ / "Audio/Reporting/deep", 0777), std::nullopt);
  for (auto rel : {"Audio", "Audio/Reporting", "Audio/Reporting/deep"})
    EXPECT_EQ(Mode(dir_ / rel), 0777u) << rel;
  ASSERT_EQ(chmod((dir_ / "Audio").c_str(), 0750), 0);
  EXPECT_EQ(files_.CreateDirectories(dir_ / "Audio/Other/", 0700), std::nullopt);
  EXPECT_EQ(Mode(dir_ / "Audio"), 0750u);
  EXPECT_EQ(Mode(dir_ / "Audio/Other"), 0700u);
  EXPECT_EQ(Mode(dir_.path()), 0700u) << "an existing parent keeps its mode";

  testing::WriteBytes(dir_ / "plain", "x");
  const std::pair<std::string, int> failures[] = {
      {dir_ / "plain/sub", ENOTDIR}, {dir_ / "plain", ENOTDIR}, {"", EINVAL}};
  for (const auto& [path, code] : failures) {
    const OptionalError error = files_.CreateDirectories(path, 0755);
    ASSERT_TRUE(error) << path << ": a file where a directory should be is not success";
    EXPECT_EQ(error->domain, kPosixErrorDomain);
    EXPECT_EQ(error->code, code) << path;
    EXPECT_NE(error->description.find(std::strerror(code)), std::string::npos) << path;
  }
}

// Readers on another thread see the old or the whole new file, never a mix or a truncated one.
TEST_F(PosixFileSystemTest, ReplacesTheWholeFileByRenamingWithNoTemporaryLeft) {
  umask(027);
  const std::string target = dir_ / "summary.json";
  const std::string first(16 * 1024, 'a'), second(24 * 1024, 'b');
  ASSERT_EQ(files_.WriteFileAtomically(target, first), std::nullopt);
  EXPECT_EQ(Mode(target), 0640u) << "a new file follows the umask";
  std::atomic<bool> done{false};
  std::atomic<int> torn{0};
  std::thread reader([&] {
    for (std::string seen; !done;) {
      seen = ReadBytes(target);
      torn += seen != first && seen != second;
    }
  });
  for (int i = 0; i < 30; ++i) {
    ASSERT_EQ(files_.WriteFileAtomically(target, i % 2 ? first : second), std::nullopt);
  }
  done = true;
  reader.join();
  EXPECT_EQ(torn.load(), 0);
  ASSERT_EQ(files_.WriteFileAtomically(target, ""), std::nullopt);
  EXPECT_EQ(ReadBytes(target), "");
  EXPECT_EQ(Entries(), 1u);
}

// A file-size limit makes write() fail half way, for root too; set in a child so that it cannot
// touch anything else in this process.
TEST_F(PosixFileSystemTest, FailedWriteRemovesTheTemporaryAndKeepsTheOldFile) {
  const std::string target = dir_ / "summary.json";
  ASSERT_EQ(files_.WriteFileAtomically(target, "old"), std::nullopt);
  const pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    signal(SIGXFSZ, SIG_IGN);
    const rlimit limit{4096, 4096};
    setrlimit(RLIMIT_FSIZE, &limit);
    const OptionalError error = files_.WriteFileAtomically(target, std::string(64 * 1024, 'n'));
    _exit(!error ? 10 : error->code == EFBIG ? 0 : 11);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0)
      << status << " (10: the write succeeded; 11: another error than EFBIG)";
  EXPECT_EQ(ReadBytes(target), "old");
  EXPECT_EQ(Entries(), 1u);
}

}  // namespace
}  // namespace tavrin
