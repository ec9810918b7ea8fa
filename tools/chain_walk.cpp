#include "tools/chain_walk.h"

#include <errno.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include "misc/misc_store.h"

int pread_full(int fd, void* buf, size_t length, off_t offset) {
  uint8_t* p = static_cast<uint8_t*>(buf);
  while (length > 0) {
    ssize_t n = pread(fd, p, length, offset);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      if (n == 0) errno = 0;
      return -1;
    }
    p += n;
    length -= static_cast<size_t>(n);
    offset += n;
  }
  return 0;
}

std::string io_problem(int error) {
  return error != 0 ? strerror(error) : "unexpected end of file";
}

int read_misc_item(int fd, int item, uint8_t* out) {
  const misc_item_info& info = gPartitionInfo_MISC[item - 1];
  return pread_full(fd, out, info.length, static_cast<off_t>(info.offset));
}

int read_stored_header(int misc_fd, initial_block_header* ibh) {
  uint8_t raw[INITIAL_BLOCK_HEADER_SIZE];
  if (read_misc_item(misc_fd, 2, raw) != 0) return -1;
  *ibh = decode_initial_block_header(raw);
  return 0;
}

const char* no_chain_reason(const initial_block_header& ibh) {
  if (ibh.magic == INITIAL_BLOCK_HEADER_MAGIC) return nullptr;
  if ((ibh.magic | ibh.first_block | ibh.block_size | ibh.block_count | ibh.initial_crc |
       ibh.state) == 0) {
    return "24 zero bytes: the disabled form, it names no chain";
  }
  return "its magic is not \"BHdr\": it names no chain";
}

int walk_chain(int fd, const initial_block_header& ibh, chain_visitor visit, void* context,
               chain_walk_result* result) {
  *result = {};
  if (ibh.block_size < CHAIN_BLOCK_HEADER_SIZE) return WALK_BAD_BLOCK_SIZE;
  uint32_t block = ibh.first_block;
  uint32_t running_crc = ibh.initial_crc;
  for (uint32_t i = 0; i < ibh.block_count; ++i) {
    result->block = block;
    if (block == 0) return WALK_ENDS_EARLY;
    uint8_t raw[CHAIN_BLOCK_HEADER_SIZE];
    // A hostile header can name a block whose offset no off_t holds.
    const uint64_t offset = static_cast<uint64_t>(block) * ibh.block_size;
    if (offset > static_cast<uint64_t>(INT64_MAX)) return WALK_BEYOND_DEVICE;
    if (pread_full(fd, raw, sizeof(raw), static_cast<off_t>(offset)) != 0) {
      result->error = errno;
      return WALK_READ_FAILED;
    }
    chain_block_header h = decode_chain_block_header(raw);
    if (h.magic != CHAIN_BLOCK_MAGIC) {
      result->found = h.magic;
      result->expected = CHAIN_BLOCK_MAGIC;
      return WALK_BAD_MAGIC;
    }
    running_crc = chain_crc(running_crc, block, h.next_block);
    if (h.crc != running_crc) {
      result->found = h.crc;
      result->expected = running_crc;
      return WALK_BAD_CRC;
    }
    result->blocks = i + 1;
    if (visit != nullptr && !visit(context, i, block, h)) return WALK_OK;
    block = h.next_block;
  }
  result->block = block;
  return block == 0 ? WALK_OK : WALK_TOO_LONG;
}

std::string walk_problem(int status, const chain_walk_result& r, const initial_block_header& ibh) {
  char line[160];
  switch (status) {
    case WALK_READ_FAILED:
      snprintf(line, sizeof(line), "cannot read block %u (chain block %u): ", r.block, r.blocks);
      return line + io_problem(r.error);
    case WALK_BAD_MAGIC:
      snprintf(line, sizeof(line), "bad magic %08x at block %u (chain block %u)", r.found, r.block,
               r.blocks);
      break;
    case WALK_BAD_CRC:
      snprintf(line, sizeof(line), "bad CRC %08x at block %u (chain block %u), expected %08x",
               r.found, r.block, r.blocks, r.expected);
      break;
    case WALK_ENDS_EARLY:
      snprintf(line, sizeof(line), "chain ends after %u of %u blocks", r.blocks, ibh.block_count);
      break;
    case WALK_TOO_LONG:
      snprintf(line, sizeof(line), "chain goes on past its %u blocks (to block %u)",
               ibh.block_count, r.block);
      break;
    case WALK_BEYOND_DEVICE:
      snprintf(line, sizeof(line), "block %u (chain block %u): offset beyond the device", r.block,
               r.blocks);
      break;
    case WALK_BAD_BLOCK_SIZE:
      snprintf(line, sizeof(line), "block size %u is smaller than a chain block header",
               ibh.block_size);
      break;
    default:
      return "";
  }
  return line;
}
