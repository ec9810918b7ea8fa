#include "ramdump/misc_flags.h"

#include "misc/misc_store.h"
#include "platform/log.h"
#include "ramdump/le_bytes.h"
#include "ramdump/ramdump_names.h"

bool read_ramdump_enabled() {
  uint8_t flag[4] = {0, 0, 0, 0};
  if (MISC_read_RamdumpEnable(flag) != 0) {
    RB_LOGE("error reading ramdump enable flag from MISC partition\n");
    return false;
  }
  return get_le32(flag) != RAMDUMP_DISABLED;
}

int write_enable_flag(uint32_t value) {
  uint8_t flag[4];
  put_le32(flag, value);
  int rc = MISC_write_RamdumpEnable(flag);
  if (rc != 0) {
    if (value == RAMDUMP_DISABLED) {
      RB_LOGE("error writing ramdump disable flag to MISC partition\n");
    } else {
      RB_LOGE("error writing ramdump enable flag to MISC partition\n");
    }
  }
  return rc;
}

int write_disabled_ibh() {
  const uint8_t zeros[24] = {};
  int rc = MISC_write_RamdumpIBH(zeros);
  if (rc != 0) RB_LOGE("error writing ramdump disable initial block header to MISC partition\n");
  return rc;
}
