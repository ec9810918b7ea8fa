// Whole-buffer reads and writes of a descriptor, repeating on EINTR.
#pragma once

#include <stddef.h>
#include <sys/types.h>

// Reads until length bytes have arrived or the file ends; an early end is not reported.
// Returns 0, or -1 after logging a read error.
int read_retry(int fd, void* buf, size_t length);

// Writes all length bytes, continuing after partial writes. Returns 0, or -1 after logging a
// write error.
int write_retry(int fd, const void* buf, size_t length);

// Starts writing a just written range of fd back to its device without waiting for it, so
// that long sequential writes stream to the device instead of piling up for the final fsync.
void start_writeback(int fd, off64_t offset, off64_t length);

// Seeks to offset from the start of the file, repeating on EINTR; returns lseek64's result
// (the caller logs its own message on failure).
off64_t seek_retry(int fd, off64_t offset);
