#include "ramdump/conversion.h"

#include "platform/log.h"

int run_conversion(const ramdump_options&, const char*) {
  RB_LOGE("conversion is not available in this build\n");
  return -1;
}
