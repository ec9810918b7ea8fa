// The default mount table inside the fake device root: which table file is chosen, the
// device-tree table merged in front of it, slot suffixes, boot settings from properties, the
// kernel command line and the device tree, and the block device lookup with its encryption
// state.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "fs_mgr/fs_mgr_boot_config.h"
#include "tests/harness/fake_device.h"

namespace {

const std::string kNoDt =
    "I fstab_dump: [libfs_mgr]fs_mgr_read_fstab_dt(): failed to read fstab from dt\n";

// The value of one "name=value" line of fstab_dump's output.
std::string field(const std::string& out, const std::string& name) {
  const std::string text = "\n" + out, key = "\n" + name + "=";
  size_t at = text.find(key);
  if (at == std::string::npos) return "<none>";
  at += key.size();
  return text.substr(at, text.find('\n', at) - at);
}

// Runs fstab_dump --default on a fresh log: "<num_entries> <fstab_filename>" or "NULL TABLE".
std::string dump_default(FakeDevice& device, RunResult* result = nullptr) {
  device.clear_log();
  RunResult r = device.run({"--default"}, "fstab_dump");
  if (result != nullptr) *result = r;
  return r.out == "NULL TABLE\n"
             ? "NULL TABLE"
             : field(r.out, "num_entries") + " " + field(r.out, "fstab_filename");
}

std::string dt(const std::string& value) { return value + '\0'; }

TEST(DefaultFstab, TableFileChoice) {
  FakeDevice device;
  REQUIRE_DEVICE(device);
  EXPECT_EQ(dump_default(device), "1 \"/vendor/etc/fstab.rbtest\"");  // name from /proc/cmdline
  EXPECT_EQ(device.log(), kNoDt);

  // An empty property leaves the name to the command line; odm comes first.
  device.set_property("ro.boot.hardware", "");
  device.write_file("/odm/etc/fstab.rbtest", "/a /b e ro wait\n");
  EXPECT_EQ(dump_default(device), "1 \"/odm/etc/fstab.rbtest\"");
  // A set property wins; vendor comes before the root, which is tried last.
  device.set_property("ro.boot.hardware", "prop");
  device.write_file("/fstab.prop", "/a /b e ro wait\n/c /d e ro wait\n");
  EXPECT_EQ(dump_default(device), "2 \"/fstab.prop\"");
  device.write_file("/vendor/etc/fstab.prop", "/a /b e ro wait\n");
  EXPECT_EQ(dump_default(device), "1 \"/vendor/etc/fstab.prop\"");
  device.remove("/vendor/etc/fstab.prop");
  device.remove("/fstab.prop");
  EXPECT_EQ(dump_default(device), "NULL TABLE");
  EXPECT_EQ(device.log(), kNoDt +
                              "E fstab_dump: [libfs_mgr]fs_mgr_read_fstab(): cannot open file: "
                              "'/fstab.prop': No such file or directory\n");

  // Recovery wins over every hardware-named table; its slotselect record needs a suffix.
  device.write_file("/sbin/recovery", "");
  device.write_file("/etc/recovery.fstab", "/dev/block/by-name/system /system e ro slotselect\n");
  EXPECT_EQ(dump_default(device), "NULL TABLE");
  EXPECT_TRUE(contains(device.log(), "[libfs_mgr]Error updating for slotselect\n"));
  RunResult r;
  device.set_property("ro.boot.slot_suffix", "_b");  // used as it is
  EXPECT_EQ(dump_default(device, &r), "1 \"/etc/recovery.fstab\"");
  EXPECT_EQ(field(r.out, "rec[0].mount_source"), "\"/dev/block/by-name/system_b\"");
  device.set_property("ro.boot.slot", "c");  // comes first, and gets a "_"
  dump_default(device, &r);
  EXPECT_EQ(field(r.out, "rec[0].mount_source"), "\"/dev/block/by-name/system_c\"");
}

void write_dt_entry(FakeDevice& d, const std::string& name, const std::string& status,
                    const std::string& flags) {
  const std::string dir = "/dt/fstab/" + name + "/";
  if (!status.empty()) d.write_file(dir + "status", dt(status));
  d.write_file(dir + "dev", dt("/dev/block/by-name/" + name));
  d.write_file(dir + "type", dt("ext4"));
  d.write_file(dir + "mnt_flags", dt("ro"));
  d.write_file(dir + "fsmgr_flags", dt(flags));
}

TEST(DefaultFstab, DeviceTreeTableMergedFirst) {
  FakeDeviceConfig config;
  config.cmdline = "androidboot.android_dt_dir=/dt androidboot.slot=a\n";
  config.fstab += "/dev/block/cache /cache ext4 rw wait,verify=/dev/x\n";
  FakeDevice device(config);
  REQUIRE_DEVICE(device);
  device.set_property("ro.boot.hardware", "rbtest");
  device.write_file("/dt/compatible", dt("android,firmware"));
  device.write_file("/dt/fstab/compatible", dt("android,fstab"));
  write_dt_entry(device, "system", "okay", "wait,slotselect");
  write_dt_entry(device, "vendor", "ok", "wait");
  write_dt_entry(device, "odm", "disabled", "wait");
  write_dt_entry(device, "upper", "OK", "wait");
  write_dt_entry(device, ".hidden", "", "wait");
  device.write_file("/dt/fstab/plain", "x");

  RunResult r;
  EXPECT_EQ(dump_default(device, &r), "4 NULL");
  std::string log;
  int k = 0;  // device-tree records in directory order (the file system's), then the file's
  for (const auto& entry : std::filesystem::directory_iterator(device.host_path("/dt/fstab"))) {
    const std::string name = entry.path().filename(), rec = "rec[" + std::to_string(k) + "].";
    if (name == "system" || name == "vendor") {
      EXPECT_EQ(field(r.out, rec + "mount_source"),
                "\"/dev/block/by-name/" + name + (name == "system" ? "_a\"" : "\""));
      EXPECT_EQ(field(r.out, rec + "mount_point"), "\"/" + name + "\"");
      ++k;
    } else if (name == "odm" || name == "upper") {
      log += "I fstab_dump: [libfs_mgr]dt_fstab: Skip disabled entry for partition " + name + "\n";
    }
  }
  EXPECT_EQ(field(r.out, "rec[2].mount_point"), "\"/data\"");
  EXPECT_EQ(field(r.out, "rec[3].mount_point"), "\"/cache\"");
  EXPECT_EQ(device.log(), log);

  // One incomplete entry discards the whole device-tree table, as does a longer compatible.
  device.remove("/dt/fstab/vendor/fsmgr_flags");
  EXPECT_EQ(dump_default(device), "2 \"/vendor/etc/fstab.rbtest\"");
  EXPECT_TRUE(
      contains(device.log(),
               "E fstab_dump: [libfs_mgr]dt_fstab: Failed to find type for partition vendor\n"));
  write_dt_entry(device, "vendor", "ok", "wait");
  device.write_file("/dt/fstab/compatible", dt("android,fstab,extra"));
  EXPECT_EQ(dump_default(device), "2 \"/vendor/etc/fstab.rbtest\"");
  EXPECT_TRUE(contains(device.log(), kNoDt));

  // The hardware name from the device tree, then from nowhere.
  device.write_file("/dt/fstab/compatible", dt("android,fstab"));
  device.set_property("ro.boot.hardware", "");
  device.write_file("/dt/hardware", dt("dthw"));
  device.write_file("/vendor/etc/fstab.dthw", "/a /b e ro wait\n/c /d e ro wait\n");
  EXPECT_EQ(dump_default(device), "4 NULL");
  device.remove("/dt/hardware");
  EXPECT_EQ(dump_default(device), "2 NULL");
  EXPECT_TRUE(contains(device.log(),
                       "W fstab_dump: [libfs_mgr]fs_mgr_read_fstab_default(): failed to find "
                       "device hardware name\n"));
}

TEST(BootConfig, CommandLineDeviceTreeAndSlot) {
  FakeDeviceConfig config;
  config.cmdline =
      "console=ttyS0 androidboot.hardware=abc androidboot.hardware=def androidboot.mode=a=b "
      "androidboot.empty= androidboot.bare  androidboot.android_dt_dir=/dt "
      "androidboot.serial=\"x y\" androidboot.last=z\n";
  FakeDevice device(config);
  REQUIRE_DEVICE(device);
  device.set_property("ro.boot.hardware", "");
  device.set_property("ro.boot.prop", "pv");
  device.write_file("/dt/compatible", dt("android,firmware"));
  device.write_file("/dt/dtkey", dt("v"));
  device.write_file("/dt/one", dt(""));
  device.write_file("/dt/zero", "");  // not even the NUL byte
  RunResult r = device.run_in_root([] {
    for (const char* key : {"hardware", "mode", "empty", "bare", "prop", "dtkey", "one", "zero",
                            "serial", "last", "missing"}) {
      std::string value = "unchanged";
      bool found = fs_mgr_get_boot_config(key, &value);
      printf("%s=%d:%s\n", key, found, found ? value.c_str() : "");
    }
    std::string value = "unchanged";
    printf("cmdline prop=%d:%s\n", fs_mgr_get_boot_config_from_kernel_cmdline("prop", &value),
           value.c_str());
    printf("dir=%s\n", get_android_dt_dir().c_str());
    for (const std::string& compatible :
         {dt("android,firmware,x"), std::string("android,firmware")}) {
      std::ofstream("/dt/compatible") << compatible;
      printf("compatible=%d\n", is_dt_compatible());
    }
    value = "unchanged";  // without a kernel command line to read
    if (chroot("/tmp") != 0) return 1;
    printf("no cmdline=%d:%s\n", fs_mgr_get_boot_config_from_kernel_cmdline("last", &value),
           value.c_str());
    return 0;
  });
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(r.out,
            "hardware=1:abc\nmode=0:\nempty=1:\nbare=0:\nprop=1:pv\ndtkey=1:v\none=1:\nzero=0:\n"
            "serial=1:\"x\nlast=1:z\nmissing=0:\ncmdline prop=0:unchanged\ndir=/dt\n"
            "compatible=0\ncompatible=0\nno cmdline=0:unchanged\n");
}

// fstab_dump --find: the tool's lookup in the default table. Only an encryptable record on a
// device whose state reads exactly "encrypted" is encrypted.
TEST(BlockDevice, FindAndEncryptionState) {
  FakeDeviceConfig config;
  config.fstab =
      "/dev/block/userdata /data ext4 rw wait,forcefdeorfbe=footer\n"
      "/dev/block/cache /cache ext4 rw wait\n";
  FakeDevice device(config);
  REQUIRE_DEVICE(device);
  for (const std::string state : {"", "encrypted", "unencrypted", "encrypted "}) {
    device.set_property("ro.crypto.state", state);
    std::string found;
    for (const char* path : {"/data/vendor/ramdump/RAMDUMP_RESERVED", "/cache/x", "/system/x"}) {
      RunResult r = device.run({"--find", path}, "fstab_dump");
      found += std::to_string(r.status);
      for (const char* name : {"record", "block_device", "encryptable", "encrypted"})
        found += " " + field(r.out, name);
      found += "\n";
    }
    EXPECT_EQ(found, "0 0 \"/dev/block/userdata\" 1 " +
                         std::string(state == "encrypted" ? "1" : "0") +
                         "\n0 1 \"/dev/block/cache\" 0 0\n1 <none> <none> <none> <none>\n")
        << state;
  }
}

}  // namespace
