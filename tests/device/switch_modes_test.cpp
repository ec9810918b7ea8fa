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
    "    -t            test block chain integrity\n"
    "    -p            print progress\n"
    "    -i <crc>      specify initial hex crc value\n"
    "    -a            auto read out raw blocks then rearm block chain\n"
    "    -d            disable ramdump\n"
    "    -e            enable ramdump\n"
    "    -s            print ramdump status\n"
    "Convert between raw blocks and files.  If only <block file> parameter\n"
    "is supplied, then just re-write <block file> as raw data.  <block file> must\n"
    "exist, otherwise, use the -c option to create the file before\n"
    "converting it.\n";

const char kPrimary[] = "/dev/block/platform/msm_sdcc.1/by-name/misc";
const char kSecondary[] = "/dev/block/bootdevice/by-name/misc";

// The misc image with the given bytes placed at offset; everything else keeps the fill byte.
std::string misc_with(const std::string& base, size_t offset, const std::string& bytes) {
  std::string image = base;
  image.replace(offset, bytes.size(), bytes);
  return image;
}

FakeDeviceConfig misc_filled(uint8_t fill) {
  FakeDeviceConfig config;
  config.misc_fill = fill;
  return config;
}

TEST(CommandLine, BadCommandLinesPrintUsageAndExit2) {
  FakeDevice device(misc_filled(0xA5));
  REQUIRE_DEVICE(device);
  const std::string before = device.misc_bytes();
  const std::vector<std::vector<std::string>> cases = {
      {"-z"}, {"-c", "0"}, {"-c", "abc"}, {"-c", "x12"}, {"-r"}, {"-i"}, {"-c"}, {"-sz"},
  };
  for (const auto& args : cases) {
    RunResult r = device.run(args);
    std::string shown = args[0] + (args.size() > 1 ? " " + args[1] : "");
    EXPECT_EQ(r.status, 2) << shown;
    EXPECT_EQ(r.err, kUsage) << shown;
    EXPECT_EQ(r.out, "") << shown;
  }
  EXPECT_EQ(device.misc_bytes(), before);
}

TEST(CommandLine, ModePrecedenceAndOptionsAfterTheOperand) {
  FakeDevice device(misc_filled(0xA5));
  REQUIRE_DEVICE(device);
  const std::string blank = device.misc_bytes();

  // Status hides enable: nothing is written.
  RunResult r = device.run({"-s", "-e"});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out, "Ramdump enabled\n");
  EXPECT_EQ(device.misc_bytes(), blank);

  // Enable hides disable: the header item is untouched, the flag says "EnAb".
  r = device.run({"-ed"});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out, "Ramdump enabled\n");
  EXPECT_EQ(device.misc_bytes(), misc_with(blank, 3216, "EnAb"));

  // An option after the block file is an operand, not an option: no switch mode runs.
  r = device.run({"/data/blockfile", "-d"});
  EXPECT_EQ(r.out.find("Ramdump"), std::string::npos) << r.out;
  EXPECT_EQ(device.misc_bytes(), misc_with(blank, 3216, "EnAb"));
}

TEST(SwitchModes, EnableDisableStatusWriteExactlyTheirItems) {
  FakeDevice device(misc_filled(0xA5));
  REQUIRE_DEVICE(device);
  const std::string blank = device.misc_bytes();

  RunResult r = device.run({"-s"});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out, "Ramdump enabled\n");  // 0xA5A5A5A5 is not "DiSa"

  r = device.run({"-d"});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out, "Ramdump disabled\n");
  std::string disabled = misc_with(misc_with(blank, 3184, std::string(24, '\0')), 3216, "DiSa");
  EXPECT_EQ(device.misc_bytes(), disabled);

  r = device.run({"-s"});
  EXPECT_EQ(r.out, "Ramdump disabled\n");

  r = device.run({"-e"});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out, "Ramdump enabled\n");
  EXPECT_EQ(device.misc_bytes(), misc_with(disabled, 3216, "EnAb"));
  EXPECT_EQ(device.log(), "");  // success logs nothing
}

TEST(SwitchModes, ZerosReadAsEnabled) {
  FakeDevice device;
  REQUIRE_DEVICE(device);
  RunResult r = device.run({"-s"});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out, "Ramdump enabled\n");
}

TEST(SwitchModes, MissingPartition) {
  FakeDeviceConfig config;
  config.misc_secondary = false;
  FakeDevice device(config);
  REQUIRE_DEVICE(device);
  const std::string open_failed = std::string("Error: ") + kSecondary + " open failed.\n";

  struct Case {
    std::string option;
    int status;
    std::string out;
    std::string log;
  };
  const Case cases[] = {
      {"-s", 0, open_failed + "Error: open partition failed, item=3\nRamdump disabled\n",
       "E reserveblocks: error reading ramdump enable flag from MISC partition\\n\n"},
      {"-e", 1, open_failed + "Error: open partition failed, item=3.\n",
       "E reserveblocks: error writing ramdump enable flag to MISC partition\\n\n"
       "E reserveblocks: failed to enable ramdump\\n\n"},
      {"-d", 1, open_failed + "Error: open partition failed, item=2.\n",
       "E reserveblocks: error writing ramdump disable initial block header to MISC "
       "partition\\n\n"
       "E reserveblocks: failed to disable ramdump\\n\n"},
  };
  for (const Case& c : cases) {
    device.clear_log();
    RunResult r = device.run({c.option});
    EXPECT_EQ(r.status, c.status) << c.option;
    EXPECT_EQ(r.out, c.out) << c.option;
    EXPECT_EQ(device.log(), c.log) << c.option;
  }
}

TEST(MiscStore, PrimaryPathWinsWhenPresent) {
  FakeDeviceConfig config;
  config.misc_primary = true;
  FakeDevice device(config);
  REQUIRE_DEVICE(device);
  const std::string blank = device.misc_bytes();
  RunResult r = device.run({"-d"});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(device.misc_bytes(true),
            misc_with(misc_with(blank, 3184, std::string(24, '\0')), 3216, "DiSa"));
  EXPECT_EQ(device.misc_bytes(false), blank);
}

// The path is settled at the first access of a process and never changes afterwards.
TEST(MiscStore, PathChoiceLastsForTheProcess) {
  FakeDeviceConfig config;
  config.misc_primary = true;
  FakeDevice device(config);
  REQUIRE_DEVICE(device);
  const std::string primary = device.host_path(kPrimary);

  // The primary path works at the first access, then disappears: no fallback.
  RunResult r = device.run_in_root([&]() {
    uint8_t flag[4] = {'E', 'n', 'A', 'b'};
    if (MISC_write_RamdumpEnable(flag) != 0) return 10;
    if (unlink(kPrimary) != 0) return 11;
    return MISC_read_RamdumpEnable(flag) == -5 ? 0 : 12;
  });
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out, std::string("Error: ") + kPrimary +
                       " open failed.\nError: open partition failed, item=3\n");
  EXPECT_EQ(device.misc_bytes(false).substr(3216, 4), std::string(4, '\0'));

  // The primary path is missing at the first access and appears later: the secondary path
  // stays in use.
  r = device.run_in_root([&]() {
    uint8_t flag[4] = {'D', 'i', 'S', 'a'};
    if (MISC_write_RamdumpEnable(flag) != 0) return 20;
    FILE* f = fopen(kPrimary, "w");
    if (f == nullptr) return 21;
    fclose(f);
    uint8_t back[4] = {};
    if (MISC_read_RamdumpEnable(back) != 0) return 22;
    return memcmp(back, flag, 4) == 0 ? 0 : 23;
  });
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out, "");
  EXPECT_EQ(device.misc_bytes(false).substr(3216, 4), "DiSa");
}

TEST(MiscStore, ItemRangeLengthAndNullBuffer) {
  FakeDevice device(misc_filled(0x5A));
  REQUIRE_DEVICE(device);
  RunResult r = device.run_in_root([]() {
    uint8_t buf[32];
    memset(buf, 0, sizeof(buf));
    int results[] = {
        mfg_emmc_read(0, buf, 4),  mfg_emmc_write(5, buf, 4),     mfg_emmc_read(2, buf, 25),
        mfg_emmc_write(3, buf, 5), MISC_read_RamdumpIBH(nullptr), MISC_write_RamdumpLBA(nullptr),
        mfg_emmc_read(2, buf, 4),  // transfers all 24 bytes of the item
    };
    for (int rc : results) printf("%d\n", rc);
    int full = 0;
    for (int i = 0; i < 24; ++i) full += buf[i] == 0x5A;
    printf("%d %d\n", full, buf[24]);
    return 0;
  });
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out,
            "Error: item number is out of range, 0\n"
            "Error: open partition failed, item=0\n"
            "Error: item number is out of range, 5\n"
            "Error: open partition failed, item=5.\n"
            "Error: read data length too large, read_len=25, data_len=24\n"
            "Error: write data length too large, write_len=5, data_len=4\n"
            "-5\n-5\n-22\n-22\n-22\n-22\n0\n"
            "24 0\n");
  EXPECT_EQ(device.misc_bytes(), std::string(1 << 20, '\x5A'));
}

TEST(MiscStore, LengthTooLargeWithoutPartitionIsAnOpenFailure) {
  FakeDeviceConfig config;
  config.misc_secondary = false;
  FakeDevice device(config);
  REQUIRE_DEVICE(device);
  RunResult r = device.run_in_root([]() {
    uint8_t buf[32] = {};
    return mfg_emmc_write(2, buf, 25) == -5 ? 0 : 1;
  });
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out, std::string("Error: ") + kSecondary +
                       " open failed.\nError: open partition failed, item=2.\n");
}

}  // namespace
