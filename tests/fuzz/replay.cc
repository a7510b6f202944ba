// Runs a fuzz target over files, once each: the seeds and the regressions, in every build.
// Arguments: files and directories; a missing one, or an empty directory, is an error.

#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "tests/fuzz/Require.h"

int main(int argc, char** argv) {
  std::vector<std::filesystem::path> files;
  for (int i = 1; i < argc; ++i) {
    if (std::filesystem::is_directory(argv[i])) {
      const auto before = files.size();
      for (const auto& entry : std::filesystem::directory_iterator(argv[i])) {
        files.push_back(entry.path());
      }
      Require(files.size() > before, argv[i]);
    } else {
      files.emplace_back(argv[i]);
    }
  }
  std::ranges::sort(files);
  for (const auto& file : files) {
    std::fprintf(stderr, "%s\n", file.filename().c_str());
    std::ifstream in(file, std::ios::binary);
    Require(in.is_open(), file.c_str());
    const std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    LLVMFuzzerTestOneInput(reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size());
  }
  std::printf("%zu inputs replayed\n", files.size());
  return files.empty() ? 1 : 0;
}
