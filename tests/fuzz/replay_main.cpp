// Replays stored inputs through a fuzz target without libFuzzer, so that the ordinary builds
// run the seeds and every input that once crashed. Arguments are directories (a missing one
// holds no inputs yet); a failing input aborts inside the target.
#include <stdint.h>
#include <stdio.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <vector>

extern "C" int LLVMFuzzerInitialize(int* argc, char*** argv);
extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

int main(int argc, char** argv) {
  LLVMFuzzerInitialize(&argc, &argv);
  size_t replayed = 0;
  std::error_code missing;
  for (int i = 1; i < argc; ++i) {
    for (const auto& entry : std::filesystem::directory_iterator(argv[i], missing)) {
      std::ifstream in(entry.path(), std::ios::binary);
      const std::vector<uint8_t> bytes{std::istreambuf_iterator<char>(in), {}};
      fprintf(stderr, "%s (%zu bytes)\n", entry.path().c_str(), bytes.size());
      LLVMFuzzerTestOneInput(bytes.data(), bytes.size());
      ++replayed;
    }
  }
  printf("%zu inputs replayed\n", replayed);
  return replayed > 0 ? 0 : 1;
}
