#include "ramdump/chain_format.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <string>
#include <thread>

#include "ramdump/retry_io.h"

namespace {

// Exact bytes, then the decoded bytes encoded again: every field comes back only if the decoder
// reads it at its offset.
TEST(ChainRecords, ByteLayout) {
  using namespace std::string_literals;
  auto check = [](auto encode, auto decode, const auto& value, const std::string& expected) {
    std::string out(expected.size(), '\xAA'), again = out;
    encode(value, reinterpret_cast<uint8_t*>(&out[0]));
    encode(decode(reinterpret_cast<const uint8_t*>(expected.data())),
           reinterpret_cast<uint8_t*>(&again[0]));
    EXPECT_EQ(out, expected);
    EXPECT_EQ(again, expected);
  };
  check(encode_chain_block_header, decode_chain_block_header,
        chain_block_header{CHAIN_BLOCK_MAGIC, 0x11223344, 0x5566, 0x0400, 0xA1B2C3D4},
        "BCho\x44\x33\x22\x11\x66\x55\0\x04\xD4\xC3\xB2\xA1"s);
  check(
      encode_dump_file_record, decode_dump_file_record,
      dump_file_record{DUMP_FILE_MAGIC, "RAMDUMP_MSG.txt", 0x0102030405060708ull,
                       0xF0E0D0C0B0A09080ull},
      "F1LeRAMDUMP_MSG.txt\0\0\0\0\0\x08\x07\x06\x05\x04\x03\x02\x01\x80\x90\xA0\xB0\xC0\xD0\xE0\xF0"s);
}

// A read that comes in pieces goes on to its last byte; an early end is no error (the bytes
// that came are kept); a failing read is.
TEST(RetryIo, PiecesEarlyEndAndError) {
  int pipe_fds[2];
  ASSERT_EQ(pipe(pipe_fds), 0);
  ASSERT_EQ(write_retry(pipe_fds[1], "012345678", 9), 0);
  std::thread late([&] {
    usleep(200000);
    write_retry(pipe_fds[1], "9AB", 3);
    close(pipe_fds[1]);
  });
  std::string buf(32, 'x');
  EXPECT_EQ(read_retry(pipe_fds[0], &buf[0], 10), 0);   // 9 bytes, then the last one
  EXPECT_EQ(read_retry(pipe_fds[0], &buf[10], 22), 0);  // 2 bytes, then the end
  late.join();
  close(pipe_fds[0]);
  EXPECT_EQ(buf.substr(0, 13), "0123456789ABx");
  EXPECT_EQ(read_retry(-1, &buf[0], buf.size()), -1);
}

}  // namespace
