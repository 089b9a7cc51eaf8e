/* Plays kept inputs through a fuzz target, without a fuzzer: the files that are named, and the files of
 * the folders that are named. One thread, no lock.
 */
#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "tests/fuzz/target.h"

namespace {

std::vector<std::filesystem::path> filesOf(const std::filesystem::path &place) {
  if (!std::filesystem::is_directory(place)) return {place};
  std::vector<std::filesystem::path> files;
  for (const auto &entry : std::filesystem::directory_iterator(place)) {
    files.push_back(entry.path());
  }
  std::sort(files.begin(), files.end());
  return files;
}

bool play(const std::filesystem::path &path) {
  std::ifstream file(path, std::ios::binary);
  const std::string bytes{std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>()};
  if (!file) {
    std::fprintf(stderr, "%s cannot be read\n", path.c_str());
    return false;
  }
  std::printf("%s: %zu bytes\n", path.c_str(), bytes.size());
  std::fflush(stdout);
  LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t *>(bytes.data()), bytes.size());
  return true;
}

}  // namespace

int main(int argc, char **argv) {
  for (int i = 1; i < argc; i++) {
    const auto files = filesOf(argv[i]);
    if (files.empty()) std::fprintf(stderr, "%s has no inputs\n", argv[i]);
    if (files.empty() || !std::all_of(files.begin(), files.end(), play)) return 1;
  }
  return argc > 1 ? 0 : 1;
}
