#include "platform/linux/files/PosixFileSystem.h"

#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
#include <filesystem>
#include <memory>
#include <optional>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "tests/fakes/FakeFileSystem.h"
#include "tests/unit/linux/LinuxTestSupport.h"

namespace tavrin {
namespace {

using testing::ReadBytes;

unsigned Mode(const std::string& path) {
  struct stat info {};
  EXPECT_EQ(stat(path.c_str(), &info), 0) << path;
  return info.st_mode & 07777;
}

// ---- What every FileSystem does: the Linux one and the fake that unit tests of the core use ----

struct FilesDriver {
  virtual ~FilesDriver() = default;
  virtual FileSystem& Get() = 0;
  virtual std::string Root() = 0;  // an existing, empty directory
  virtual std::optional<std::string> Read(const std::string& path) = 0;
  virtual std::optional<unsigned> DirectoryMode(const std::string& path) = 0;
};

struct PosixDriver final : FilesDriver {
  FileSystem& Get() override { return files; }
  std::string Root() override { return dir.path(); }
  std::optional<std::string> Read(const std::string& path) override {
    if (!std::filesystem::is_regular_file(path)) return std::nullopt;
    return ReadBytes(path);
  }
  std::optional<unsigned> DirectoryMode(const std::string& path) override {
    struct stat info {};
    if (stat(path.c_str(), &info) != 0 || !S_ISDIR(info.st_mode)) return std::nullopt;
    return info.st_mode & 07777;
  }
  PosixFileSystem files;
  testing::TempDir dir;
};

struct FakeDriver final : FilesDriver {
  FakeDriver() { files.AddDirectory("/root", 0700); }
  FileSystem& Get() override { return files; }
  std::string Root() override { return "/root"; }
  std::optional<std::string> Read(const std::string& path) override { return files.ReadFile(path); }
  std::optional<unsigned> DirectoryMode(const std::string& path) override {
    const auto directories = files.Directories();
    const auto found = directories.find(path);
    if (found == directories.end()) return std::nullopt;
    return found->second;
  }
  testing::FakeFileSystem files;
};

class FileSystemContractTest : public ::testing::TestWithParam<std::unique_ptr<FilesDriver> (*)()> {
 protected:
  std::unique_ptr<FilesDriver> driver_ = GetParam()();
  FileSystem& files_ = driver_->Get();
  const std::string root_ = driver_->Root();
};

INSTANTIATE_TEST_SUITE_P(
    , FileSystemContractTest,
    ::testing::Values(
        []() -> std::unique_ptr<FilesDriver> { return std::make_unique<PosixDriver>(); },
        []() -> std::unique_ptr<FilesDriver> { return std::make_unique<FakeDriver>(); }),
    [](const auto& info) { return info.index == 0 ? "Posix" : "Fake"; });

TEST_P(FileSystemContractTest, DirectoriesComeWithTheirParentsAndWritesReplaceWholeFiles) {
  EXPECT_EQ(files_.CreateDirectories(root_ + "/a/b/c", 0750), std::nullopt);
  EXPECT_EQ(driver_->DirectoryMode(root_ + "/a/b"), 0750u);
  EXPECT_EQ(files_.CreateDirectories(root_ + "/a/b", 0700), std::nullopt) << "it exists: success";
  EXPECT_EQ(driver_->DirectoryMode(root_ + "/a/b"), 0750u) << "and keeps its mode";

  EXPECT_EQ(files_.WriteFileAtomically(root_ + "/a/f", "a longer first text"), std::nullopt);
  EXPECT_EQ(files_.WriteFileAtomically(root_ + "/a/f", "second"), std::nullopt);
  EXPECT_EQ(driver_->Read(root_ + "/a/f"), "second");
}

TEST_P(FileSystemContractTest, APathIsAFileOrADirectoryAndAWriteNeedsItsDirectory) {
  ASSERT_EQ(files_.WriteFileAtomically(root_ + "/f", "x"), std::nullopt);
  EXPECT_TRUE(files_.CreateDirectories(root_ + "/f", 0755));
  EXPECT_TRUE(files_.CreateDirectories(root_ + "/f/sub", 0755));
  EXPECT_TRUE(files_.WriteFileAtomically(root_, "x")) << "over a directory";
  EXPECT_TRUE(files_.WriteFileAtomically(root_ + "/missing/f", "x"));
  EXPECT_EQ(driver_->Read(root_ + "/missing/f"), std::nullopt);
  EXPECT_EQ(driver_->Read(root_ + "/f"), "x");
}

// Appends accumulate and are read back in pieces; an atomic write shows nothing until its commit
// and nothing at all when dropped uncommitted; listing shows files only, sorted.
TEST_P(FileSystemContractTest, AppendsReadsListingAndStreamedAtomicWrites) {
  OptionalError error;
  auto appended = files_.OpenForAppend(root_ + "/s", 0640, &error);
  ASSERT_TRUE(appended) << error->LocalizedDescription();
  EXPECT_EQ(appended->Append("abc"), std::nullopt);
  EXPECT_EQ(appended->Append("defgh"), std::nullopt);
  EXPECT_EQ(driver_->Read(root_ + "/s"), "abcdefgh") << "each append reaches the file";
  auto reader = files_.OpenForReading(root_ + "/s", &error);
  ASSERT_TRUE(reader);
  std::string piece, all;
  for (int reads = 0; reads < 10; ++reads) {
    ASSERT_EQ(reader->Read(3, &piece), std::nullopt);
    if (piece.empty()) break;
    EXPECT_LE(piece.size(), 3u);
    all += piece;
  }
  EXPECT_EQ(all, "abcdefgh");
  EXPECT_FALSE(files_.OpenForReading(root_ + "/none", &error));
  EXPECT_TRUE(error);
  EXPECT_FALSE(files_.OpenForAppend(root_ + "/missing/s", 0640, &error));

  auto atomic = files_.BeginAtomicWrite(root_ + "/t", &error);
  ASSERT_TRUE(atomic);
  EXPECT_EQ(atomic->Append("[1,"), std::nullopt);
  EXPECT_EQ(atomic->Append("2]"), std::nullopt);
  EXPECT_EQ(driver_->Read(root_ + "/t"), std::nullopt);
  EXPECT_EQ(atomic->Commit(), std::nullopt);
  EXPECT_EQ(driver_->Read(root_ + "/t"), "[1,2]");
  atomic = files_.BeginAtomicWrite(root_ + "/t", &error);
  ASSERT_TRUE(atomic);
  EXPECT_EQ(atomic->Append("dropped"), std::nullopt);
  atomic.reset();
  EXPECT_EQ(driver_->Read(root_ + "/t"), "[1,2]");

  ASSERT_EQ(files_.CreateDirectories(root_ + "/d", 0750), std::nullopt);
  EXPECT_EQ(files_.ListFiles(root_), (std::vector<std::string>{"s", "t"}));
  EXPECT_EQ(files_.RemoveFile(root_ + "/s"), std::nullopt);
  EXPECT_TRUE(files_.RemoveFile(root_ + "/s")) << "already gone";
  EXPECT_EQ(files_.ListFiles(root_), std::vector<std::string>{"t"});
  EXPECT_TRUE(files_.ListFiles(root_ + "/none").empty());
}

// ---- The Linux one ------------------------------------------------------------------------------

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

TEST_F(PosixFileSystemTest, DirectoryModesAreExactWhateverTheUmaskAndErrorsNameTheirCause) {
  EXPECT_EQ(files_.CreateDirectories(dir_ / "Audio/Reporting/", 0777), std::nullopt);
  EXPECT_EQ(Mode(dir_ / "Audio"), 0777u) << "the umask of 022 does not reduce it";

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
