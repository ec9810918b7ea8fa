// Shared by the fuzz targets: quiet logging, and the option values that end the process on
// purpose.
#pragma once

#include <android-base/logging.h>
#include <android/log.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <string>

// Messages are still built (INFO is the tool's minimum severity, so their formatting code runs)
// but go nowhere: a log line per input would dominate the run time.
inline void fuzz_quiet_logging() {
  __android_log_set_logger([](const struct __android_logger_data*, const char*) {});
  android::base::SetMinimumLogSeverity(android::base::INFO);
}

// A "reservedsize=" or "zramsize=" value whose size does not fit 64 bits aborts the process by
// design, so such inputs are not faults. Every occurrence in the raw bytes is judged as if it
// started an option, which may skip a few harmless inputs but never lets an intended abort
// through.
inline bool has_intended_size_overflow(const uint8_t* data, size_t size) {
  std::string text(reinterpret_cast<const char*>(data), size);  // NUL-terminated copy
  for (size_t at = text.find("reservedsize="); at != std::string::npos;
       at = text.find("reservedsize=", at + 1)) {
    char* end = nullptr;
    uint64_t n = strtoull(text.c_str() + at + strlen("reservedsize="), &end, 10);
    uint64_t multiplier = 1;
    if (*end == 'G' || *end == 'g') multiplier = 1ULL << 30;
    if (*end == 'M' || *end == 'm') multiplier = 1ULL << 20;
    if (*end == 'K' || *end == 'k') multiplier = 1ULL << 10;
    uint64_t product;
    if (__builtin_mul_overflow(n, multiplier, &product)) return true;
  }
  const uint64_t pages = static_cast<uint64_t>(sysconf(_SC_PHYS_PAGES));
  const uint64_t page_size = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
  for (size_t at = text.find("zramsize="); at != std::string::npos;
       at = text.find("zramsize=", at + 1)) {
    uint64_t percent =
        static_cast<unsigned int>(strtoll(text.c_str() + at + strlen("zramsize="), nullptr, 0));
    uint64_t scaled;
    uint64_t product;
    if (__builtin_mul_overflow(pages, percent, &scaled) ||
        __builtin_mul_overflow(scaled / 100, page_size, &product)) {
      return true;
    }
  }
  return false;
}
