// The command line and the feature switch (-s, -e, -d) on the real binary, and the misc item
// store on the partition image, inside the fake device root.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "misc/misc_store.h"
#include "tests/harness/fake_device.h"

namespace {

const char kUsage[] =
    "usage: reserveblocks [-a] [-d] [-e] [-s] [-p] [-r <out file>] [-c <size>] [-t] [-i <crc>] "
    "<block file>\n    -r <out file> read from raw block of <block file> to <out file>\n    -c "
    "<size>     also create <block file> of size and convert\n\n    -t            test block chain "
    "integrity\n    -p            print progress\n    -i <crc>      specify initial hex crc value\n"
    "    -a            auto read out raw blocks then rearm block chain\n    -d            disable "
    "ramdump\n    -e            enable ramdump\n    -s            print ramdump status\nConvert "
    "between raw blocks and files.  If only <block file> parameter\nis supplied, then just "
    "re-write <block file> as raw data.  <block file> must\nexist, otherwise, use the -c option to "
    "create the file before\nconverting it.\n";

const std::string kOpenFailed = "Error: " MISC_DEVICE " open failed.\n";
const char kEnableFailed[] =
    "E reserveblocks: error writing ramdump enable flag to MISC partition\\n\n"
    "E reserveblocks: failed to enable ramdump\\n\n";

std::string patched(std::string image, size_t offset, const std::string& bytes) {
  return image.replace(offset, bytes.size(), bytes);
}

// Steps on the image the ones before left, filled with 0xA5 (enabled: not "DiSa") so that any
// stray byte shows; only failures log; image "": no misc partition.
TEST(SwitchModes, CommandLinesAndTheItemsEachModeWrites) {
  FakeDevice device;
  REQUIRE_DEVICE(device);
  const std::string blank(1 << 20, '\xA5'), enabled = patched(blank, 3216, "EnAb");
  const std::string disabled = patched(patched(enabled, 3184, std::string(24, '\0')), 3216, "DiSa");
  write_host_file(device.misc_host_path(), blank);
  const std::string
      no_misc = kOpenFailed + "Error: open partition failed, item=",
      read_failed = "E reserveblocks: error reading ramdump enable flag from MISC partition\\n\n",
      disable_failed =
          "E reserveblocks: error writing ramdump disable initial block header to "
          "MISC partition\\n\nE reserveblocks: failed to disable ramdump\\n\n";
  const struct {
    std::vector<std::string> args;
    int status;
    std::string out, image, log = "";
  } steps[] = {
      {{"-z"}, 2, "", blank},
      {{"-c", "0"}, 2, "", blank},
      {{"-s", "-e"}, 0, "Ramdump enabled\n", blank},  // status hides enable
      {{"-ed"}, 0, "Ramdump enabled\n", enabled},     // enable hides disable
      {{"/data/x", "-d"}, 1, "", enabled},            // an option after the block file is not seen
      {{"-d"}, 0, "Ramdump disabled\n", disabled},
      {{"-s"}, 0, "Ramdump disabled\n", disabled},
      {{"-e"}, 0, "Ramdump enabled\n", patched(disabled, 3216, "EnAb")},
      {{"-s"}, 0, no_misc + "3\nRamdump disabled\n", "", read_failed},
      {{"-e"}, 1, no_misc + "3.\n", "", kEnableFailed},
      {{"-d"}, 1, no_misc + "2.\n", "", disable_failed},
  };
  for (const auto& step : steps) {
    SCOPED_TRACE(&step - steps);
    if (step.image.empty()) device.remove(MISC_DEVICE);
    device.clear_log();
    RunResult r = device.run(step.args);
    EXPECT_EQ(r.status, step.status);
    EXPECT_EQ(r.out, step.out);
    EXPECT_EQ(r.err, step.status == 2 ? kUsage : "");
    EXPECT_TRUE(device.misc_bytes() == step.image);
    if (step.status == 0 || step.log != "") {
      EXPECT_EQ(device.log(), step.log);
    }
  }
  // A build host has neither a log daemon nor a property service: without the log file the
  // records go to standard error, and nothing is created in /dev.
  device.remove("/dev/__log__");
  device.remove("/dev/__properties__");
  EXPECT_EQ(device.run({"-e"}).err, kEnableFailed);
  EXPECT_FALSE(device.exists("/dev/__log__") || device.exists("/dev/__properties__"));
}

// One access per process on an image of i % 251, with a buffer of 0xEE (reads) or 1, 2, 3...
// (writes): an access moves the item's whole length or nothing and leaves the partition closed.
// The first access settles the path: the primary one if it opens then, for good.
TEST(MiscStore, ItemAccess) {
  FakeDevice device;
  REQUIRE_DEVICE(device);
  std::string image(1 << 20, '\0');
  for (size_t i = 0; i < image.size(); ++i) image[i] = static_cast<char>(i % 251);
  device.write_file(MISC_PATH_PRIMARY, "");  // its directory
  uint32_t offset, length;
  const struct {
    std::function<int(uint8_t*)> access;
    int rc;
    bool write;
    size_t offset, length;  // of the bytes moved
    std::string out = "";
    bool partition = true, primary = false;
  } cases[] = {
      {[](uint8_t* b) { return MISC_write_RamdumpLBA(b); }, 0, true, 3136, 4},
      {[](uint8_t* b) { return mfg_emmc_write(4, b, 4); }, 0, true, 3160, 4},
      {[](uint8_t* b) { return mfg_emmc_read(2, b, 4); }, 0, false, 3184, 24},  // length at most
      {[](uint8_t* b) { return mfg_emmc_read(0, b, 4); }, -5, false, 0, 0,
       "Error: item number is out of range, 0\nError: open partition failed, item=0\n"},
      {[](uint8_t* b) { return mfg_emmc_read(2, b, 25); }, -22, false, 0, 0,
       "Error: read data length too large, read_len=25, data_len=24\n"},
      {[](uint8_t* b) { return mfg_emmc_write(3, b, 5); }, -22, true, 0, 0,
       "Error: write data length too large, write_len=5, data_len=4\n"},
      {[](uint8_t*) { return MISC_read_RamdumpIBH(nullptr); }, -22, false, 0, 0},
      {[](uint8_t*) { return MISC_write_RamdumpLBA(nullptr); }, -22, true, 0, 0},
      {[&](uint8_t*) { return mfg_open(5, &offset, &length); }, -1, false, 0, 0,
       "Error: item number is out of range, 5\n"},
      {[&](uint8_t*) { return mfg_open(3, &offset, &length); }, -1, false, 0, 0, kOpenFailed,
       false},
      // Without a partition a length beyond the item is an open failure, not a length error.
      {[](uint8_t* b) { return mfg_emmc_write(2, b, 25); }, -5, true, 0, 0,
       kOpenFailed + "Error: open partition failed, item=2.\n", false},
      {[](uint8_t* b) {
         return MISC_write_RamdumpEnable(b) + unlink(MISC_PATH_PRIMARY) +
                MISC_read_RamdumpEnable(b);
       },
       -5, true, 0, 0,
       "Error: " MISC_PATH_PRIMARY " open failed.\nError: open partition failed, item=3\n", true,
       true},
      {[](uint8_t* b) {
         uint8_t flag[4];
         return MISC_read_RamdumpEnable(flag) + close(creat(MISC_PATH_PRIMARY, 0644)) +
                MISC_write_RamdumpEnable(b);
       },
       0, true, 3216, 4},
  };
  for (size_t k = 0; k < sizeof(cases) / sizeof(cases[0]); ++k) {
    const auto& c = cases[k];
    SCOPED_TRACE(k);
    write_host_file(device.misc_host_path(), image);
    if (!c.partition) device.remove(MISC_DEVICE);
    device.remove(MISC_PATH_PRIMARY);
    if (c.primary) device.write_file(MISC_PATH_PRIMARY, image);
    std::string buffer(32, '\xEE');
    for (size_t i = 0; c.write && i < buffer.size(); ++i) buffer[i] = static_cast<char>(i + 1);
    RunResult r = device.run_in_root([&] {
      int rc = c.access(reinterpret_cast<uint8_t*>(&buffer[0]));
      fwrite(buffer.data(), 1, buffer.size(), stderr);
      for (const auto& fd : std::filesystem::directory_iterator("/proc/self/fd")) {
        std::error_code gone;  // the iterator's own descriptor
        if (contains(std::filesystem::read_symlink(fd, gone).string(), "misc")) return 99;
      }
      return -rc;
    });
    EXPECT_EQ(r.status, -c.rc);
    EXPECT_EQ(r.out, c.out);
    const std::string moved =
        c.write ? buffer.substr(0, c.length) : image.substr(c.offset, c.length);
    EXPECT_TRUE(r.err == (c.write ? buffer : patched(buffer, 0, moved)));
    if (c.partition) {
      EXPECT_TRUE(device.misc_bytes() == (c.write ? patched(image, c.offset, moved) : image));
    }
  }
}

}  // namespace
