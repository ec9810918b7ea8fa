// Preparing the reserved area for the firmware: creating the reserved file, and arming it,
// i.e. writing the chain headers of all its blocks straight into the raw block device.
#pragma once

#include <stdint.h>

#include "ramdump/chain_format.h"
#include "ramdump/file_ref.h"

// Creates or truncates the file (mode 0660) and fills it with size bytes of 0xFF, 64 KiB at a
// time, so that the file system allocates real blocks for all of it. With progress, prints
// "done/total" chunk lines on standard error every 16 MiB. Returns 0 or -1.
int create_file(const file_ref& file, int64_t size, int progress);

// Maps every block of block_file, then writes the chain's headers (followed by zeroed
// payloads) into those blocks of blk_dev, one seek and one write per run of up to 1024
// blocks. On success fills *ibh with the new chain's initial block header (state armed) and
// returns 0; otherwise returns -1 and leaves *ibh untouched, with nothing written when blk_dev
// does not hold the file. A run that fails to be written is logged but does not change the
// result: the integrity test shows a damaged chain.
int raw_write_blocks(const file_ref& block_file, const char* blk_dev, initial_block_header* ibh,
                     uint32_t initial_crc, int progress);

// Writes the chain over the block list (physical block of logical block i at index i, count
// of at least 1) through the device, run after run, with "done/total" progress lines on
// standard error every 8192 blocks when progress is on. A run that fails to be written is
// logged and the next one is written all the same.
void write_chain(int dev_fd, const int64_t* list, uint32_t count, uint8_t* buffer,
                 int64_t block_size, uint32_t initial_crc, int progress);

// Writes the headers of one run of n blocks, starting at the list entry first, through the
// device; next_block follows the run (0 after the last run). *running_crc advances over the
// run. buffer holds MAX_RUN_BLOCKS zeroed blocks; only each slot's first 16 bytes are ever
// written. Returns the write's result; callers ignore it.
int write_contiguous_headers(int dev_fd, const int64_t* first, uint32_t n, uint32_t next_block,
                             uint8_t* buffer, int64_t block_size, uint32_t* running_crc);
