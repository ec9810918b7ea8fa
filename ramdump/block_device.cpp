#include "ramdump/block_device.h"

#include <string.h>

#include "platform/log.h"
#include "platform/properties.h"

const char* find_block_device(const char* path, const fstab* table, int* encryptable,
                              int* encrypted) {
  if (table == nullptr || table->num_entries < 1) return nullptr;
  for (int i = 0; i < table->num_entries; ++i) {
    const fstab_rec* rec = &table->recs[i];
    if (rec->mount_point == nullptr) continue;
    size_t n = strlen(rec->mount_point);
    // The mount point must end at a path component boundary: /data holds /data/x but not
    // /database/x. The first listed record wins, even over a longer, nested mount point.
    if (strncmp(path, rec->mount_point, n) != 0 || (path[n] != '/' && path[n] != '\0')) continue;
    *encrypted = 0;
    *encryptable = 0;
    if (fs_mgr_is_encryptable(rec)) {
      *encryptable = 1;
      char state[PROPERTY_VALUE_MAX];
      property_get("ro.crypto.state", state, "");
      if (state[0] != '\0' && strcmp(state, "encrypted") == 0) *encrypted = 1;
    }
    return rec->mount_source;
  }
  return nullptr;
}

int resolve_block_device(const char* path, fstab** table, const char** blk_dev, int* encryptable,
                         int* encrypted) {
  *table = fs_mgr_read_fstab_default();
  if (*table == nullptr) {
    RB_LOGE("failed to read default fstab\n");
    return 1;
  }
  *blk_dev = find_block_device(path, *table, encryptable, encrypted);
  if (*blk_dev == nullptr) {
    RB_LOGE("Failed to find block device for %s", path);
    return 1;
  }
  return 0;
}
