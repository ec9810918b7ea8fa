// Shared by the fuzz targets, with the headers they have in common: quiet logging, a scratch
// directory, read-outs made and extracted in memory, and the option values that end the process
// on purpose.
#pragma once

#include <android-base/logging.h>
#include <android/log.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include "ramdump/chain_format.h"
#include "ramdump/dump_extract.h"

// Messages are still formatted (INFO is the tool's minimum severity) but go nowhere. Returns 0,
// what LLVMFuzzerInitialize returns.
inline int fuzz_quiet_logging() {
  __android_log_set_logger([](const struct __android_logger_data*, const char*) {});
  android::base::SetMinimumLogSeverity(android::base::INFO);
  return 0;
}

// A new directory under /tmp, removed when the process ends (one per process).
inline std::string fuzz_scratch_dir() {
  static char dir[] = "/tmp/rb-fuzz.XXXXXX";
  if (mkdtemp(dir) == nullptr) abort();
  atexit([] { std::filesystem::remove_all(dir); });
  return dir;
}

// The tool's message extraction into dir from a read-out held in memory, which is returned: the
// stream in payloads of 4080 bytes, each behind a chain block header ("BCho", the rest zero);
// with pad, the last unit padded to a whole one.
inline std::string fuzz_extract(const uint8_t* data, size_t size, bool pad,
                                const std::string& dir) {
  const std::string stream(reinterpret_cast<const char*>(data), size);
  std::string readout;
  for (size_t at = 0; at < size; at += 4096 - CHAIN_BLOCK_HEADER_SIZE) {
    readout += "BCho" + std::string(CHAIN_BLOCK_HEADER_SIZE - 4, '\0') +
               stream.substr(at, 4096 - CHAIN_BLOCK_HEADER_SIZE);
    if (pad) readout.resize((readout.size() + 4095) / 4096 * 4096, '\0');
  }
  const int fd = memfd_create("readout", MFD_CLOEXEC);
  if (write(fd, readout.data(), readout.size()) != static_cast<ssize_t>(readout.size())) abort();
  extract_ramdump_msg(("/proc/self/fd/" + std::to_string(fd)).c_str(), dir.c_str());
  close(fd);
  return readout;
}

// Whether the bytes may hold a "reservedsize=" or "zramsize=" value whose size overflows 64
// bits, which aborts by design. Judged generously, so that no intended abort gets through:
// any reserved size of 2^34 or more (the smallest that overflows with "G"), and any zram size
// at all on a machine so large that a percentage of its memory can overflow.
inline bool has_intended_size_overflow(const uint8_t* data, size_t size) {
  const std::string text(reinterpret_cast<const char*>(data), size);
  for (size_t at = text.find("reservedsize="); at != std::string::npos;
       at = text.find("reservedsize=", at + 1)) {
    if (strtoull(text.c_str() + at + strlen("reservedsize="), nullptr, 10) >> 34 != 0) return true;
  }
  uint64_t scaled, bytes;
  static const bool zram_may_overflow =
      __builtin_mul_overflow(static_cast<uint64_t>(sysconf(_SC_PHYS_PAGES)), UINT32_MAX, &scaled) ||
      __builtin_mul_overflow(scaled / 100, static_cast<uint64_t>(sysconf(_SC_PAGESIZE)), &bytes);
  return zram_may_overflow && text.find("zramsize=") != std::string::npos;
}
