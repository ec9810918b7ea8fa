#include "ramdump/block_device.h"

#include <android-base/file.h>
#include <android-base/stringprintf.h>
#include <android-base/strings.h>
#include <dirent.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

#include <string>

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

namespace {

std::string dev_name(dev_t dev) {
  return android::base::StringPrintf("%u:%u", major(dev), minor(dev));
}

// Whether upper is a device-mapper device that sits on lower alone, as the kernel lists it.
bool mapped_onto(dev_t upper, dev_t lower) {
  const std::string sys = "/sys/dev/block/" + dev_name(upper) + "/";
  struct stat st;
  if (stat((sys + "dm").c_str(), &st) != 0) return false;
  DIR* slaves = opendir((sys + "slaves").c_str());
  if (slaves == nullptr) return false;
  int count = 0;
  bool onto = false;
  while (const dirent* entry = readdir(slaves)) {
    if (entry->d_name[0] == '.') continue;
    std::string dev;
    ++count;
    onto = android::base::ReadFileToString(sys + "slaves/" + entry->d_name + "/dev", &dev) &&
           android::base::Trim(dev) == dev_name(lower);
  }
  closedir(slaves);
  return count == 1 && onto;
}

}  // namespace

int check_device_holds_file(int dev_fd, const char* blk_dev, int file_fd, const char* file) {
  struct stat dev, held;
  if (fstat(dev_fd, &dev) == 0 && S_ISBLK(dev.st_mode) && fstat(file_fd, &held) == 0 &&
      (held.st_dev == dev.st_rdev || mapped_onto(held.st_dev, dev.st_rdev))) {
    return 0;
  }
  RB_LOGE("%s does not hold %s\n", blk_dev, file);
  return -1;
}
