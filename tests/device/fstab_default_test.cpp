// The default mount table in the fake device root: the table file chosen, the device-tree table
// merged in front of it, slot suffixes, boot settings from properties, the kernel command line
// and the device tree, and the block device lookup with its encryption state.
#include <gtest/gtest.h>

#include <fstream>
#include <regex>
#include <string>
#include <vector>

#include "fs_mgr/fs_mgr_boot_config.h"
#include "tests/harness/fake_device.h"

namespace {

// The kernel command line names the hardware twice (the first counts) and moves the device tree
// to /dt.
const char kCmdline[] =
    "console=ttyS0 androidboot.hardware=rbtest androidboot.hardware=def androidboot.mode=a=b "
    "androidboot.empty= androidboot.bare  androidboot.android_dt_dir=/dt "
    "androidboot.serial=\"x y\" androidboot.last=z\n";

std::string dt(const std::string& value) { return value + '\0'; }

// The values of fstab_dump's "name=value" lines whose name ends in one of names (a regular
// expression), their quotes taken off, each after a space.
std::string values(const std::string& out, const std::string& names) {
  std::string s;
  const std::regex re("(^|\n)[^=\n]*(" + names + ")=\"?([^\"\n]*)");
  for (std::sregex_iterator m(out.begin(), out.end(), re), e; m != e; ++m) s += " " + m->str(3);
  return s;
}

// fstab_dump --default: "<num_entries> <fstab_filename>" and every record's mount source, or
// "NULL TABLE"; then the log, each line without the program and library tags.
std::string dump_default(FakeDevice& device) {
  device.clear_log();
  const std::string out = device.run({"--default"}, "fstab_dump").out;
  const std::string table = values(out, "num_entries|fstab_filename|mount_source");
  return (table.empty() ? out : table.substr(1) + "\n") +
         std::regex_replace(device.log(), std::regex(" fstab_dump: \\[libfs_mgr\\]"), " ");
}

// Each step changes files ("ro." names: properties) and reads the default table again. The device
// tree has one entry, "system", and a directory named with a dot that is none.
TEST(DefaultFstab, TableChoiceAndDeviceTree) {
  FakeDeviceConfig config;
  config.cmdline = kCmdline;
  FakeDevice device(config);
  REQUIRE_DEVICE(device);
  const std::string no_dt = "I fs_mgr_read_fstab_dt(): failed to read fstab from dt\n",
                    data = " " USERDATA_DEVICE, one = "/a /b e ro wait\n", two = one + one,
                    sys = "/dt/fstab/system/", system = " /dev/block/by-name/system_a";
  const struct {
    std::vector<std::string> changes;  // "path=content", or a path alone: removed
    std::string want;
  } steps[] = {
      {{sys + "dev=" + dt("/dev/block/by-name/system"), sys + "type=" + dt("ext4"),
        sys + "mnt_flags=" + dt("ro"), sys + "fsmgr_flags=" + dt("wait,slotselect"),
        "/dt/fstab/.hidden/dev=", "/dt/fstab/compatible=" + dt("android,fstab"),
        "/dt/compatible=" + dt("android,firmware,x")},
       "1 /vendor/etc/fstab.rbtest" + data + "\n" + no_dt},
      // An empty property leaves the name to the command line; odm comes first.
      {{"ro.boot.hardware=", "/odm/etc/fstab.rbtest=" + one},
       "1 /odm/etc/fstab.rbtest /a\n" + no_dt},
      // A set property wins; vendor comes before the root, which is tried last.
      {{"ro.boot.hardware=prop", "/fstab.prop=" + two}, "2 /fstab.prop /a /a\n" + no_dt},
      {{"/vendor/etc/fstab.prop=" + one}, "1 /vendor/etc/fstab.prop /a\n" + no_dt},
      {{"/vendor/etc/fstab.prop", "/fstab.prop"},
       "NULL TABLE\n" + no_dt +
           "E fs_mgr_read_fstab(): cannot open file: '/fstab.prop': No such file or directory\n"},
      // Recovery wins over every hardware-named table; its slotselect record needs a suffix.
      {{"/sbin/recovery=", "/etc/recovery.fstab=/dev/x /x e ro slotselect\n"},
       "NULL TABLE\n" + no_dt +
           "E Error updating for slotselect\n"
           "E fs_mgr_read_fstab(): failed to load fstab from : '/etc/recovery.fstab'\n"},
      {{"ro.boot.slot_suffix=_b"}, "1 /etc/recovery.fstab /dev/x_b\n" + no_dt},
      {{"ro.boot.slot=a"}, "1 /etc/recovery.fstab /dev/x_a\n" + no_dt},  // gets a "_"
      // The device tree's records come first; an entry's status must be exactly "okay" or "ok".
      {{"/sbin/recovery", "/odm/etc/fstab.rbtest", "ro.boot.hardware=rbtest",
        "/dt/compatible=" + dt("android,firmware")},
       "2 NULL" + system + data + "\n"},
      {{sys + "status=" + dt("okay")}, "2 NULL" + system + data + "\n"},
      {{sys + "status=" + dt("ok")}, "2 NULL" + system + data + "\n"},
      {{sys + "status=" + dt("OK")},
       "1 /vendor/etc/fstab.rbtest" + data +
           "\nI dt_fstab: Skip disabled entry for partition system\n" + no_dt},
      // An incomplete entry discards the whole device-tree table, as does a longer compatible.
      {{sys + "status", sys + "fsmgr_flags"},
       "1 /vendor/etc/fstab.rbtest" + data +
           "\nE dt_fstab: Failed to find type for partition system\n" + no_dt},
      {{sys + "fsmgr_flags=" + dt("wait,slotselect"),
        "/dt/fstab/compatible=" + dt("android,fstab,x")},
       "1 /vendor/etc/fstab.rbtest" + data + "\n" + no_dt},
      // The hardware name from the device tree, then from nowhere.
      {{"/dt/fstab/compatible=" + dt("android,fstab"),
        "/proc/cmdline=androidboot.android_dt_dir=/dt\n",
        "ro.boot.hardware=", "/dt/hardware=" + dt("dthw"), "/vendor/etc/fstab.dthw=" + two},
       "3 NULL" + system + " /a /a\n"},
      {{"/dt/hardware"},
       "1 NULL" + system +
           "\nW fs_mgr_read_fstab_default(): failed to find device hardware name\n" +
           "E fs_mgr_read_fstab(): cannot open file: '': No such file or directory\n"},
  };
  for (const auto& step : steps) {
    for (const std::string& change : step.changes) {
      const size_t eq = change.find('=');
      const std::string path = change.substr(0, eq), content = change.substr(eq + 1);
      eq == std::string::npos ? device.remove(path)
      : path[0] != '/'        ? device.set_property(path, content)
                              : device.write_file(path, content);
    }
    EXPECT_EQ(dump_default(device), step.want);
  }
}

// Boot settings inside a child of the test, then fstab_dump --find: the tool's lookup in the
// default table. Only an encryptable record on a device whose state reads exactly "encrypted" is
// encrypted.
TEST(DefaultFstab, BootConfigAndBlockDevice) {
  FakeDeviceConfig config;
  config.cmdline = kCmdline;
  config.fstab =
      "/dev/data /data ext4 rw wait,forcefdeorfbe=footer\n/dev/cache /cache ext4 rw wait\n";
  FakeDevice device(config);
  REQUIRE_DEVICE(device);
  device.set_property("ro.boot.prop", "pv");
  device.write_file("/dt/compatible", dt("android,firmware"));
  device.write_file("/dt/one", dt(""));
  device.write_file("/dt/zero", "");  // not even the NUL byte
  RunResult r = device.run_in_root([] {
    std::string value = "unchanged";
    printf("cmdline prop=%d:%s\n", fs_mgr_get_boot_config_from_kernel_cmdline("prop", &value),
           value.c_str());
    for (const char* key : {"mode", "empty", "bare", "one", "zero", "serial", "last"}) {
      const bool found = fs_mgr_get_boot_config(key, &value);
      printf("%s=%d:%s\n", key, found, found ? value.c_str() : "");
    }
    std::ofstream("/dt/compatible") << "android,firmware";  // its last byte is dropped unseen
    std::string dt_only;
    printf("compatible=%d one=%d\n", is_dt_compatible(), fs_mgr_get_boot_config("one", &dt_only));
    if (chroot("/tmp") != 0) return 1;  // without a kernel command line to read
    printf("no cmdline=%d:%s\n", fs_mgr_get_boot_config_from_kernel_cmdline("last", &value),
           value.c_str());
    return 0;
  });
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(r.out,
            "cmdline prop=0:unchanged\nmode=0:\nempty=1:\nbare=0:\none=1:\nzero=0:\nserial=1:\"x\n"
            "last=1:z\ncompatible=0 one=0\nno cmdline=0:z\n");
  for (const std::string state : {"encrypted", "encrypted "}) {
    device.set_property("ro.crypto.state", state);
    std::string found;
    for (const char* path : {"/data/vendor/ramdump/RAMDUMP_RESERVED", "/cache/x", "/system/x"}) {
      r = device.run({"--find", path}, "fstab_dump");
      found += std::to_string(r.status) +
               values(r.out, "record|block_device|encryptable|encrypted") + "\n";
    }
    EXPECT_EQ(found, "0 0 /dev/data 1 " + std::to_string(state == "encrypted") +
                         "\n0 1 /dev/cache 0 0\n1\n")
        << state;
  }
}

}  // namespace
