// Gives a target every file of the folders that are named, in the order of their names, and nothing
// at all before them. Each input's name is on standard output before it is tried.
#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "fuzz/target.h"

int main(int argc, char** argv) {
  const uint8_t nothing = 0;
  LLVMFuzzerTestOneInput(&nothing, 0);
  std::vector<std::filesystem::path> files;
  for (int i = 1; i < argc; ++i) {
    if (std::filesystem::is_directory(argv[i])) {
      std::copy(std::filesystem::directory_iterator(argv[i]), {}, std::back_inserter(files));
    } else if (std::filesystem::exists(argv[i])) {
      files.emplace_back(argv[i]);
    }
  }
  std::sort(files.begin(), files.end());
  for (const std::filesystem::path& path : files) {
    printf("%s\n", path.c_str());
    fflush(stdout);
    std::ifstream file(path, std::ios::binary);
    const std::string bytes(std::istreambuf_iterator<char>(file), {});
    fuzz::Require(file.good(), "the input cannot be read");
    LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size());
  }
  if (files.empty()) {
    fprintf(stderr, "no inputs\n");
    return 1;
  }
  return 0;
}
