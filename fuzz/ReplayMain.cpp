// Runs a fuzz target's entry point over a corpus without libFuzzer, so that every build and every
// ctest run exercises the target: each file named on the command line (directories are walked),
// then, for each file, every prefix and a few single-byte substitutions, which reach the
// truncation and bad-format paths near the seeds. CMake passes the target's corpus directory.

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

namespace {

using Bytes = std::vector<uint8_t>;

// Seeds larger than this are replayed as they are, without derived inputs, to keep a replay
// well under a second.
constexpr size_t kMaxDerivedSeedSize = 512;
// Bytes substituted at each position: 0, a byte never used by MessagePack, a str32 and a bin8
// header, a one-element array, 0xff.
constexpr std::array<uint8_t, 6> kSubstitutes = {0x00, 0xc1, 0xdb, 0xc4, 0x91, 0xff};

size_t runs = 0;

void Run(const Bytes& input) {
  LLVMFuzzerTestOneInput(input.data(), input.size());
  ++runs;
}

void RunWithDerived(const Bytes& seed) {
  Run(seed);
  if (seed.size() > kMaxDerivedSeedSize) return;
  for (size_t size = 0; size < seed.size(); ++size) Run(Bytes(seed.begin(), seed.begin() + size));
  for (size_t pos = 0; pos < seed.size(); ++pos) {
    for (uint8_t substitute : kSubstitutes) {
      if (seed[pos] == substitute) continue;
      Bytes mutated = seed;
      mutated[pos] = substitute;
      Run(mutated);
    }
  }
}

}  // namespace

// Each argument is a corpus file or a directory of them; a path that cannot be read fails the run.
int main(int argc, char** argv) {
  std::vector<std::filesystem::path> files;
  for (int i = 1; i < argc; ++i) {
    if (!std::filesystem::is_directory(argv[i])) {
      files.emplace_back(argv[i]);  // a missing one fails below, as unreadable
      continue;
    }
    for (const auto& entry : std::filesystem::recursive_directory_iterator(argv[i])) {
      if (entry.is_regular_file()) files.push_back(entry.path());
    }
  }
  std::sort(files.begin(), files.end());
  for (const auto& path : files) {
    std::ifstream file(path, std::ios::binary);
    if (!file) {
      std::fprintf(stderr, "%s: cannot read\n", path.c_str());
      return 1;
    }
    RunWithDerived(Bytes(std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>()));
  }
  std::printf("replayed %zu inputs from %zu files\n", runs, files.size());
  return 0;
}
