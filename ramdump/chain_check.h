// The chain integrity test (-t): walks the chain through the raw device, writing nothing.
#pragma once

#include <stdint.h>

// Starts at the physical block of block_file's logical block 0 and follows next_block links
// until one is 0, checking every magic and, up to the first mismatch, every CRC from
// initial_crc. Returns 0 when the chain was walked (a CRC mismatch is only a warning), -2 on a
// bad magic, -1 on an open, stat, seek or read failure. A chain that loops is walked forever.
int test_block_chain(const char* block_file, const char* blk_dev, uint32_t initial_crc);
