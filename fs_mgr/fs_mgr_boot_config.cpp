#include "fs_mgr/fs_mgr_boot_config.h"

#include <android-base/file.h>
#include <android-base/logging.h>
#include <android-base/stringprintf.h>
#include <android-base/strings.h>
#include <stdlib.h>
#include <string.h>

#include <mutex>
#include <vector>

#include "platform/properties.h"

// A null output is a programming error, not a condition the callers could handle.
#define FS_MGR_CHECK_OUT(out_val)                                     \
  do {                                                                \
    if ((out_val) == nullptr) {                                       \
      LOG(FATAL) << "Check failed: out_val != nullptr in libfs_mgr "; \
    }                                                                 \
  } while (0)

namespace {

const std::string kDefaultAndroidDtDir("/proc/device-tree/firmware/android");

}  // namespace

bool fs_mgr_get_boot_config_from_kernel_cmdline(const std::string& key, std::string* out_val) {
  FS_MGR_CHECK_OUT(out_val);
  std::string cmdline;
  if (!android::base::ReadFileToString("/proc/cmdline", &cmdline)) return false;
  return fs_mgr_get_boot_config_from_cmdline_text(cmdline, key, out_val);
}

bool fs_mgr_get_boot_config_from_cmdline_text(const std::string& cmdline, const std::string& key,
                                              std::string* out_val) {
  FS_MGR_CHECK_OUT(out_val);
  const std::string name = "androidboot." + key;
  // Quoting is not recognised: a quoted value with a space in it is split like the rest.
  for (const std::string& entry : android::base::Split(android::base::Trim(cmdline), " ")) {
    std::vector<std::string> pieces = android::base::Split(entry, "=");
    if (pieces.size() == 2 && pieces[0] == name) {
      *out_val = pieces[1];
      return true;
    }
  }
  return false;
}

const std::string& get_android_dt_dir() {
  static std::once_flag once;
  static std::string dt_dir;
  // Only the command line may move the directory: the device tree itself lives there.
  std::call_once(once, [] {
    if (!fs_mgr_get_boot_config_from_kernel_cmdline("android_dt_dir", &dt_dir)) {
      dt_dir = kDefaultAndroidDtDir;
    }
  });
  return dt_dir;
}

bool is_dt_compatible() {
  std::string value;
  return read_dt_file(get_android_dt_dir() + "/compatible", &value) && value == "android,firmware";
}

// Device-tree strings end in a NUL byte; it is dropped without looking at it.
bool read_dt_file(const std::string& file_name, std::string* file_content) {
  if (!android::base::ReadFileToString(file_name, file_content)) return false;
  if (file_content->empty()) return false;
  file_content->pop_back();
  return true;
}

bool fs_mgr_get_boot_config(const std::string& key, std::string* out_val) {
  FS_MGR_CHECK_OUT(out_val);
  *out_val = platform_get_property("ro.boot." + key, "");
  if (!out_val->empty()) return true;
  // On the command line an empty value still counts as given.
  if (fs_mgr_get_boot_config_from_kernel_cmdline(key, out_val)) return true;
  if (!is_dt_compatible()) return false;
  return read_dt_file(get_android_dt_dir() + "/" + key, out_val);
}

std::string fs_mgr_get_slot_suffix() {
  std::string value;
  if (fs_mgr_get_boot_config("slot", &value)) return "_" + value;
  if (fs_mgr_get_boot_config("slot_suffix", &value)) return value;
  return "";
}

bool fs_mgr_update_for_slotselect(fstab* table) {
  std::string suffix;
  for (int i = 0; i < table->num_entries; ++i) {
    fstab_rec* rec = &table->recs[i];
    if ((rec->fs_mgr_flags & MF_SLOTSELECT) == 0) continue;
    // Looked up only once a record needs it, so tables without A/B records never depend on
    // the boot settings.
    if (suffix.empty()) {
      suffix = fs_mgr_get_slot_suffix();
      if (suffix.empty()) return false;
    }
    // The suffix is not empty, so neither is the result; the record keeps a heap string.
    const std::string with_suffix = android::base::StringPrintf(
        "%s%s", rec->mount_source != nullptr ? rec->mount_source : "", suffix.c_str());
    free(rec->mount_source);
    rec->mount_source = strdup(with_suffix.c_str());
  }
  return true;
}
