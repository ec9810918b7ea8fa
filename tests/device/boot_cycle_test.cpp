// The boot-time entry (-a, "enable full") and the automatic cycle, as the real binary in the
// fake device root, with the firmware simulator storing the dumps.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <utility>
#include <vector>

#include "tests/harness/chain_checks.h"
#include "tests/harness/fake_device.h"

namespace {

const char kReserved[] = "/data/vendor/ramdump/RAMDUMP_RESERVED";
const char kStatus[] = "/data/vendor/ramdump/RAMDUMP_STATUS";
const char kOutDir[] = "/data/vendor/ramdump/apq/00";
const char kOutput[] = "/data/vendor/ramdump/apq/00/RAMDUMP_OUTPUT";
const char kMessage[] = "/data/vendor/ramdump/apq/00/RAMDUMP_MSG.txt";
const char kNoDump[] = "E reserveblocks: No ramdump found, exiting\\n\n";
const uint64_t kGiB = 1ull << 30;
using Files = std::vector<std::pair<std::string, std::string>>;

mode_t mode_of(const FakeDevice& device, const std::string& path) {
  struct stat st;
  return stat(device.host_path(path).c_str(), &st) == 0 ? st.st_mode & 07777 : 0;
}

// The simulated firmware stores the files as a dump.
void simulate_crash(FakeDevice& device, const Files& files) {
  std::vector<std::string> args = {MISC_DEVICE, USERDATA_DEVICE};
  for (const auto& file : files) {
    device.write_file(file.first, file.second);
    args.push_back(file.first);
  }
  RunResult r = device.run(args, "firmware_sim");
  ASSERT_EQ(r.status, 0) << r.err;
}

// -a applies the request file first ("disable" on the first line wins, "enabled" begins with
// "enable"); "enable full" ignores it and the block address item; near misses convert "enable".
TEST(BootEntry, RequestFileAndEnableFull) {
  FakeDevice device(16 * kGiB);
  REQUIRE_DEVICE(device);
  auto misc = [&](size_t at, size_t n) { return device.misc_bytes().substr(at, n); };
  const std::string near_miss = "E reserveblocks: failed to convert enabl",
                    no_reserved = "E reserveblocks: Failed to delete " + std::string(kReserved) +
                                  ": No such file or directory\\n\n";
  const struct {
    std::vector<std::string> args;
    const char* request;  // nullptr: none, nor a reserved file
    const char *flag, *flag_after;
    int status;
    std::string log;
  } steps[] = {
      {{"-a"}, nullptr, "DiSa", "DiSa", 255, no_reserved},
      {{"-a"}, "disable\nenable\n", "EnAb", "DiSa", 0, "I reserveblocks: Disabling ramdump\\n\n"},
      {{"-a"}, "enabled", "DiSa", "EnAb", 255, "I reserveblocks: Enabling ramdump\\n\n"},
      {{"enable", "full"}, "disable", "DiSa", "EnAb", 0, kNoDump},
      {{"enable", "fullx"}, "disable", "DiSa", "DiSa", 1, near_miss},
      {{"enable", "full", "x"}, "disable", "DiSa", "DiSa", 1, near_miss},
      {{"enabl", "full"}, "disable", "DiSa", "DiSa", 1, near_miss},
      {{"enablex", "full"}, "disable", "DiSa", "DiSa", 1, near_miss},
  };
  for (const auto& s : steps) {
    SCOPED_TRACE(s.args[0] + " " + s.args.back());
    const bool auto_entry = s.args[0] == "-a", cycle = s.flag_after == std::string("EnAb");
    if (s.request) {
      device.write_file(kStatus, s.request, 0666);
      device.write_file(kReserved, std::string(8 * 4096, '\xFF'));
    }
    for (const char* file : {kOutput, kMessage, "/data/vendor/ramdump/kvdump.rdmp"}) {
      device.write_file(file, "x");
    }
    set_misc_item(device, 3136, "LBA!");
    set_misc_item(device, 3184, std::string(24, '\x11'));  // armed, no dump
    set_misc_item(device, 3216, s.flag);
    device.set_property("debug.kvo.kvdump", "");
    device.clear_log();
    EXPECT_EQ(device.run(s.args).status, s.status);
    EXPECT_EQ(misc(3136, 4), auto_entry ? std::string(4, '\xFF') : "LBA!");
    EXPECT_EQ(misc(3184, 24) == std::string(24, '\0'), auto_entry && s.status == 0);
    EXPECT_EQ(misc(3216, 4), s.flag_after);
    EXPECT_EQ(device.property("debug.kvo.kvdump"), s.status == 1 ? "" : "fail");
    EXPECT_TRUE(contains(tool_log(device), s.log)) << device.log();
    EXPECT_EQ(contains(tool_log(device), kNoDump), cycle) << device.log();
    EXPECT_EQ(device.exists("/data/vendor/ramdump/kvdump.rdmp"), !auto_entry);
    for (const char* file : {kReserved, kOutput, kMessage, kOutDir, "/data/vendor/ramdump/apq"}) {
      EXPECT_EQ(device.exists(file), !auto_entry || cycle) << file;  // disabled: all deleted
    }
    if (!s.request) {
      EXPECT_EQ(mode_of(device, kStatus), 0666u);  // created empty for everyone
      EXPECT_EQ(device.read_file(kStatus), "");
    }
  }
}

TEST(AutoCycle, SpaceThresholdsAndUnusableReservedFile) {
  FakeDevice device(16 * kGiB);
  REQUIRE_DEVICE(device);
  const uint64_t kCreate = 10737418240ull, kKeep = 6442450944ull;
  const std::string short_of = "E reserveblocks: Not enough space available to create ramdump ",
                    disabling =
                        "E reserveblocks: Disabling ramdump due to not enough free space\\n\n";
  const struct {
    bool reserved, immutable;  // present; not openable for writing, which counts as missing
    uint64_t free;
    std::string log;
  } cases[] = {
      {false, false, kCreate - 4096,
       short_of + "reserved file: have 10737414144 bytes, need 10737418240 bytes\\n\n" + disabling},
      {true, false, kKeep - 4096,
       short_of + "output file: have 6442446848 bytes, need 6442450944 bytes\\n\n" + disabling},
      {true, false, kKeep, kNoDump},
      {true, true, kCreate,
       "E reserveblocks: failed to open file:/data/vendor/ramdump/RAMDUMP_RESERVED for writing: "
       "Operation not permitted\\n\n"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.free);
    device.remove(kReserved);
    std::filesystem::remove_all(device.host_path("/data/filler"));
    if (c.reserved) device.write_file(kReserved, std::string(4 * 4096, '\xFF'));
    if (c.immutable) {
      ASSERT_EQ(system(("chattr +i " + device.host_path(kReserved)).c_str()), 0);
    }
    ASSERT_TRUE(device.set_free_space(c.free)) << device.free_space();
    set_misc_item(device, 3216, "EnAb");
    set_misc_item(device, 3184, std::string(24, '\x44'));
    device.clear_log();
    EXPECT_EQ(device.run({"-a"}).status, 255);
    EXPECT_TRUE(contains(tool_log(device), c.log)) << device.log();
    const bool disabled = contains(c.log, disabling);
    EXPECT_EQ(device.misc_bytes().substr(disabled ? 3184 : 3216, disabled ? 36 : 4),
              disabled ? std::string(32, '\0') + "DiSa" : "EnAb");
    EXPECT_EQ(device.exists(kReserved), c.reserved);  // disabling leaves the file
    if (c.immutable) system(("chattr -i " + device.host_path(kReserved)).c_str());
  }
}

// The dump bit of the stored state decides; the state is stored armed without a dump, other
// bits kept, and a re-arming after a read-out stores a fresh header (state 1).
TEST(AutoCycle, StateWordAndReadOutOfASmallChain) {
  FakeDevice device(16 * kGiB);
  REQUIRE_DEVICE(device);
  const Files files = {{"/tmp/firmware_log.bin", std::string(5000, '\x01')},
                       {"/tmp/RAMDUMP_MSG.txt", "watchdog timeout on cpu 3\n"},
                       {"/tmp/memory1.bin", std::string(100000, '\x02')}};
  const uint32_t count = 64;
  const struct {
    uint32_t state, stored;
    bool dump;
  } cases[] = {{0, 1, false}, {0x80000004u, 0x80000005u, false}, {3, 1, true}, {6, 1, true}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.state);
    device.write_file(kReserved, std::string(count * 4096, '\xFF'), 0744);
    ASSERT_EQ(device.run({"-i", "feed", kReserved}).status, 0) << device.log();
    const std::vector<long> blocks = map_file(device, kReserved, count);
    set_misc_item(device, 3184, make_ibh(blocks[0], 4096, count, 0xfeed, c.state & ~2u));
    if (c.dump) simulate_crash(device, files);
    set_misc_item(device, 3184, make_ibh(blocks[0], 4096, count, 0xfeed, c.state));
    device.set_property("debug.kvo.ramdump_new_directory", "");
    device.clear_log();
    EXPECT_EQ(device.run({"-a", "-i", "1"}).status, c.dump ? 0 : 255);
    EXPECT_EQ(device.property("debug.kvo.kvdump"), c.dump ? "done" : "fail");
    EXPECT_EQ(device.property("debug.kvo.ramdump_new_directory"), c.dump ? kOutDir : "");
    EXPECT_EQ(stored_ibh(device), make_ibh(blocks[0], 4096, count, 0xfeed, c.stored));
    EXPECT_EQ(verify_chain(device, blocks, 0xfeed, true), "");  // re-armed with the stored CRC
    EXPECT_EQ(contains(tool_log(device), kNoDump), !c.dump) << device.log();
    if (!c.dump) continue;
    EXPECT_EQ(std::filesystem::file_size(device.host_path(kOutput)), count * 4096u);
    EXPECT_EQ(device.read_file(kMessage), files[1].second);
    EXPECT_FALSE(device.exists(std::string(kOutDir) + "/firmware_log.bin"));
    for (const char* made : {kOutDir, "/data/vendor/ramdump/apq", kOutput}) {
      EXPECT_EQ(mode_of(device, made), made == kOutput ? 0666u : 0777u) << made;
    }
  }
}

// Boots at full size: create and arm at exactly 10 GiB free; collect and re-arm; find nothing.
TEST(AutoCycle, FullCrashCycleAtFullSize) {
  FakeDevice device(16 * kGiB);
  REQUIRE_DEVICE(device);
  const uint32_t kCount = 1081344;  // 4,429,185,024 / 4096
  ASSERT_EQ(device.run({"-e"}).status, 0);

  ASSERT_TRUE(device.set_free_space(10737418240ull));
  RunResult r = device.run({"-a", "-i", "1234abcd"});
  EXPECT_EQ(r.status, 255);  // a first arming reports failure: there was nothing to collect
  EXPECT_EQ(device.property("debug.kvo.kvdump"), "fail");
  EXPECT_EQ(mode_of(device, kReserved), 0744u);
  EXPECT_EQ(std::filesystem::file_size(device.host_path(kReserved)), 4429185024u);
  const std::vector<long> blocks = map_file(device, kReserved, kCount);
  EXPECT_EQ(stored_ibh(device), make_ibh(blocks[0], 4096, kCount, 0x1234abcd, 1));
  EXPECT_EQ(device.misc_bytes().substr(3136, 4), std::string(4, '\xFF'));
  EXPECT_EQ(verify_chain(device, blocks, 0x1234abcd, false), "");
  std::filesystem::remove_all(device.host_path("/data/filler"));

  std::string message = "Kernel panic - not syncing: Fatal exception\n";
  for (int i = 0; i < 500; ++i) message += "[" + std::to_string(i) + "] call trace line\n";
  std::string big(3 << 20, '\0');
  for (size_t i = 0; i < big.size(); ++i) big[i] = static_cast<char>(i * 7 + (i >> 12));
  const Files files = {{"/tmp/kernel_log.bin", std::string(12345, 't')},
                       {"/tmp/RAMDUMP_MSG.txt", message},
                       {"/tmp/memory0.bin", big}};
  simulate_crash(device, files);
  EXPECT_EQ(stored_ibh(device), make_ibh(blocks[0], 4096, kCount, 0x1234abcd, 3));
  std::vector<size_t> stored;  // hashes of the blocks as the firmware left them
  std::ifstream raw(device.data_device(), std::ios::binary);
  std::string block(4096, '\0');
  for (long b : blocks) {
    raw.seekg(static_cast<std::streamoff>(b) * 4096).read(&block[0], 4096);
    stored.push_back(std::hash<std::string>()(block));
  }

  r = device.run({"-a", "-i", "99999999"});
  EXPECT_EQ(r.status, 0) << device.log();
  EXPECT_EQ(device.property("debug.kvo.kvdump"), "done");
  EXPECT_EQ(device.property("debug.kvo.ramdump_new_directory"), kOutDir);
  EXPECT_EQ(device.read_file(kMessage), message);
  EXPECT_EQ(stored_ibh(device), make_ibh(blocks[0], 4096, kCount, 0x1234abcd, 1));
  EXPECT_EQ(verify_chain(device, blocks, 0x1234abcd, false), "");

  ASSERT_EQ(std::filesystem::file_size(device.host_path(kOutput)), 4429185024u);
  std::ifstream out(device.host_path(kOutput), std::ios::binary);
  size_t first_bad = kCount;
  for (size_t i = 0; i < kCount && first_bad == kCount; ++i) {
    if (!out.read(&block[0], 4096) || std::hash<std::string>()(block) != stored[i]) first_bad = i;
  }
  EXPECT_EQ(first_bad, kCount) << "first output block that differs";

  device.clear_log();
  r = device.run({"-a"});
  EXPECT_EQ(r.status, 255);
  EXPECT_EQ(device.property("debug.kvo.kvdump"), "fail");
  EXPECT_EQ(device.property("debug.kvo.ramdump_new_directory"), kOutDir);
  EXPECT_TRUE(contains(tool_log(device), kNoDump)) << device.log();
  EXPECT_EQ(device.read_file(kMessage), message);  // the last dump stays until the next one
}

}  // namespace
