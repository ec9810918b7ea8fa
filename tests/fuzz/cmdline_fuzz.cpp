// The kernel command line lookup. The input is the key, a line feed, then the command line.
#include <stdlib.h>

#include <string>

#include "fs_mgr/fs_mgr_boot_config.h"
#include "tests/fuzz/fuzz_common.h"

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fuzz_quiet_logging();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string input(reinterpret_cast<const char*>(data), size);
  const size_t newline = input.find('\n');
  if (newline == std::string::npos) return 0;
  const std::string key = input.substr(0, newline);
  const std::string cmdline = input.substr(newline + 1);

  const std::string untouched = "\x01untouched";
  std::string value = untouched;
  if (fs_mgr_get_boot_config_from_cmdline_text(cmdline, key, &value)) {
    // A match is one whole "androidboot.<key>=<value>" entry between spaces (or the ends).
    const std::string entry = "androidboot." + key + "=" + value;
    if (value.find_first_of(" =") != std::string::npos) abort();
    if (cmdline.find(entry) == std::string::npos) abort();
  } else if (value != untouched) {
    abort();  // no match leaves the output alone
  }
  return 0;
}
