// Boot settings that the firmware hands to the system (boot properties, the kernel command
// line, the device tree) and the A/B slot suffix that follows from them.
#pragma once

#include <string>

#include "fs_mgr/fs_mgr_fstab.h"

// "androidboot.<key>=value" on /proc/cmdline; out_val is left alone when there is no match.
bool fs_mgr_get_boot_config_from_kernel_cmdline(const std::string& key, std::string* out_val);
// The same lookup in a command line given as text (what /proc/cmdline holds).
bool fs_mgr_get_boot_config_from_cmdline_text(const std::string& cmdline, const std::string& key,
                                              std::string* out_val);
// Property "ro.boot.<key>", then the kernel command line, then the device tree.
bool fs_mgr_get_boot_config(const std::string& key, std::string* out_val);
// The device-tree directory of the firmware's settings, settled once per process.
const std::string& get_android_dt_dir();
// Whether that directory holds the firmware's settings ("android,firmware").
bool is_dt_compatible();
// A device-tree value: the file's content without its last byte (the terminating NUL).
bool read_dt_file(const std::string& file_name, std::string* file_content);
// "_" + slot, or slot_suffix as it is, or "" when the boot settings name no slot.
std::string fs_mgr_get_slot_suffix();
// Appends the slot suffix to the mount source of every "slotselect" record.
bool fs_mgr_update_for_slotselect(fstab* table);
