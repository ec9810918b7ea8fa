// Finds the block device that holds a file, from the device's mount table.
#pragma once

#include "fs_mgr/fs_mgr_fstab.h"

// path must be absolute with links and dot components resolved. Returns the mount_source of
// the first record whose mount point is a prefix of path followed by "/" or the end of path
// (borrowed from table), or null. On a match *encryptable is 1 when the record may be
// encrypted, and *encrypted is 1 when it may be and "ro.crypto.state" reads "encrypted";
// without a match both are left untouched.
const char* find_block_device(const char* path, const fstab* table, int* encryptable,
                              int* encrypted);

// Loads the default mount table and finds path's block device in it. Returns 0 with *table
// (which must stay loaded while *blk_dev is used) and the outputs set, or 1 after logging
// that the table or the device was not found (a table already loaded is not released).
int resolve_block_device(const char* path, fstab** table, const char** blk_dev, int* encryptable,
                         int* encrypted);

// Whether the raw device (dev_fd, opened from blk_dev) holds the file system of the file
// (file_fd, named file in messages): the same device, or a device-mapper device whose only
// slave it is (full-disk encryption puts /data on dm-crypt over the userdata partition, sector
// for sector). Otherwise logs that the device does not hold the file and returns -1, before
// anything on the device has been read or written; 0 when it does.
int check_device_holds_file(int dev_fd, const char* blk_dev, int file_fd, const char* file);
