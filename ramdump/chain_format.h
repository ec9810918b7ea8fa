// The reserved-block chain, the contract with the boot firmware. Every chain block starts
// with a chain_block_header naming the next physical block; the initial_block_header, kept
// in the misc partition, names the first block. After a crash the payloads (bytes 16 to the
// end of each block) taken in chain order hold the dump stream: dump_file_records, each
// followed directly by the file's content. All fields are little-endian.
#pragma once

#include <stddef.h>
#include <stdint.h>

constexpr uint32_t CHAIN_BLOCK_MAGIC = 0x6F684342;           // "BCho"
constexpr uint32_t INITIAL_BLOCK_HEADER_MAGIC = 0x72644842;  // "BHdr"
constexpr uint32_t DUMP_FILE_MAGIC = 0x654C3146;             // "F1Le"

// State word bits of the initial block header.
constexpr uint32_t STATE_ARMED = 1;         // set by the tool when the chain is written
constexpr uint32_t STATE_DUMP_PRESENT = 2;  // set by the firmware after storing a dump

// A run of physically consecutive chain blocks is cut after this many blocks.
constexpr uint32_t MAX_RUN_BLOCKS = 1024;

constexpr size_t CHAIN_BLOCK_HEADER_SIZE = 16;
constexpr size_t INITIAL_BLOCK_HEADER_SIZE = 24;
constexpr size_t DUMP_FILE_RECORD_SIZE = 40;
constexpr size_t DUMP_FILE_NAME_SIZE = 20;

struct chain_block_header {
  uint32_t magic;
  uint32_t next_block;     // 0 ends the chain
  uint16_t reserved;       // bytes 8-9; written as 0, read by nobody
  uint16_t run_remaining;  // blocks left in this block's run, this one included
  uint32_t crc;            // chain CRC of this block
};

struct initial_block_header {
  uint32_t magic;
  uint32_t first_block;
  uint32_t block_size;
  uint32_t block_count;
  uint32_t initial_crc;  // where the chain CRC starts, not the last block's CRC
  uint32_t state;
};

struct dump_file_record {
  uint32_t magic;
  char name[DUMP_FILE_NAME_SIZE];  // NUL-terminated when well formed; never trusted to be
  uint64_t size;
  uint64_t reserved;
};

void encode_chain_block_header(const chain_block_header& h, uint8_t out[CHAIN_BLOCK_HEADER_SIZE]);
chain_block_header decode_chain_block_header(const uint8_t in[CHAIN_BLOCK_HEADER_SIZE]);

void encode_initial_block_header(const initial_block_header& h,
                                 uint8_t out[INITIAL_BLOCK_HEADER_SIZE]);
initial_block_header decode_initial_block_header(const uint8_t in[INITIAL_BLOCK_HEADER_SIZE]);

void encode_dump_file_record(const dump_file_record& r, uint8_t out[DUMP_FILE_RECORD_SIZE]);
dump_file_record decode_dump_file_record(const uint8_t in[DUMP_FILE_RECORD_SIZE]);

// The chain CRC of one block: zlib's crc32 continued from the previous block's CRC (the
// initial CRC for the first block) over LE32(block) followed by LE32(next_block).
uint32_t chain_crc(uint32_t previous_crc, uint32_t block, uint32_t next_block);

// The header of the k-th block of a run of n blocks (counted from 0): its CRC continues
// *running_crc, which advances to it. next_block is the run's next entry, or the block after
// the run for the last one.
chain_block_header make_chain_block_header(uint32_t block, uint32_t next_block, uint32_t n,
                                           uint32_t k, uint32_t* running_crc);

// Runs over a block list (physical block of logical block i at index i): consecutive entries
// that increase by exactly 1, cut after MAX_RUN_BLOCKS. Whether block i extends the run of n
// blocks that ends at i - 1:
inline bool extends_run(const int64_t* blocks, uint32_t i, uint32_t n) {
  return n > 0 && n < MAX_RUN_BLOCKS && blocks[i] == blocks[i - 1] + 1;
}
