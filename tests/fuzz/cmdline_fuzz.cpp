// The kernel command line lookup. The input is the key, a line feed, then the command line.
#include "fs_mgr/fs_mgr_boot_config.h"
#include "tests/fuzz/fuzz_common.h"

extern "C" int LLVMFuzzerInitialize(int*, char***) { return fuzz_quiet_logging(); }

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string input(reinterpret_cast<const char*>(data), size);
  const size_t newline = input.find('\n');
  if (newline == std::string::npos) return 0;
  const std::string key = input.substr(0, newline), cmdline = input.substr(newline + 1);
  std::string value = "\x01untouched";
  // A match is a whole "androidboot.<key>=<value>" entry of the line; no match leaves the
  // output alone.
  if (fs_mgr_get_boot_config_from_cmdline_text(cmdline, key, &value)
          ? cmdline.find("androidboot." + key + "=" + value) == std::string::npos
          : value != "\x01untouched") {
    abort();
  }
  return 0;
}
