// The boot-time entry (-a, "enable full") and the automatic cycle, run as the real binary in
// the fake device root: request file, properties, space thresholds, the state word, and one
// full-size crash cycle with the firmware simulator.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "tests/harness/chain_checks.h"
#include "tests/harness/fake_device.h"

namespace {

const char kReserved[] = "/data/vendor/ramdump/RAMDUMP_RESERVED";
const char kStatus[] = "/data/vendor/ramdump/RAMDUMP_STATUS";
const char kOutDir[] = "/data/vendor/ramdump/apq/00";
const char kOutput[] = "/data/vendor/ramdump/apq/00/RAMDUMP_OUTPUT";
const char kMessage[] = "/data/vendor/ramdump/apq/00/RAMDUMP_MSG.txt";
const uint64_t kGiB = 1ull << 30;

FakeDeviceConfig data_device(uint64_t bytes) {
  FakeDeviceConfig config;
  config.data_bytes = bytes;
  return config;
}

std::string le32(uint32_t v) {
  std::string s(4, '\0');
  for (int i = 0; i < 4; ++i) s[i] = static_cast<char>(v >> (8 * i));
  return s;
}

std::string misc_item(const FakeDevice& device, size_t offset, size_t length) {
  return device.misc_bytes().substr(offset, length);
}

void set_misc_item(FakeDevice& device, size_t offset, const std::string& bytes) {
  std::string misc = device.misc_bytes();
  misc.replace(offset, bytes.size(), bytes);
  write_host_file(device.misc_host_path(), misc);
}

mode_t mode_of(const FakeDevice& device, const std::string& path) {
  struct stat st;
  return stat(device.host_path(path).c_str(), &st) == 0 ? st.st_mode & 07777 : 0;
}

bool contains(const std::string& haystack, const std::string& needle) {
  return haystack.find(needle) != std::string::npos;
}

// The dump stream the firmware simulator writes for these files: a record header for each,
// named after the file's base name, then its content.
std::string dump_stream(const std::vector<std::pair<std::string, std::string>>& files) {
  std::string stream;
  for (const auto& file : files) {
    std::string name = file.first.substr(file.first.rfind('/') + 1);
    name.resize(20, '\0');
    stream += "F1Le" + name + le32(static_cast<uint32_t>(file.second.size())) + le32(0) +
              std::string(8, '\0') + file.second;
  }
  return stream;
}

// Writes the files into the root and lets the simulated firmware store them as a dump.
void simulate_crash(FakeDevice& device,
                    const std::vector<std::pair<std::string, std::string>>& files) {
  std::vector<std::string> args = {MISC_DEVICE, USERDATA_DEVICE};
  for (const auto& file : files) {
    device.write_file(file.first, file.second);
    args.push_back(file.first);
  }
  RunResult r = device.run(args, "firmware_sim");
  ASSERT_EQ(r.status, 0) << r.err;
}

// A reserved file of count blocks, armed by the tool and its header stored with state.
std::vector<long> arm_small_reserved(FakeDevice& device, uint32_t count, uint32_t crc,
                                     uint32_t state) {
  device.write_file(kReserved, std::string(count * 4096, '\xFF'), 0744);
  char crc_text[16];
  snprintf(crc_text, sizeof(crc_text), "%x", crc);
  RunResult r = device.run({"-i", crc_text, kReserved});
  EXPECT_EQ(r.status, 0) << device.log();
  std::vector<long> blocks = map_file(device, kReserved, count);
  set_misc_item(device, 3184, make_ibh(blocks[0], 4096, count, crc, state));
  device.clear_log();
  return blocks;
}

TEST(BootEntry, RequestFileAndDisabledPath) {
  FakeDevice device(data_device(64u << 20));
  REQUIRE_DEVICE(device);
  device.write_file("/data/vendor/ramdump/kvdump.rdmp", "old");

  // A missing request file is created empty, readable and writable by everyone. The feature
  // is disabled here, so everything of it is deleted; there was no reserved file.
  set_misc_item(device, 3216, "DiSa");
  RunResult r = device.run({"-a"});
  EXPECT_EQ(r.status, 255);
  EXPECT_TRUE(device.exists(kStatus));
  EXPECT_EQ(mode_of(device, kStatus), 0666u);
  EXPECT_EQ(device.read_file(kStatus), "");
  EXPECT_EQ(misc_item(device, 3136, 4), std::string(4, '\xFF'));
  EXPECT_FALSE(device.exists("/data/vendor/ramdump/kvdump.rdmp"));
  EXPECT_EQ(device.property("debug.kvo.kvdump"), "fail");
  EXPECT_EQ(tool_log(device),
            "I reserveblocks: Ramdump is disabled, deleting ramdump reserved file: "
            "/data/vendor/ramdump/RAMDUMP_RESERVED\\n\n"
            "E reserveblocks: Failed to delete /data/vendor/ramdump/RAMDUMP_RESERVED: No such file "
            "or directory\\n\n"
            "I reserveblocks: Ramdump is disabled, deleting ramdump output file: "
            "/data/vendor/ramdump/apq/00/RAMDUMP_OUTPUT\\n\n");

  // A "disable" request on its first line wins over a later "enable"; the reserved file and
  // the outputs go, and deleting the reserved file is the result.
  set_misc_item(device, 3216, "EnAb");
  set_misc_item(device, 3184, std::string(24, '\x33'));
  device.write_file(kStatus, "disable\nenable\n", 0666);
  device.write_file(kReserved, "reserved");
  device.write_file(kOutput, "out");
  device.write_file(kMessage, "msg");
  device.clear_log();
  r = device.run({"-a"});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(misc_item(device, 3184, 24), std::string(24, '\0'));
  EXPECT_EQ(misc_item(device, 3216, 4), "DiSa");
  EXPECT_TRUE(contains(tool_log(device), "I reserveblocks: Disabling ramdump\\n\n"));
  for (const char* gone : {kReserved, kOutput, kMessage, kOutDir, "/data/vendor/ramdump/apq"}) {
    EXPECT_FALSE(device.exists(gone)) << gone;
  }
}

TEST(BootEntry, EnableRequestAndEnableFull) {
  FakeDevice device(data_device(16 * kGiB));
  REQUIRE_DEVICE(device);
  // A present reserved file with nothing stored keeps the cycle short: "No ramdump found".
  device.write_file(kReserved, std::string(8 * 4096, '\xFF'));
  set_misc_item(device, 3216, "DiSa");
  device.write_file(kStatus, "enabled", 0666);  // a prefix test: this enables
  RunResult r = device.run({"-a"});
  EXPECT_EQ(r.status, 255);
  EXPECT_EQ(misc_item(device, 3216, 4), "EnAb");
  std::string log = tool_log(device);
  EXPECT_TRUE(contains(log, "I reserveblocks: Enabling ramdump\\n\n")) << log;
  EXPECT_TRUE(contains(log, "E reserveblocks: No ramdump found, exiting\\n\n")) << log;
  EXPECT_EQ(device.property("debug.kvo.kvdump"), "fail");
  EXPECT_EQ(misc_item(device, 3184, 24), std::string(20, '\0') + le32(1));

  // "enable full" enables and runs the cycle, leaving the block address item and the request
  // file alone, and exits 0 whatever the cycle did.
  set_misc_item(device, 3136, "LBA!");
  set_misc_item(device, 3216, "DiSa");
  device.write_file(kStatus, "disable", 0666);
  device.clear_log();
  r = device.run({"enable", "full"});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(misc_item(device, 3216, 4), "EnAb");
  EXPECT_EQ(misc_item(device, 3136, 4), "LBA!");
  EXPECT_EQ(device.property("debug.kvo.kvdump"), "fail");
  EXPECT_TRUE(contains(tool_log(device), "No ramdump found, exiting")) << device.log();

  // Anything but exactly "enable full" is an ordinary command line with "enable" as its block
  // file, which does not exist here.
  for (const std::vector<std::string>& args :
       {std::vector<std::string>{"enable", "fullx"}, {"enable", "full", "x"}, {"enabl", "full"}}) {
    set_misc_item(device, 3216, "DiSa");
    device.clear_log();
    r = device.run(args);
    EXPECT_EQ(r.status, 1) << args[1];
    EXPECT_EQ(misc_item(device, 3216, 4), "DiSa") << args[1];
  }
}

TEST(AutoCycle, SpaceThresholdsAndUnusableReservedFile) {
  FakeDevice device(data_device(16 * kGiB));
  REQUIRE_DEVICE(device);
  const uint64_t kCreate = 10737418240ull;
  const uint64_t kKeep = 6442450944ull;
  struct Case {
    const char* what;
    bool reserved;   // a reserved file is present
    bool immutable;  // ... but cannot be opened for writing
    uint64_t free;
    std::string log;  // expected in the tool's log
    bool disabled;
  };
  const Case cases[] = {
      {"missing, one block short of 10 GiB", false, false, kCreate - 4096,
       "E reserveblocks: Not enough space available to create ramdump reserved file: have "
       "10737414144 bytes, need 10737418240 bytes\\n\n"
       "E reserveblocks: Disabling ramdump due to not enough free space\\n\n",
       true},
      {"present, one block short of 6 GiB", true, false, kKeep - 4096,
       "E reserveblocks: Not enough space available to create ramdump output file: have "
       "6442446848 bytes, need 6442450944 bytes\\n\n"
       "E reserveblocks: Disabling ramdump due to not enough free space\\n\n",
       true},
      {"present, exactly 6 GiB", true, false, kKeep,
       "E reserveblocks: No ramdump found, exiting\\n\n", false},
      // Not writable counts as missing: the 10 GiB rule applies, and the creation fails.
      {"not writable, 8 GiB", true, true, 8 * kGiB,
       "E reserveblocks: Not enough space available to create ramdump reserved file", true},
      {"not writable, exactly 10 GiB", true, true, kCreate,
       "E reserveblocks: failed to open file:/data/vendor/ramdump/RAMDUMP_RESERVED for writing: "
       "Operation not permitted\\n\n",
       false},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    device.remove(kReserved);
    device.write_file("/data/filler.x", "");
    system(("rm -rf " + device.host_path("/data/filler")).c_str());
    if (c.reserved) device.write_file(kReserved, std::string(4 * 4096, '\xFF'));
    if (c.immutable) {
      ASSERT_EQ(system(("chattr +i " + device.host_path(kReserved)).c_str()), 0);
    }
    ASSERT_TRUE(device.set_free_space(c.free)) << device.free_space();
    set_misc_item(device, 3216, "EnAb");
    set_misc_item(device, 3184, std::string(24, '\x44'));
    device.clear_log();
    RunResult r = device.run({"-a"});
    EXPECT_EQ(r.status, 255);
    EXPECT_TRUE(contains(tool_log(device), c.log)) << device.log();
    EXPECT_EQ(misc_item(device, 3216, 4), c.disabled ? "DiSa" : "EnAb");
    if (c.disabled) {
      EXPECT_EQ(misc_item(device, 3184, 24), std::string(24, '\0'));
      EXPECT_EQ(device.exists(kReserved), c.reserved);  // disabling leaves the file
    }
    if (c.immutable) system(("chattr -i " + device.host_path(kReserved)).c_str());
  }
}

// The state word is stored armed and without a dump, other bits kept, before anything is read
// out; the dump bit of the old value decides whether there is a dump, and a re-arming after a
// read-out stores a fresh header (state 1). A small reserved file keeps it fast.
TEST(AutoCycle, StateWordAndReadOutOfASmallChain) {
  FakeDevice device(data_device(16 * kGiB));
  REQUIRE_DEVICE(device);
  struct Case {
    uint32_t state;
    uint32_t stored;
    bool dump;
  };
  const Case cases[] = {
      {1, 1, false}, {0, 1, false}, {4, 5, false}, {0x80000000u, 0x80000001u, false},
      {3, 1, true},  {2, 1, true},  {6, 1, true}};
  const std::vector<std::pair<std::string, std::string>> files = {
      {"/tmp/tz.bin", std::string(5000, '\x01')},
      {"/tmp/RAMDUMP_MSG.txt", "watchdog bite on cpu 3\n"},
      {"/tmp/ocimem.bin", std::string(100000, '\x02')}};
  const uint32_t count = 64;
  for (const Case& c : cases) {
    SCOPED_TRACE(c.state);
    std::vector<long> blocks = arm_small_reserved(device, count, 0xfeed, c.state & ~2u);
    if (c.dump) simulate_crash(device, files);
    set_misc_item(device, 3184, make_ibh(blocks[0], 4096, count, 0xfeed, c.state));
    device.set_property("debug.kvo.ramdump_new_directory", "");
    device.clear_log();
    RunResult r = device.run({"-a", "-i", "1"});
    EXPECT_EQ(r.status, c.dump ? 0 : 255);
    EXPECT_EQ(device.property("debug.kvo.kvdump"), c.dump ? "done" : "fail");
    EXPECT_EQ(device.property("debug.kvo.ramdump_new_directory"), c.dump ? kOutDir : "");
    EXPECT_EQ(stored_ibh(device), make_ibh(blocks[0], 4096, count, 0xfeed, c.stored));
    EXPECT_EQ(verify_chain(device, blocks, 0xfeed, true), "");  // re-armed with the stored CRC
    if (!c.dump) {
      EXPECT_TRUE(contains(tool_log(device), "E reserveblocks: No ramdump found, exiting\\n\n"));
      continue;
    }
    std::string out = device.read_file(kOutput);
    ASSERT_EQ(out.size(), count * 4096u);
    std::string payloads;
    for (uint32_t i = 0; i < count; ++i) payloads += out.substr(i * 4096 + 16, 4080);
    std::string stream = dump_stream(files);
    EXPECT_EQ(payloads.substr(0, stream.size()), stream);
    EXPECT_EQ(device.read_file(kMessage), files[1].second);
    EXPECT_EQ(mode_of(device, kOutDir), 0777u);
    EXPECT_EQ(mode_of(device, "/data/vendor/ramdump/apq"), 0777u);
    EXPECT_EQ(mode_of(device, kOutput), 0666u);
    EXPECT_TRUE(
        contains(tool_log(device), "I reserveblocks: Found file 'RAMDUMP_MSG.txt', size 23\\n\n"))
        << device.log();
  }
}

// One crash cycle at full size: first boot creates and arms the 4224 MiB reserved file (with
// exactly 10 GiB free), the simulated firmware stores a dump, the second boot reads it out,
// extracts the message and re-arms, the third boot finds nothing.
TEST(AutoCycle, FullCrashCycleAtFullSize) {
  FakeDevice device(data_device(16 * kGiB));
  REQUIRE_DEVICE(device);
  const uint32_t kCount = 1081344;  // 4,429,185,024 / 4096
  ASSERT_EQ(device.run({"-e"}).status, 0);

  ASSERT_TRUE(device.set_free_space(10737418240ull));
  RunResult r = device.run({"-a", "-i", "1234abcd"});
  EXPECT_EQ(r.status, 255);  // a first arming reports failure: there was nothing to collect
  EXPECT_EQ(device.property("debug.kvo.kvdump"), "fail");
  EXPECT_EQ(mode_of(device, kReserved), 0744u);
  struct stat st;
  ASSERT_EQ(stat(device.host_path(kReserved).c_str(), &st), 0);
  EXPECT_EQ(st.st_size, 4429185024);
  std::vector<long> blocks = map_file(device, kReserved, kCount);
  EXPECT_EQ(stored_ibh(device), make_ibh(blocks[0], 4096, kCount, 0x1234abcd, 1));
  EXPECT_EQ(misc_item(device, 3136, 4), std::string(4, '\xFF'));
  EXPECT_EQ(verify_chain(device, blocks, 0x1234abcd, false), "");
  system(("rm -rf " + device.host_path("/data/filler")).c_str());

  std::string message = "Kernel panic - not syncing: Fatal exception\n";
  for (int i = 0; i < 500; ++i) message += "[" + std::to_string(i) + "] call trace line\n";
  std::string big(3 << 20, '\0');
  for (size_t i = 0; i < big.size(); ++i) big[i] = static_cast<char>(i * 7 + (i >> 12));
  const std::vector<std::pair<std::string, std::string>> files = {
      {"/tmp/dmesg_tz.bin", std::string(12345, 't')},
      {"/tmp/RAMDUMP_MSG.txt", message},
      {"/tmp/DDRCS0.BIN", big}};
  simulate_crash(device, files);
  EXPECT_EQ(stored_ibh(device), make_ibh(blocks[0], 4096, kCount, 0x1234abcd, 3));

  device.clear_log();
  r = device.run({"-a", "-i", "99999999"});
  EXPECT_EQ(r.status, 0) << device.log();
  EXPECT_EQ(device.property("debug.kvo.kvdump"), "done");
  EXPECT_EQ(device.property("debug.kvo.ramdump_new_directory"), kOutDir);
  EXPECT_EQ(device.read_file(kMessage), message);
  EXPECT_EQ(stored_ibh(device), make_ibh(blocks[0], 4096, kCount, 0x1234abcd, 1));
  EXPECT_EQ(verify_chain(device, blocks, 0x1234abcd, false), "");

  // The output is every chain block in chain order as the firmware left it: the chain's
  // headers (unchanged by the re-arming with the same CRC) and the dump stream, then zeros.
  const std::string stream = dump_stream(files);
  int out_fd = open(device.host_path(kOutput).c_str(), O_RDONLY);
  int dev_fd = open(device.data_device().c_str(), O_RDONLY);
  ASSERT_GE(out_fd, 0);
  ASSERT_EQ(lseek(out_fd, 0, SEEK_END), 4429185024);
  std::string chunk(1024 * 4096, '\0');
  std::string header(16, '\0');
  size_t first_bad = kCount;
  for (uint32_t i = 0; i < kCount && first_bad == kCount; i += 1024) {
    ASSERT_EQ(pread(out_fd, &chunk[0], chunk.size(), static_cast<off_t>(i) * 4096),
              static_cast<ssize_t>(chunk.size()));
    for (uint32_t k = 0; k < 1024 && first_bad == kCount; ++k) {
      pread(dev_fd, &header[0], 16, static_cast<off_t>(blocks[i + k]) * 4096);
      size_t at = static_cast<size_t>(i + k) * 4080;
      std::string payload = at < stream.size() ? stream.substr(at, 4080) : "";
      payload.resize(4080, '\0');
      if (chunk.compare(k * 4096, 16, header) != 0 ||
          chunk.compare(k * 4096 + 16, 4080, payload) != 0) {
        first_bad = i + k;
      }
    }
  }
  close(out_fd);
  close(dev_fd);
  EXPECT_EQ(first_bad, kCount) << "first output block that differs";

  device.clear_log();
  r = device.run({"-a"});
  EXPECT_EQ(r.status, 255);
  EXPECT_EQ(device.property("debug.kvo.kvdump"), "fail");
  EXPECT_EQ(device.property("debug.kvo.ramdump_new_directory"), kOutDir);
  EXPECT_TRUE(contains(tool_log(device), "E reserveblocks: No ramdump found, exiting\\n\n"))
      << device.log();
  EXPECT_EQ(device.read_file(kMessage), message);  // the last dump stays until the next one
}

}  // namespace
