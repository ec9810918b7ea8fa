// Creation, arming, read-out, the integrity test and the firmware simulator, run as the real
// binaries on a real ext4 file system, checked byte by byte on the raw device.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <vector>

#include "ramdump/dump_extract.h"
#include "tests/harness/chain_checks.h"
#include "tests/harness/fake_device.h"

namespace {

const char kDir[] = "/data/vendor/ramdump";

FakeDeviceConfig data_device(uint64_t bytes = 256ull << 20) {
  FakeDeviceConfig config;
  config.data_bytes = bytes;
  return config;
}

// Allocates the files' blocks in turn, blocks_per_step at a time, then fills them: the file
// system places each step right behind the other file's last one, so runs stay short.
void grow_interleaved(FakeDevice& device, const std::vector<std::string>& paths, int steps,
                      int blocks_per_step) {
  const off_t step_bytes = 4096 * blocks_per_step;
  std::vector<int> fds;
  for (const std::string& path : paths) {
    fds.push_back(open(device.host_path(path).c_str(), O_RDWR | O_CREAT | O_TRUNC, 0644));
  }
  for (int step = 0; step < steps; ++step) {
    for (int fd : fds) ASSERT_EQ(posix_fallocate(fd, step * step_bytes, step_bytes), 0);
  }
  std::string data(steps * step_bytes, '\x77');
  for (int fd : fds) {
    ASSERT_EQ(pwrite(fd, data.data(), data.size(), 0), static_cast<ssize_t>(data.size()));
    fsync(fd);
    close(fd);
  }
}

std::string hex(uint32_t v, bool padded) {
  char buf[16];
  snprintf(buf, sizeof(buf), padded ? "0x%08x" : "0x%x", v);
  return buf;
}

// What a successful conversion prints: the device, then the header fields with the block
// size before the first block.
std::string header_lines(uint32_t magic, uint32_t block_size, uint32_t first, uint32_t count,
                         uint32_t crc, uint32_t state) {
  return std::string(USERDATA_DEVICE) + "\n" + hex(magic, true) + "\n" + hex(block_size, false) +
         "\n" + hex(first, false) + "\n" + hex(count, false) + "\n" + hex(crc, true) + "\n" +
         hex(state, true) + "\n";
}

bool has_run_longer_than(const std::vector<long>& blocks, size_t length) {
  size_t run = 1;
  for (size_t i = 1; i < blocks.size(); ++i) {
    run = blocks[i] == blocks[i - 1] + 1 ? run + 1 : 1;
    if (run > length) return true;
  }
  return false;
}

size_t device_hash(const FakeDevice& device) {
  sync();
  return std::hash<std::string>()(device.read_raw(0, 256u << 20));
}

TEST(Arming, ContiguousAndFragmentedFilesCarryTheExpectedChain) {
  FakeDevice device(data_device());
  REQUIRE_DEVICE(device);
  const std::string contiguous = std::string(kDir) + "/contiguous";
  const std::string fragmented = std::string(kDir) + "/fragmented";

  // 2500 blocks, created by the tool itself: a run longer than 1024 blocks.
  RunResult r = device.run({"-i", "12345678", "-c", "10240000", contiguous});
  ASSERT_EQ(r.status, 0) << r.err << device.log();
  std::vector<long> blocks = map_file(device, contiguous, 2500);
  EXPECT_TRUE(has_run_longer_than(blocks, 1024));
  EXPECT_EQ(r.out, header_lines(0x72644842, 4096, blocks[0], 2500, 0x12345678, 1));
  EXPECT_EQ(verify_chain(device, blocks, 0x12345678, true), "");
  EXPECT_EQ(tool_log(device),
            "I reserveblocks: Creating reserved area 10240000 bytes\\n\n"
            "I reserveblocks:   block dev: " USERDATA_DEVICE
            "\\n\n"
            "I reserveblocks: encryptable: yes\\n\n"
            "I reserveblocks:   encrypted: no\\n\n"
            "I reserveblocks: initial CRC: 12345678\\n\n"
            "I reserveblocks: initializing block chain (i=12345678)\\n\n"
            "I reserveblocks:  block size: 4096 bytes\\n\n"
            "I reserveblocks:  file size: 10240000 bytes, 2500 full blocks available\\n\n"
            "I reserveblocks: Opened " USERDATA_DEVICE
            " for writing\\n\n"
            "I reserveblocks: Success\\n\n");

  // Two files grown a block at a time in turn: many short runs.
  grow_interleaved(device, {fragmented, std::string(kDir) + "/other"}, 300, 1);
  blocks = map_file(device, fragmented, 300);
  ASSERT_FALSE(has_run_longer_than(blocks, 150)) << "the file system did not fragment the file";
  r = device.run({"-i", "0", fragmented});
  ASSERT_EQ(r.status, 0) << device.log();
  EXPECT_EQ(r.out, header_lines(0x72644842, 4096, blocks[0], 300, 0, 1));
  EXPECT_EQ(verify_chain(device, blocks, 0, true), "");

  // Re-arming with another initial CRC rewrites every CRC; the same CRC gives the same chain.
  ASSERT_EQ(device.run({"-i", "abcdef01", fragmented}).status, 0);
  EXPECT_EQ(verify_chain(device, blocks, 0xabcdef01, true), "");
}

TEST(Arming, ProgressLinesOfCreationAndArming) {
  FakeDevice device(data_device());
  REQUIRE_DEVICE(device);
  RunResult r = device.run({"-p", "-c", "81920000", std::string(kDir) + "/big"});
  ASSERT_EQ(r.status, 0) << device.log();
  EXPECT_EQ(r.err,
            "0/1250\n256/1250\n512/1250\n768/1250\n1024/1250\n1250/1250\n"
            "0/20000\n8192/20000\n16384/20000\n20000/20000\n");

  // A size with a tail: one 64 KiB chunk and one byte, read out through the raw device.
  const std::string small = std::string(kDir) + "/small";
  const std::string out = std::string(kDir) + "/small.out";
  r = device.run({"-p", "-c", "65537", "-r", out, small});
  ASSERT_EQ(r.status, 0) << device.log();
  EXPECT_EQ(r.err, "0/1\n1/1\n");  // read-out prints no progress
  EXPECT_EQ(r.out, header_lines(0, 0, 0, 0, 0, 0));
  struct stat st;
  ASSERT_EQ(stat(device.host_path(small).c_str(), &st), 0);
  EXPECT_EQ(st.st_size, 65537);
  EXPECT_EQ(st.st_mode & 07777, 0660u);
  ASSERT_EQ(stat(device.host_path(out).c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0666u);
  EXPECT_EQ(device.read_file(out), std::string(16 * 4096, '\xFF'));
}

TEST(Arming, RefusedFilesLeaveTheDeviceUntouched) {
  FakeDevice device(data_device());
  REQUIRE_DEVICE(device);
  const std::string tiny = std::string(kDir) + "/tiny";
  const std::string holey = std::string(kDir) + "/holey";
  device.write_file(tiny, std::string(100, 'x'));
  // Blocks 0-2 and 4-7 written, block 3 a hole.
  device.write_file(holey, std::string(3 * 4096, 'h'));
  int fd = open(device.host_path(holey).c_str(), O_WRONLY);
  ASSERT_EQ(pwrite(fd, std::string(4 * 4096, 'h').data(), 4 * 4096, 4 * 4096), 4 * 4096);
  fsync(fd);
  close(fd);
  ASSERT_EQ(device.map_block(holey, 3), 0);

  struct Case {
    std::string path;
    std::string message;
  };
  for (const Case& c : {Case{tiny, "E reserveblocks: 0 full blocks available in file\\n\n"},
                        Case{holey, "E reserveblocks: refusing to write to block 0\\n\n"}}) {
    size_t before = device_hash(device);
    device.clear_log();
    RunResult r = device.run({c.path});
    EXPECT_EQ(r.status, 255) << c.path;
    EXPECT_EQ(r.out, "") << c.path;
    EXPECT_NE(tool_log(device).find(c.message), std::string::npos) << device.log();
    EXPECT_EQ(device_hash(device), before) << c.path;
  }

  // Read-out does not refuse a hole: it copies block 0 of the device in its place.
  const std::string out = std::string(kDir) + "/holey.out";
  ASSERT_EQ(device.run({"-r", out, holey}).status, 0) << device.log();
  std::string copied = device.read_file(out);
  ASSERT_EQ(copied.size(), 8u * 4096);
  EXPECT_EQ(copied.substr(3 * 4096, 4096), device.read_raw(0, 4096));
  EXPECT_EQ(copied.substr(0, 4096), std::string(4096, 'h'));
}

TEST(Conversion, LookupFailuresExit1) {
  FakeDevice device(data_device(64u << 20));
  REQUIRE_DEVICE(device);
  device.write_file("/vendor/elsewhere", "x");
  struct Case {
    std::vector<std::string> args;
    bool remove_fstab;
    std::string message;
  };
  const Case cases[] = {
      {{}, false, "E reserveblocks: failed to convert (null) to absolute path: Invalid argument\n"},
      {{"/data/missing"},
       false,
       "E reserveblocks: failed to convert /data/missing to absolute path: No such file or "
       "directory\n"},
      {{"/vendor/elsewhere"},
       false,
       "E reserveblocks: Failed to find block device for /vendor/elsewhere\n"},
      {{"/vendor/elsewhere"}, true, "E reserveblocks: failed to read default fstab\\n\n"},
  };
  for (const Case& c : cases) {
    if (c.remove_fstab) device.remove("/vendor/etc/fstab.rbtest");
    device.clear_log();
    RunResult r = device.run(c.args);
    std::string shown = c.args.empty() ? "(none)" : c.args[0];
    EXPECT_EQ(r.status, 1) << shown;
    EXPECT_EQ(r.out, "") << shown;
    EXPECT_EQ(tool_log(device), c.message) << shown;
    if (c.args.empty()) {
      EXPECT_EQ(r.err.rfind("usage: reserveblocks ", 0), 0u) << r.err;
    }
  }
}

class ArmedFile : public testing::Test {
 protected:
  void SetUp() override {
    std::string why;
    if (!fake_device_supported(&why)) GTEST_SKIP() << why;
    ASSERT_EQ(device_.setup_error(), "");
    grow_interleaved(device_, {path_, std::string(kDir) + "/filler"}, 16, 4);
    RunResult r = device_.run({"-i", "5eed", path_});
    ASSERT_EQ(r.status, 0) << device_.log();
    blocks_ = map_file(device_, path_, 64);
    ASSERT_EQ(verify_chain(device_, blocks_, 0x5eed, true), "");
    device_.clear_log();
  }

  uint64_t offset_of(size_t chain_index) const {
    return static_cast<uint64_t>(blocks_[chain_index]) * 4096;
  }

  FakeDevice device_{data_device(64u << 20)};
  const std::string path_ = std::string(kDir) + "/armed";
  std::vector<long> blocks_;
};

TEST_F(ArmedFile, IntegrityTest) {
  RunResult r = device_.run({"-t", "-i", "5eed", "-r", std::string(kDir) + "/not-made", path_});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out, "");
  EXPECT_FALSE(device_.exists(std::string(kDir) + "/not-made"));  // -t wins over -r
  EXPECT_NE(tool_log(device_).find("I reserveblocks: Read 64 blocks successfully\\n\n"),
            std::string::npos)
      << device_.log();

  // A wrong initial CRC shows as a mismatch at the first block, and only there.
  device_.clear_log();
  r = device_.run({"-t", "-i", "5eef", path_});
  EXPECT_EQ(r.status, 0);
  std::string log = tool_log(device_);
  char first[128];
  snprintf(first, sizeof(first), "E reserveblocks: CRC32 mismatch at block %lx, got ", blocks_[0]);
  EXPECT_NE(log.find(first), std::string::npos) << log;
  EXPECT_EQ(log.find("CRC32 mismatch", log.find(first) + strlen(first)), std::string::npos) << log;
  EXPECT_NE(log.find("I reserveblocks: Read 64 blocks successfully\\n\n"
                     "W reserveblocks: Integrity of chain not verified due to CRC mismatch\\n\n"),
            std::string::npos)
      << log;

  // One stored CRC damaged: reported with the stored and the computed value, exit 0.
  std::string header = device_.read_raw(offset_of(5), 16);
  uint32_t good_crc = le32_at(header, 12);
  device_.write_raw(offset_of(5) + 12, std::string("\x01\x02\x03\x04", 4));
  device_.clear_log();
  r = device_.run({"-t", "-i", "5eed", path_});
  EXPECT_EQ(r.status, 0);
  char mismatch[128];
  snprintf(mismatch, sizeof(mismatch),
           "E reserveblocks: CRC32 mismatch at block %lx, got 04030201, expecting %08x\\n\n",
           blocks_[5], good_crc);
  EXPECT_NE(tool_log(device_).find(mismatch), std::string::npos) << device_.log();

  // A damaged magic ends the walk with 254.
  device_.write_raw(offset_of(9), "XCho");
  device_.clear_log();
  r = device_.run({"-t", "-i", "5eed", path_});
  EXPECT_EQ(r.status, 254);
  char bad_magic[96];
  snprintf(bad_magic, sizeof(bad_magic),
           "E reserveblocks: Bad magic at block %lx, got 6f684358\\n\n", blocks_[9]);
  EXPECT_NE(tool_log(device_).find(bad_magic), std::string::npos) << device_.log();

  // An empty file maps no block 0: nothing to walk.
  device_.write_file(std::string(kDir) + "/empty", "");
  device_.clear_log();
  r = device_.run({"-t", std::string(kDir) + "/empty"});
  EXPECT_EQ(r.status, 0);
  EXPECT_NE(tool_log(device_).find("I reserveblocks: Read 0 blocks successfully\\n\n"),
            std::string::npos)
      << device_.log();
}

TEST_F(ArmedFile, ReadOutCopiesTheRawBlocksInLogicalOrder) {
  // Mark every payload so that a block out of order or a stale cache would show.
  for (size_t i = 0; i < blocks_.size(); ++i) {
    device_.write_raw(offset_of(i) + 16, "logical block " + std::to_string(i));
  }
  const std::string out = std::string(kDir) + "/out";
  RunResult r = device_.run({"-i", "5eed", "-r", out, path_});
  ASSERT_EQ(r.status, 0) << device_.log();
  EXPECT_EQ(r.out, header_lines(0, 0, 0, 0, 0, 0));
  std::string expected;
  for (size_t i = 0; i < blocks_.size(); ++i) expected += device_.read_raw(offset_of(i), 4096);
  EXPECT_EQ(device_.read_file(out), expected);
  EXPECT_NE(tool_log(device_).find("I reserveblocks: initializing block chain (i=00005eed)\\n\n"
                                   "I reserveblocks: Opened " USERDATA_DEVICE " for reading\\n\n"
                                   "I reserveblocks: Opened " +
                                   out + " for writing\\n\nI reserveblocks: Success\\n\n"),
            std::string::npos)
      << device_.log();
}

TEST_F(ArmedFile, FirmwareSimulatorAndExtractionAgree) {
  // Store the chain's header where the firmware looks for it.
  std::string misc = device_.misc_bytes();
  misc.replace(3184, 24, make_ibh(blocks_[0], 4096, 64, 0x5eed, 1));
  write_host_file(device_.misc_host_path(), misc);

  std::string message = "Kernel panic - not syncing: simulated\n";
  for (int i = 0; i < 200; ++i) message += "line " + std::to_string(i) + " of the message\n";
  device_.write_file("/tmp/dmesg.bin", std::string(9000, '\x11'));
  device_.write_file("/tmp/RAMDUMP_MSG.txt", message);
  device_.write_file("/tmp/ddr.bin", std::string(70000, '\x22'));
  RunResult r = device_.run(
      {MISC_DEVICE, USERDATA_DEVICE, "/tmp/dmesg.bin", "/tmp/RAMDUMP_MSG.txt", "/tmp/ddr.bin"},
      "firmware_sim");
  ASSERT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(stored_ibh(device_), make_ibh(blocks_[0], 4096, 64, 0x5eed, 3));
  // The simulator writes payloads only: the headers still verify.
  EXPECT_EQ(verify_chain(device_, blocks_, 0x5eed, false), "");

  const std::string out = std::string(kDir) + "/out";
  ASSERT_EQ(device_.run({"-r", out, path_}).status, 0);
  r = device_.run_in_root([&]() {
    mkdir("/data/msg", 0777);
    return extract_ramdump_msg(out.c_str(), "/data/msg");
  });
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(device_.read_file("/data/msg/RAMDUMP_MSG.txt"), message);
  EXPECT_FALSE(device_.exists("/data/msg/dmesg.bin"));

  // A broken chain is refused, naming the block, and nothing is stored.
  device_.write_raw(offset_of(20) + 12, std::string(4, '\0'));
  misc.replace(3184, 24, make_ibh(blocks_[0], 4096, 64, 0x5eed, 1));
  write_host_file(device_.misc_host_path(), misc);
  r = device_.run({MISC_DEVICE, USERDATA_DEVICE, "/tmp/RAMDUMP_MSG.txt"}, "firmware_sim");
  EXPECT_EQ(r.status, 1);
  EXPECT_NE(r.err.find("at block " + std::to_string(blocks_[20]) + " (chain block 20)"),
            std::string::npos)
      << r.err;
  EXPECT_EQ(stored_ibh(device_), make_ibh(blocks_[0], 4096, 64, 0x5eed, 1));
}

}  // namespace
