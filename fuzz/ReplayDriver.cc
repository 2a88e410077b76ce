// The main program of a fuzz target built without libFuzzer: runs the target
// once over each file named, and over every file below each directory named
// (in name order), so that a corpus can be replayed under any build. A broken
// invariant aborts, as under the fuzzer.
#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <system_error>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

int main(int argc, char** argv) {
  std::vector<std::filesystem::path> inputs;
  for (int k = 1; k < argc; ++k) {
    std::error_code ec;
    std::filesystem::path argument(argv[k]);
    if (std::filesystem::is_directory(argument, ec)) {
      std::vector<std::filesystem::path> found;
      for (auto it = std::filesystem::recursive_directory_iterator(argument, ec);
           !ec && it != std::filesystem::recursive_directory_iterator(); it.increment(ec)) {
        if (it->is_regular_file()) found.push_back(it->path());
      }
      if (ec) {
        std::fprintf(stderr, "%s: cannot list %s: %s\n", argv[0], argv[k], ec.message().c_str());
        return 2;
      }
      std::sort(found.begin(), found.end());
      inputs.insert(inputs.end(), found.begin(), found.end());
    } else {
      inputs.push_back(argument);
    }
  }
  for (const std::filesystem::path& input : inputs) {
    std::ifstream in(input, std::ios::binary);
    if (!in) {
      std::fprintf(stderr, "%s: cannot read %s\n", argv[0], input.c_str());
      return 2;
    }
    std::vector<uint8_t> bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    LLVMFuzzerTestOneInput(bytes.data(), bytes.size());
  }
  std::printf("%s: ran %zu inputs\n", argv[0], inputs.size());
  return 0;
}
