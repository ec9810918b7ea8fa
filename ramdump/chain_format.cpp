#include "ramdump/chain_format.h"

#include <string.h>
#include <zlib.h>

#include "ramdump/le_bytes.h"

void encode_chain_block_header(const chain_block_header& h, uint8_t out[CHAIN_BLOCK_HEADER_SIZE]) {
  put_le32(out, h.magic);
  put_le32(out + 4, h.next_block);
  put_le16(out + 8, h.reserved);
  put_le16(out + 10, h.run_remaining);
  put_le32(out + 12, h.crc);
}

chain_block_header decode_chain_block_header(const uint8_t in[CHAIN_BLOCK_HEADER_SIZE]) {
  chain_block_header h;
  h.magic = get_le32(in);
  h.next_block = get_le32(in + 4);
  h.reserved = get_le16(in + 8);
  h.run_remaining = get_le16(in + 10);
  h.crc = get_le32(in + 12);
  return h;
}

void encode_initial_block_header(const initial_block_header& h,
                                 uint8_t out[INITIAL_BLOCK_HEADER_SIZE]) {
  put_le32(out, h.magic);
  put_le32(out + 4, h.first_block);
  put_le32(out + 8, h.block_size);
  put_le32(out + 12, h.block_count);
  put_le32(out + 16, h.initial_crc);
  put_le32(out + 20, h.state);
}

initial_block_header decode_initial_block_header(const uint8_t in[INITIAL_BLOCK_HEADER_SIZE]) {
  initial_block_header h;
  h.magic = get_le32(in);
  h.first_block = get_le32(in + 4);
  h.block_size = get_le32(in + 8);
  h.block_count = get_le32(in + 12);
  h.initial_crc = get_le32(in + 16);
  h.state = get_le32(in + 20);
  return h;
}

void encode_dump_file_record(const dump_file_record& r, uint8_t out[DUMP_FILE_RECORD_SIZE]) {
  put_le32(out, r.magic);
  memcpy(out + 4, r.name, DUMP_FILE_NAME_SIZE);
  put_le64(out + 24, r.size);
  put_le64(out + 32, r.reserved);
}

dump_file_record decode_dump_file_record(const uint8_t in[DUMP_FILE_RECORD_SIZE]) {
  dump_file_record r;
  r.magic = get_le32(in);
  memcpy(r.name, in + 4, DUMP_FILE_NAME_SIZE);
  r.size = get_le64(in + 24);
  r.reserved = get_le64(in + 32);
  return r;
}

uint32_t chain_crc(uint32_t previous_crc, uint32_t block, uint32_t next_block) {
  uint8_t numbers[8];
  put_le32(numbers, block);
  put_le32(numbers + 4, next_block);
  return static_cast<uint32_t>(crc32(previous_crc, numbers, sizeof(numbers)));
}

chain_block_header make_chain_block_header(uint32_t block, uint32_t next_block, uint32_t n,
                                           uint32_t k, uint32_t* running_crc) {
  chain_block_header h;
  h.magic = CHAIN_BLOCK_MAGIC;
  h.next_block = next_block;
  h.reserved = 0;
  h.run_remaining = static_cast<uint16_t>(n - k);
  h.crc = chain_crc(*running_crc, block, next_block);
  *running_crc = h.crc;
  return h;
}
