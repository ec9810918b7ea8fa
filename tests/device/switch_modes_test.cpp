// The command line and the feature switch (-s, -e, -d) on the real binary, and the misc item
// store's path choice and errors, inside the fake device root.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "misc/misc_store.h"
#include "tests/harness/fake_device.h"

namespace {

const char kUsage[] =
    "usage: reserveblocks [-a] [-d] [-e] [-s] [-p] [-r <out file>] [-c <size>] [-t] [-i <crc>] "
    "<block file>\n"
    "    -r <out file> read from raw block of <block file> to <out file>\n"
    "    -c <size>     also create <block file> of size and convert\n\n"
    "    -t            test block chain integrity\n    -p            print progress\n"
    "    -i <crc>      specify initial hex crc value\n"
    "    -a            auto read out raw blocks then rearm block chain\n"
    "    -d            disable ramdump\n    -e            enable ramdump\n"
    "    -s            print ramdump status\n"
    "Convert between raw blocks and files.  If only <block file> parameter\n"
    "is supplied, then just re-write <block file> as raw data.  <block file> must\n"
    "exist, otherwise, use the -c option to create the file before\nconverting it.\n";

const char kPrimary[] = "/dev/block/platform/msm_sdcc.1/by-name/misc";
const std::string kOpenFailed = std::string("Error: ") + MISC_DEVICE + " open failed.\n";

std::string patched(std::string image, size_t offset, const std::string& bytes) {
  return image.replace(offset, bytes.size(), bytes);
}

// A root whose misc partition images are filled with fill: the secondary one, and the primary
// one when asked for; none when fill is negative.
void set_misc(FakeDevice& device, int fill, bool primary = false) {
  if (fill < 0) {
    device.remove(MISC_DEVICE);
    return;
  }
  write_host_file(device.misc_host_path(), std::string(1 << 20, static_cast<char>(fill)));
  if (primary) device.write_file(kPrimary, device.misc_bytes());
}

// Each mode writes exactly its items; the misc image is filled with 0xA5 so that any other
// byte written shows.
TEST(SwitchModes, CommandLinesAndTheItemsEachModeWrites) {
  FakeDevice device;
  REQUIRE_DEVICE(device);
  set_misc(device, 0xA5);
  const std::string blank = device.misc_bytes();
  for (const std::vector<std::string>& args : std::vector<std::vector<std::string>>{
           {"-z"}, {"-c", "0"}, {"-c", "abc"}, {"-r"}, {"-i"}, {"-c"}, {"-sz"}}) {
    RunResult r = device.run(args);
    EXPECT_EQ(r.status, 2) << args[0];
    EXPECT_EQ(r.err, kUsage) << args[0];
    EXPECT_EQ(r.out, "") << args[0];
  }
  const std::string enabled = patched(blank, 3216, "EnAb");
  const std::string disabled = patched(patched(enabled, 3184, std::string(24, '\0')), 3216, "DiSa");
  struct {
    std::vector<std::string> args;
    int status;
    std::string out, image;
  } steps[] = {
      {{"-s", "-e"}, 0, "Ramdump enabled\n", blank},  // status hides enable; 0xA5 is not "DiSa"
      {{"-ed"}, 0, "Ramdump enabled\n", enabled},     // enable hides disable
      {{"/data/x", "-d"}, 1, "", enabled},            // an option after the block file is not seen
      {{"-d"}, 0, "Ramdump disabled\n", disabled},
      {{"-s"}, 0, "Ramdump disabled\n", disabled},
      {{"-e"}, 0, "Ramdump enabled\n", patched(disabled, 3216, "EnAb")},
  };
  for (const auto& step : steps) {
    device.clear_log();
    RunResult r = device.run(step.args);
    EXPECT_EQ(r.status, step.status) << step.args[0];
    EXPECT_EQ(r.out, step.out) << step.args[0];
    EXPECT_TRUE(device.misc_bytes() == step.image) << step.args[0];
    EXPECT_EQ(device.log().empty(), step.status == 0) << device.log();  // success logs nothing
  }
}

// A build host has no log daemon or property service: the log file and the property directory
// are used only where they exist (the fake root has both). Without them the messages go to
// standard error, a property cannot be set, and nothing is created in /dev.
TEST(SwitchModes, HostWithoutLogFileOrPropertyDirectory) {
  FakeDevice device;
  REQUIRE_DEVICE(device);
  write_host_file(device.misc_host_path(), patched(device.misc_bytes(), 3216, "DiSa"));
  device.remove("/dev/__log__");
  device.remove("/dev/__properties__");
  RunResult boot = device.run({"-a"}), dump = device.run({"/nonexistent"}, "fstab_dump");
  EXPECT_EQ(boot.status, 255);
  EXPECT_EQ(boot.err,
            "I reserveblocks: Ramdump is disabled, deleting ramdump reserved file: "
            "/data/vendor/ramdump/RAMDUMP_RESERVED\\n\n"
            "E reserveblocks: Failed to delete /data/vendor/ramdump/RAMDUMP_RESERVED: No such file "
            "or directory\\n\n"
            "I reserveblocks: Ramdump is disabled, deleting ramdump output file: "
            "/data/vendor/ramdump/apq/00/RAMDUMP_OUTPUT\\n\n");
  EXPECT_EQ(dump.status, 1);
  EXPECT_EQ(dump.err,
            "E fstab_dump: [libfs_mgr]fs_mgr_read_fstab(): cannot open file: '/nonexistent': No "
            "such file or directory\nfstab_dump: /nonexistent: no mount table read (the reasons "
            "are logged)\n");
  EXPECT_FALSE(device.exists("/dev/__log__"));
  EXPECT_FALSE(device.exists("/dev/__properties__"));
}

TEST(MiscStore, MissingPartitionAndBadItems) {
  FakeDevice device;
  REQUIRE_DEVICE(device);
  set_misc(device, -1);
  struct {
    std::string option;
    int status;
    std::string out, log;
  } cases[] = {
      {"-s", 0, kOpenFailed + "Error: open partition failed, item=3\nRamdump disabled\n",
       "E reserveblocks: error reading ramdump enable flag from MISC partition\\n\n"},
      {"-e", 1, kOpenFailed + "Error: open partition failed, item=3.\n",
       "E reserveblocks: error writing ramdump enable flag to MISC partition\\n\n"
       "E reserveblocks: failed to enable ramdump\\n\n"},
      {"-d", 1, kOpenFailed + "Error: open partition failed, item=2.\n",
       "E reserveblocks: error writing ramdump disable initial block header to MISC "
       "partition\\n\nE reserveblocks: failed to disable ramdump\\n\n"},
  };
  for (const auto& c : cases) {
    device.clear_log();
    RunResult r = device.run({c.option});
    EXPECT_EQ(r.status, c.status) << c.option;
    EXPECT_EQ(r.out, c.out) << c.option;
    EXPECT_EQ(device.log(), c.log) << c.option;
  }
  // Without a partition a length beyond the item is an open failure, not a length error.
  RunResult r = device.run_in_root([] {
    uint8_t buf[32] = {};
    return mfg_emmc_write(2, buf, 25) == -5 ? 0 : 1;
  });
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out, kOpenFailed + "Error: open partition failed, item=2.\n");

  // With a partition: item numbers out of range, lengths beyond the item, null buffers.
  write_host_file(device.misc_host_path(), std::string(1 << 20, '\x5A'));
  r = device.run_in_root([] {
    uint8_t buf[32] = {};
    for (int rc : {mfg_emmc_read(0, buf, 4), mfg_emmc_write(5, buf, 4), mfg_emmc_read(2, buf, 25),
                   mfg_emmc_write(3, buf, 5), MISC_read_RamdumpIBH(nullptr),
                   MISC_write_RamdumpLBA(nullptr), mfg_emmc_read(2, buf, 4)}) {
      printf("%d ", rc);
    }
    // The short read transferred the whole 24-byte item and nothing more.
    printf("%zu\n", std::string(reinterpret_cast<char*>(buf), 32).find_first_not_of('\x5A'));
    return 0;
  });
  EXPECT_EQ(r.out,
            "Error: item number is out of range, 0\nError: open partition failed, item=0\n"
            "Error: item number is out of range, 5\nError: open partition failed, item=5.\n"
            "Error: read data length too large, read_len=25, data_len=24\n"
            "Error: write data length too large, write_len=5, data_len=4\n"
            "-5 -5 -22 -22 -22 -22 0 24\n");
  EXPECT_EQ(device.misc_bytes(), std::string(1 << 20, '\x5A'));
}

// The path is settled at the first access of a process: the primary one if it opens then (and
// no fallback afterwards), else the secondary one for good.
TEST(MiscStore, PathChoiceLastsForTheProcess) {
  FakeDevice device;
  REQUIRE_DEVICE(device);
  set_misc(device, 0, true);
  const std::string blank = device.misc_bytes();
  EXPECT_EQ(device.run({"-s"}).out, "Ramdump enabled\n");  // zeros are not "DiSa"
  EXPECT_EQ(device.run({"-d"}).status, 0);
  EXPECT_EQ(device.read_file(kPrimary), patched(blank, 3216, "DiSa"));
  EXPECT_EQ(device.misc_bytes(), blank);

  RunResult r = device.run_in_root([&] {
    uint8_t flag[4] = {'E', 'n', 'A', 'b'};
    if (MISC_write_RamdumpEnable(flag) != 0 || unlink(kPrimary) != 0) return 1;
    return MISC_read_RamdumpEnable(flag) == -5 ? 0 : 2;
  });
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out, std::string("Error: ") + kPrimary +
                       " open failed.\nError: open partition failed, item=3\n");

  r = device.run_in_root([&] {
    uint8_t flag[4] = {'D', 'i', 'S', 'a'}, back[4] = {};
    if (MISC_write_RamdumpEnable(flag) != 0 || fopen(kPrimary, "w") == nullptr) return 1;
    return MISC_read_RamdumpEnable(back) == 0 && memcmp(back, flag, 4) == 0 ? 0 : 2;
  });
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out, "");
  EXPECT_EQ(device.misc_bytes(), patched(blank, 3216, "DiSa"));
}

}  // namespace
