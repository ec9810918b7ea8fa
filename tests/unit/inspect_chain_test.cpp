// ramdump_inspect verify and misc, and firmware_sim's read-only and placement options, run as
// built on image files: a sparse "device" armed by the tool's own chain writer and a misc image.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "ramdump/arming.h"
#include "ramdump/chain_format.h"
#include "tests/harness/chain_checks.h"

namespace {

constexpr uint32_t kCrc = 0x5eed1234;

// Standard output and error of a program of the build, named first in command; under
// RB_TEST_WRAPPER (an emulator) when it is set.
RunResult run(const std::string& command) {
  const char* wrapper = getenv("RB_TEST_WRAPPER");
  const std::string out = testing::TempDir() + "chain_run." + std::to_string(getpid());
  const int w = system((std::string(wrapper != nullptr ? wrapper : "") + " " RB_BUILD_DIR "/" +
                        command + " >" + out + " 2>&1")
                           .c_str());
  RunResult r = {read_host_file(out), "", WIFEXITED(w) ? WEXITSTATUS(w) : -1};
  unlink(out.c_str());
  return r;
}

// Blocks in two runs of 1024 and 476, then three short ones, armed into a sparse device image,
// with a misc image that names them, and the read-out: the blocks in chain order.
struct Chain {
  std::string dir = testing::TempDir() + "chain_XXXXXX";
  std::string dev = (mkdtemp(dir.data()), dir + "/dev.img"), misc = dir + "/misc.img",
              out = dir + "/out.bin";
  std::vector<int64_t> blocks;

  Chain() {
    for (int64_t b = 100; b < 1600; ++b) blocks.push_back(b);
    blocks.insert(blocks.end(), {2500, 1700, 1701, 1702, 3000});
    const int fd = open(dev.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    std::vector<uint8_t> buffer(MAX_RUN_BLOCKS * 4096, 0);
    write_chain(fd, blocks.data(), blocks.size(), buffer.data(), 4096, kCrc, 0);
    close(fd);
    set_misc(3184, make_ibh(100, 4096, blocks.size(), kCrc, STATE_ARMED));
  }
  ~Chain() { std::filesystem::remove_all(dir); }

  void set_misc(size_t offset, const std::string& bytes) {
    std::string image = read_host_file(misc);
    image.resize(std::max<size_t>(image.size(), 4096), '\0');
    write_host_file(misc, image.replace(offset, bytes.size(), bytes));
  }
  // Changes the header of chain block i; with fix, its CRC follows the change.
  void patch(size_t i, const std::function<void(chain_block_header&)>& change, bool fix = false) {
    std::string image = read_host_file(dev);
    auto at = [&](size_t k) { return reinterpret_cast<uint8_t*>(&image[blocks[k] * 4096]); };
    chain_block_header h = decode_chain_block_header(at(i));
    change(h);
    if (fix) h.crc = chain_crc(decode_chain_block_header(at(i - 1)).crc, blocks[i], h.next_block);
    encode_chain_block_header(h, at(i));
    write_host_file(dev, image);
  }
  void read_out() {
    std::string readout, image = read_host_file(dev);
    for (int64_t b : blocks) readout += image.substr(b * 4096, 4096);
    write_host_file(out, readout);
  }
};

// ramdump_inspect verify and misc, and firmware_sim --verify-only, on a chain and misc image
// damaged in one place each; none of them changes either image.
TEST(Inspect, VerifyMiscAndFirmwareSim) {
  Chain c;
  // clang-format off
  const std::string dev = c.dev, misc = c.misc, dev_image = read_host_file(dev), misc_image = read_host_file(misc);
  auto items = [&](std::string flag, std::string ibh, std::string lba) {
    return [=, &c] { c.set_misc(3216, flag), c.set_misc(3184, ibh), c.set_misc(3136, lba); };
  };
  auto crc = [](chain_block_header& h) { h.crc ^= 1; };
  const std::string verify = "ramdump_inspect verify ", out = " " + c.out, misc_text = "ramdump_inspect misc " + misc,
                    on_device = verify + "--device " + dev + " --misc " + misc, stores = verify + "--misc " + misc + out;
  const auto state = items("disa", make_ibh(0x1234, 4096, 99, 0xabc, 0x13), "\x10\0\0\0");
  // clang-format on
  struct {
    std::function<void()> damage;
    std::string command;
    int status;
    std::vector<std::string> expected;
  } rows[] = {
      // clang-format off
      {nullptr, verify + out, 0, {"blocks: 1505\nruns: 5, longest 1024\n"
       "run lengths: 1: 2, 2-3: 1, 256-511: 1, 1024: 1\nchain block 0: CRC not checked", "result: good\n"}},
      {nullptr, verify + "--first-block 0100 --initial-crc 5eed1234" + out, 0, {"result: good\n"}},
      {nullptr, verify + "--first-block 0x65 --initial-crc 5eed1234" + out, 1,
       {"first bad block: chain block 0 (block 101): bad CRC"}},
      {[&] { c.set_misc(3184, make_ibh(100, 4096, 1505, 7, 1)); }, stores, 1,
       {"chain block 0 (block 100): bad CRC"}},
      {[&] { c.patch(500, crc); }, verify + "--json" + out, 1, {"\"blocks\": 1505, \"runs\": 5, \"longest_run\": 1024, "
       "\"run_lengths\": {\"1\": 2, \"2-3\": 1, \"256-511\": 1, \"1024\": 1}, \"block0_checked\": false, \"ok\": false, "
       "\"first_bad\": {\"chain_block\": 500, \"block\": 600, \"reason\": \"bad CRC"}},
      {[&] { c.patch(1502, [](auto& h) { h.magic = 0; }); }, verify + out, 1,
       {"chain block 1502 (block 1701): bad magic 00000000"}},
      {[&] { c.patch(700, [](auto& h) { ++h.run_remaining; }); }, verify + out, 1,
       {"chain block 700 (block 800): run_remaining 325 inside a run, expected 324"}},
      {[&] { c.patch(1500, [](auto& h) { h.run_remaining = 2; }); }, verify + out, 1,
       {"chain block 1500 (block 2500): run_remaining 2, but next_block 1700 is not block 2500 + 1"}},
      {[&] { c.patch(1504, [](auto& h) { h.next_block = 77; }, true); }, verify + out, 1,
       {"chain block 1504 (block 3000): the chain does not end: next_block 77"}},
      {[&] { c.patch(1023, [](auto& h) { h.next_block = 0; }, true); }, verify + out, 1,
       {"chain block 1023 (block 1123): next_block 0 ends the chain, but more"}},
      {[&] { c.set_misc(3184, make_ibh(100, 4096, 1506, kCrc, 1)); }, stores, 1,
       {"1505 blocks, but the stored header counts 1506"}},
      {nullptr, on_device, 0, {"device: ", "blocks: 1505\n", "result: good\n"}},
      {[&] { c.patch(1200, crc); }, on_device, 1, {"blocks: 1200\n", "chain block 1200 (block 1300): bad CRC"}},
      {[&] { c.patch(1504, [](auto& h) { h.next_block = 1700; }, true); }, on_device, 1,
       {"chain goes on past its 1505 blocks (to block 1700)"}},
      {[&] { c.set_misc(3184, make_ibh(100, 4096, 1506, kCrc, 1)); }, on_device, 1,
       {"chain ends after 1505 of 1506 blocks"}},
      {items("", "BHdx" + make_ibh(1, 2, 3, 4, 0).substr(4), ""), on_device, 1,
       {"its magic is not \"BHdr\": it names no chain"}},
      {items("DiSa", std::string(24, '\0'), "\xff\xff\xff\xff"), misc_text, 0, {"\"DiSa\": disabled\n",
       "24 zero bytes: the disabled form, it names no chain", "block address (offset 3136): ffffffff: the disable",
       "unused item (offset 3160, left alone by the tool): 00 00 00 00\n"}},
      {state, misc_text, 0, {": enabled\n", "first block  4660\n", "initial CRC  00000abc\n",
       "state        00000013: armed, dump present, other bits 00000010\n", "00000010: a block address, not"}},
      {state, "ramdump_inspect misc --json " + misc, 0, {"\"names_chain\": true, \"no_chain_reason\": null,",
       "\"state\": 19, \"state_bits\": [\"armed\",\"dump present\",\"other bits 00000010\"]},\n"}},
      {[&] { write_host_file(misc, read_host_file(misc).substr(0, 3219)); }, misc_text, 1,
       {"too short: the misc items end at byte 3220\n"}},
      {nullptr, "firmware_sim --verify-only " + misc + " " + dev, 0,
       {"chain: 1505 blocks from block 100 verified (initial CRC 5eed1234)\n"}},
      {nullptr, "firmware_sim --first-record-at 39 " + misc + " " + dev, 2, {"takes 0 or a number of at least 40\n"}},
      // clang-format on
  };
  for (const auto& row : rows) {
    if (row.damage) row.damage();
    c.read_out();
    const std::string damaged = read_host_file(dev) + read_host_file(misc);
    RunResult r = run(row.command);
    EXPECT_EQ(r.status, row.status) << row.command << "\n" << r.out;
    for (const auto& text : row.expected)
      EXPECT_TRUE(contains(r.out, text)) << row.command << r.out;
    EXPECT_TRUE(read_host_file(dev) + read_host_file(misc) == damaged) << row.command;
    write_host_file(dev, dev_image), write_host_file(misc, misc_image);
  }
}

// A filler record that puts the file's record header at each offset, which splits it another way
// across the first two payloads.
TEST(FirmwareSim, FirstRecordAt) {
  for (uint64_t at : {4079u, 4060u, 40u}) {  // 1, 20 and 4040 bytes before the end
    Chain c;
    const std::string content(5000, 'm'), file = c.dir + "/memory0.bin";
    write_host_file(file, content);
    RunResult r = run("firmware_sim --first-record-at " + std::to_string(at) + " " + c.misc + " " +
                      c.dev + " " + file);
    ASSERT_EQ(r.status, 0) << r.out;
    c.read_out();
    EXPECT_EQ(run("ramdump_inspect extract " + c.out + " " + c.dir + "/x").status, 0) << at;
    EXPECT_EQ(read_host_file(c.dir + "/x/filler.bin"), std::string(at - 40, '\0')) << at;
    EXPECT_EQ(read_host_file(c.dir + "/x/memory0.bin"), content) << at;
    EXPECT_EQ(le32_at(read_host_file(c.misc), 3184 + 20), STATE_ARMED | STATE_DUMP_PRESENT);
  }
}

}  // namespace
