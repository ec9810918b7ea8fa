// A block file as the raw device sees it: its block size, its number of whole blocks, and the
// physical block behind each logical block.
#pragma once

#include <stdint.h>

#include "ramdump/file_ref.h"

// The block file's geometry from stat: the block size is st_blksize (the file system's, not
// the device's), count the number of whole blocks (a trailing partial block is not part of
// the chain). Returns 0, or -1 after logging "failed to stat".
int stat_block_file(const file_ref& file, int64_t* block_size, uint32_t* count, int64_t* size);

// Asks the file system for the file's extents once (FIEMAP), so that the block map is cached
// before it is walked one block at a time. Nothing depends on it succeeding.
void prefetch_block_map(int fd);

// FIBMAP (ioctl request 1) on fd: *block holds the logical block on input and the physical
// block on output (0 for a hole). Returns the ioctl's result: 0 on success, -1 with errno.
int fibmap(int fd, int* block);
