#include "ramdump/chain_format.h"

#include <gtest/gtest.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <vector>

#include "ramdump/arming.h"
#include "ramdump/retry_io.h"

namespace {

const int64_t kBlock = 4096;

// Arms a chain over the block list into a sparse file standing in for the raw device, with
// the same writer the arming uses, and reads every chain block back from it.
std::vector<std::vector<uint8_t>> arm(const std::vector<int64_t>& blocks, uint32_t initial_crc) {
  FILE* device = tmpfile();
  std::vector<uint8_t> buffer(MAX_RUN_BLOCKS * kBlock, 0);
  write_chain(fileno(device), blocks.data(), static_cast<uint32_t>(blocks.size()), buffer.data(),
              kBlock, initial_crc, 0);
  std::vector<std::vector<uint8_t>> read_back;
  for (int64_t b : blocks) {
    std::vector<uint8_t> block(kBlock);
    EXPECT_EQ(pread(fileno(device), block.data(), kBlock, b * kBlock), kBlock) << b;
    read_back.push_back(block);
  }
  fclose(device);
  return read_back;
}

TEST(ChainWriter, KnownChains) {
  struct expected_header {
    uint32_t next_block;
    uint16_t run_remaining;
    uint32_t crc;
  };
  struct {
    const char* what;
    std::vector<int64_t> blocks;
    uint32_t initial_crc;
    std::vector<expected_header> expected;  // of the first blocks
  } cases[] = {
      {"worked example",
       {0x1000, 0x1001, 0x2000},
       0x12345678,
       {{0x1001, 2, 0x1C1D5043}, {0x2000, 1, 0x688442A6}, {0, 1, 0x394A06EC}}},
      {"worked example from CRC 0", {0x1000, 0x1001, 0x2000}, 0, {{0x1001, 2, 0xA66687B2}}},
      // The example's last block on its own, continuing from the CRC before it.
      {"one block", {0x2000}, 0x688442A6, {{0, 1, 0x394A06EC}}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    auto blocks = arm(c.blocks, c.initial_crc);
    for (size_t i = 0; i < c.expected.size(); ++i) {
      SCOPED_TRACE(i);
      chain_block_header h = decode_chain_block_header(blocks[i].data());
      EXPECT_EQ(h.magic, CHAIN_BLOCK_MAGIC);
      EXPECT_EQ(h.next_block, c.expected[i].next_block);
      EXPECT_EQ(h.reserved, 0);
      EXPECT_EQ(h.run_remaining, c.expected[i].run_remaining);
      EXPECT_EQ(h.crc, c.expected[i].crc);
      EXPECT_EQ(std::count(blocks[i].begin() + 16, blocks[i].end(), 0), kBlock - 16);
    }
  }
}

// Runs are cut after 1024 blocks even where the physical blocks go on consecutively; the cut
// changes run_remaining only, never the links.
TEST(ChainWriter, LongRunsAreCut) {
  struct {
    const char* what;
    std::vector<int64_t> blocks;
    std::vector<uint16_t> run_lengths;
  } cases[] = {
      {"1025 consecutive and a lone block", {}, {1024, 1, 1}},
      {"2500 consecutive", {}, {1024, 1024, 452}},
      {"none consecutive", {9, 7, 5, 3}, {1, 1, 1, 1}},
  };
  for (int64_t b = 100; b < 100 + 1025; ++b) cases[0].blocks.push_back(b);
  cases[0].blocks.push_back(5000);
  for (int64_t b = 7; b < 7 + 2500; ++b) cases[1].blocks.push_back(b);

  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    auto blocks = arm(c.blocks, 0xDEADBEEF);
    size_t i = 0;
    for (uint16_t n : c.run_lengths) {
      for (uint16_t k = 0; k < n; ++k, ++i) {
        chain_block_header h = decode_chain_block_header(blocks[i].data());
        ASSERT_EQ(h.run_remaining, n - k) << "block index " << i;
        ASSERT_EQ(h.next_block, i + 1 < c.blocks.size() ? c.blocks[i + 1] : 0) << i;
      }
    }
    ASSERT_EQ(i, c.blocks.size());
  }
}

// Encodes value and checks the exact bytes; then decodes those bytes and encodes them again,
// which brings back every field only if the decoder reads each one at its offset.
template <size_t N, typename T>
void check_layout(void (*encode)(const T&, uint8_t*), T (*decode)(const uint8_t*), const T& value,
                  const std::vector<uint8_t>& expected) {
  ASSERT_EQ(expected.size(), N);
  uint8_t out[N];
  encode(value, out);
  EXPECT_EQ(std::vector<uint8_t>(out, out + N), expected);
  memset(out, 0xAA, N);
  encode(decode(expected.data()), out);
  EXPECT_EQ(std::vector<uint8_t>(out, out + N), expected);
}

TEST(ChainRecords, ByteLayout) {
  const std::vector<uint8_t> chain_bytes = {'B',  'C',  'h',  'o',  0x44, 0x33, 0x22, 0x11,
                                            0x00, 0x00, 0x00, 0x04, 0xD4, 0xC3, 0xB2, 0xA1};
  check_layout<16>(encode_chain_block_header, decode_chain_block_header,
                   {CHAIN_BLOCK_MAGIC, 0x11223344, 0, 0x0400, 0xA1B2C3D4}, chain_bytes);

  const std::vector<uint8_t> initial_bytes = {'B',  'H',  'd',  'r',  0x45, 0x23, 0x01, 0x00,
                                              0x00, 0x10, 0x00, 0x00, 0x00, 0x08, 0x01, 0x00,
                                              0x0D, 0xF0, 0xFE, 0xCA, 0x01, 0x00, 0x00, 0x00};
  check_layout<24>(encode_initial_block_header, decode_initial_block_header,
                   {INITIAL_BLOCK_HEADER_MAGIC, 0x00012345, 4096, 0x10800, 0xCAFEF00D, STATE_ARMED},
                   initial_bytes);

  const std::vector<uint8_t> record_bytes = {
      'F',  '1',  'L',  'e',  'R',  'A',  'M',  'D',  'U',  'M',  'P',  '_',  'M',  'S',
      'G',  '.',  't',  'x',  't',  0,    0,    0,    0,    0,    0x08, 0x07, 0x06, 0x05,
      0x04, 0x03, 0x02, 0x01, 0x80, 0x90, 0xA0, 0xB0, 0xC0, 0xD0, 0xE0, 0xF0};
  check_layout<40>(
      encode_dump_file_record, decode_dump_file_record,
      {DUMP_FILE_MAGIC, "RAMDUMP_MSG.txt", 0x0102030405060708ull, 0xF0E0D0C0B0A09080ull},
      record_bytes);

  // The other formats' magics are not chain blocks.
  EXPECT_NE(decode_chain_block_header(initial_bytes.data()).magic, CHAIN_BLOCK_MAGIC);
  EXPECT_NE(decode_chain_block_header(record_bytes.data()).magic, CHAIN_BLOCK_MAGIC);
}

TEST(RetryIo, ShortAndEmptyTransfers) {
  FILE* f = tmpfile();
  ASSERT_NE(f, nullptr);
  int fd = fileno(f);
  const char text[] = "0123456789";
  EXPECT_EQ(write_retry(fd, text, 0), 0);
  EXPECT_EQ(write_retry(fd, text, 10), 0);
  ASSERT_EQ(lseek(fd, 0, SEEK_SET), 0);

  char buf[32];
  memset(buf, 'x', sizeof(buf));
  EXPECT_EQ(read_retry(fd, buf, 0), 0);
  EXPECT_EQ(buf[0], 'x');
  // Shorter than asked: the early end is not reported, the bytes that came are kept.
  EXPECT_EQ(read_retry(fd, buf, sizeof(buf)), 0);
  EXPECT_EQ(0, memcmp(buf, text, 10));
  EXPECT_EQ(buf[10], 'x');
  fclose(f);

  EXPECT_EQ(read_retry(-1, buf, sizeof(buf)), -1);
  EXPECT_EQ(write_retry(-1, text, 10), -1);
}

}  // namespace
