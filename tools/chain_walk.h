// Following a chain on a raw device (or an image of one) from its stored initial block header,
// as the boot firmware does: the firmware simulator and ramdump_inspect walk with this one
// piece of code, so that both refuse exactly the same chains.
#pragma once

#include <stddef.h>
#include <stdint.h>
#include <sys/types.h>

#include <string>

#include "ramdump/chain_format.h"

// Reads exactly length bytes at offset, repeating on EINTR and partial reads. Returns 0, or -1
// with errno set (0 when the file ends first).
int pread_full(int fd, void* buf, size_t length, off_t offset);

// The reason of a failed pread_full: strerror, or "unexpected end of file".
std::string io_problem(int error);

// Reads item (1 to 4) of a misc partition image or device, its full table length, into out.
// Returns 0 or -1 like pread_full.
int read_misc_item(int fd, int item, uint8_t* out);

// Reads and decodes the initial block header item of a misc partition image or device.
// Returns 0 or -1 like pread_full.
int read_stored_header(int misc_fd, initial_block_header* ibh);

// Why a stored initial block header names no chain, or nullptr when it names one.
const char* no_chain_reason(const initial_block_header& ibh);

enum chain_walk_status {
  WALK_OK = 0,
  WALK_READ_FAILED = -1,  // error holds errno, 0 when the device ended
  WALK_BAD_MAGIC = -2,
  WALK_BAD_CRC = -3,
  WALK_ENDS_EARLY = -4,  // next_block 0 before block_count blocks
  WALK_TOO_LONG = -5,    // next_block not 0 after block_count blocks (a loop, among others)
  WALK_BAD_BLOCK_SIZE = -6,
  WALK_BEYOND_DEVICE = -7,  // the block's offset exceeds any file offset
};

struct chain_walk_result {
  uint32_t blocks;           // chain blocks read and found good
  uint32_t block;            // where the walk stopped: the failing block, or the one past the end
  uint32_t found, expected;  // the magic or CRC at a bad block
  int error;
};

// Called with every good block in chain order; returning false ends the walk there (a success).
typedef bool (*chain_visitor)(void* context, uint32_t index, uint32_t block,
                              const chain_block_header& header);

// Walks the chain named by ibh through fd, at block × block_size: every magic, every CRC from
// initial_crc, and exactly block_count blocks of which only the last has next_block 0. Never
// reads more than block_count + 1 headers, so a loop ends the walk. Returns a chain_walk_status.
int walk_chain(int fd, const initial_block_header& ibh, chain_visitor visit, void* context,
               chain_walk_result* result);

// One line saying why walk_chain failed with status, e.g. "bad magic 00000000 at block 1234
// (chain block 6)".
std::string walk_problem(int status, const chain_walk_result& result,
                         const initial_block_header& ibh);
