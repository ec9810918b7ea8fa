// The file system's block map: the physical block of a regular file's logical block.
#pragma once

// FIBMAP (ioctl request 1) on fd: *block holds the logical block on input and the physical
// block on output (0 for a hole). Returns the ioctl's result: 0 on success, -1 with errno.
int fibmap(int fd, int* block);
