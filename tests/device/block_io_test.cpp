// Creation, arming, read-out and the integrity test, run as the real binary on a real ext4 file
// system and checked byte by byte on the raw device.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "tests/harness/chain_checks.h"
#include "tests/harness/fake_device.h"

namespace {

const std::string kDir = "/data/vendor/ramdump/";

size_t longest_run(const std::vector<long>& blocks) {
  size_t longest = 1;
  for (size_t i = 1, run = 1; i < blocks.size(); ++i) {
    run = blocks[i] == blocks[i - 1] + 1 ? run + 1 : 1;
    longest = std::max(longest, run);
  }
  return longest;
}

// What a conversion prints: the device, then the header fields, block size before first block.
std::string header_lines(uint32_t first, uint32_t count, uint32_t crc) {
  char text[160];
  snprintf(text, sizeof(text), "%s\n0x%08x\n0x%x\n0x%x\n0x%x\n0x%08x\n0x%08x\n", USERDATA_DEVICE,
           count != 0 ? 0x72644842 : 0, count != 0 ? 4096 : 0, first, count, crc, count != 0);
  return text;
}

TEST(Arming, ContiguousAndFragmentedFiles) {
  FakeDevice device(256ull << 20);
  REQUIRE_DEVICE(device);
  // Runs longer than 1024 blocks; progress every 256 chunks of 64 KiB and every 8192 blocks.
  const std::string big = kDir + "big";
  RunResult r = device.run({"-p", "-i", "12345678", "-c", "81920000", big});
  ASSERT_EQ(r.status, 0) << device.log();
  const std::vector<long> big_blocks = map_file(device, big, 20000);
  EXPECT_GT(longest_run(big_blocks), 1024u);
  EXPECT_EQ(r.out, header_lines(big_blocks[0], 20000, 0x12345678));
  EXPECT_EQ(r.err,
            "0/1250\n256/1250\n512/1250\n768/1250\n1024/1250\n1250/1250\n"
            "0/20000\n8192/20000\n16384/20000\n20000/20000\n");
  EXPECT_EQ(verify_chain(device, big_blocks, 0x12345678, true), "");
  std::string log;
  for (const char* line : {"Creating reserved area 81920000 bytes", "  block dev: " USERDATA_DEVICE,
                           "encryptable: yes", "  encrypted: no", "initial CRC: 12345678",
                           "initializing block chain (i=12345678)", " block size: 4096 bytes",
                           " file size: 81920000 bytes, 20000 full blocks available",
                           "Opened " USERDATA_DEVICE " for writing", "Success"}) {
    log += std::string("I reserveblocks: ") + line + "\\n\n";
  }
  EXPECT_EQ(tool_log(device), log);

  // One chunk and a one-byte tail; reading the unarmed file out prints no progress, a zero header.
  const std::string small = kDir + "small", out = kDir + "small.out";
  r = device.run({"-p", "-c", "65537", "-r", out, small});
  ASSERT_EQ(r.status, 0) << device.log();
  EXPECT_EQ(r.err, "0/1\n1/1\n");
  EXPECT_EQ(r.out, header_lines(0, 0, 0));
  namespace fs = std::filesystem;
  EXPECT_EQ(fs::file_size(device.host_path(small)), 65537u);
  EXPECT_EQ(fs::status(device.host_path(small)).permissions(), fs::perms(0660));
  EXPECT_EQ(fs::status(device.host_path(out)).permissions(), fs::perms(0666));
  EXPECT_EQ(device.read_file(out), std::string(16 * 4096, '\xFF'));
  // Runs over 1024 blocks, read out in pieces of 1024 (under valgrind and emulation too).
  ASSERT_EQ(device.run({"-r", kDir + "big.out", big}).status, 0);
  EXPECT_TRUE(device.read_file(kDir + "big.out") == raw_blocks(device.data_device(), big_blocks));

  // A file allocated 4 blocks at a time alternately with another one: many short runs.
  const std::string path = kDir + "armed", data(64 * 4096, '\x77');
  int fds[] = {open(device.host_path(path).c_str(), O_RDWR | O_CREAT, 0644),
               open(device.host_path(kDir + "filler").c_str(), O_RDWR | O_CREAT, 0644)};
  for (off_t at = 0; at < 64 * 4096; at += 4 * 4096) {
    for (int fd : fds) ASSERT_EQ(posix_fallocate(fd, at, 4 * 4096), 0);
  }
  for (int fd : fds) {  // unwritten blocks would map to 0
    ASSERT_EQ(pwrite(fd, data.data(), data.size(), 0), ssize_t(data.size()));
    close(fd);
  }
  const std::vector<long> blocks = map_file(device, path, 64);
  ASSERT_LE(longest_run(blocks), 8u) << "the file system did not fragment the file";
  ASSERT_EQ(device.run({"-i", "5eed", path}).status, 0) << device.log();
  EXPECT_EQ(verify_chain(device, blocks, 0x5eed, true), "");
  auto offset_of = [&](size_t i) { return static_cast<uint64_t>(blocks[i]) * 4096; };
  // Each header differs (its CRC), so a read-out in any order but the logical one shows.
  ASSERT_EQ(device.run({"-r", kDir + "out", path}).status, 0) << device.log();
  EXPECT_TRUE(device.read_file(kDir + "out") == raw_blocks(device.data_device(), blocks));

  // The integrity test wins over -r: good; two CRCs damaged (the first reported, exit 0); a bad
  // magic (254). Returns the log after the lookup.
  auto walk = [&](int status) {
    device.clear_log();
    RunResult t = device.run({"-t", "-i", "5eed", "-r", kDir + "not-made", path});
    EXPECT_EQ(t.status, status);
    EXPECT_EQ(t.out, "");
    const std::string log = tool_log(device);
    return log.substr(log.rfind("for reading\\n\n") + 14);
  };
  const std::string walked = "I reserveblocks: Read 64 blocks successfully\\n\n";
  char mismatch[128], bad_magic[96];
  snprintf(mismatch, sizeof(mismatch),
           "E reserveblocks: CRC32 mismatch at block %lx, got 04030201, expecting %08x\\n\n",
           blocks[5], le32_at(raw_blocks(device.data_device(), {blocks[5]}, 16), 12));
  snprintf(bad_magic, sizeof(bad_magic),
           "E reserveblocks: Bad magic at block %lx, got 6f684358\\n\n", blocks[9]);
  EXPECT_EQ(walk(0), walked);
  for (size_t i : {5, 9}) device.write_raw(offset_of(i) + 12, "\x01\x02\x03\x04");
  EXPECT_EQ(walk(0),
            mismatch + walked +
                "W reserveblocks: Integrity of chain not verified due to CRC mismatch\\n\n");
  device.write_raw(offset_of(9), "XCho");
  EXPECT_EQ(walk(254), mismatch + std::string(bad_magic));
  EXPECT_FALSE(device.exists(kDir + "not-made"));
}

// Every block is mapped before anything is written: refused files (255) and lookup failures (1)
// leave their blocks and device block 0 as they were.
TEST(Conversion, RefusedFilesAndLookupFailures) {
  FakeDevice device(64ull << 20);
  REQUIRE_DEVICE(device);
  const std::string tiny = kDir + "tiny", holey = kDir + "holey";
  device.write_file(tiny, std::string(100, 'x'));
  device.write_file(holey, std::string(8 * 4096, 'h'));
  ASSERT_EQ(system(("fallocate -p -o 12288 -l 4096 " + device.host_path(holey)).c_str()), 0);
  const std::vector<long> holey_blocks = map_file(device, holey, 8);
  ASSERT_EQ(holey_blocks[3], 0);

  device.write_file("/vendor/elsewhere", "x");
  const struct {
    std::vector<std::string> args;
    int status;
    std::string log;
  } cases[] = {
      {{tiny}, 255, "0 full blocks available in file\\n\n"},
      {{holey}, 255, "refusing to write to block 0\\n\n"},
      {{}, 1, "failed to convert (null) to absolute path: Invalid argument\n"},
      {{"/data/x"}, 1, "failed to convert /data/x to absolute path: No such file or directory\n"},
      {{"/vendor/elsewhere"}, 1, "Failed to find block device for /vendor/elsewhere\n"},
  };
  for (const auto& c : cases) {
    const std::string file = c.args.empty() ? "" : c.args[0];
    const std::string before = raw_blocks(device.data_device(), map_file(device, file, 8));
    device.clear_log();
    RunResult r = device.run(c.args);
    EXPECT_EQ(r.status, c.status) << file;
    EXPECT_EQ(r.out, "") << file;
    EXPECT_EQ(r.err.rfind("usage: ", 0) == 0, c.args.empty()) << r.err;  // no operand: usage
    EXPECT_TRUE(contains(tool_log(device), "E reserveblocks: " + c.log)) << device.log();
    EXPECT_TRUE(raw_blocks(device.data_device(), map_file(device, file, 8)) == before) << file;
  }
  // The read-out copies device block 0 in place of a hole.
  ASSERT_EQ(device.run({"-r", kDir + "holey.out", holey}).status, 0) << device.log();
  const std::string copied = device.read_file(kDir + "holey.out");
  EXPECT_TRUE(copied == raw_blocks(device.data_device(), holey_blocks));
  EXPECT_EQ(copied.substr(0, 4096), std::string(4096, 'h'));
}

}  // namespace
