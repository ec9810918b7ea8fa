// Whole-buffer reads and writes of a descriptor, repeating on EINTR.
#pragma once

#include <stddef.h>

// Reads until length bytes have arrived or the file ends; an early end is not reported.
// Returns 0, or -1 after logging a read error.
int read_retry(int fd, void* buf, size_t length);

// Writes all length bytes, continuing after partial writes. Returns 0, or -1 after logging a
// write error.
int write_retry(int fd, const void* buf, size_t length);
