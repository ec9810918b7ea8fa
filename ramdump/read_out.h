// Read-out: copies the reserved blocks, in chain order, from the raw block device into a
// file. The device is read, not the file, because the firmware wrote the dump into the
// physical blocks behind the file system's back.
#pragma once

#include "ramdump/file_ref.h"

// Every block of block_file, mapped to its physical block, read from blk_dev and appended to
// out_file (created with mode 0666), each block whole with its chain header. Returns 0, or -1
// after logging the failure; a partly written out file stays. When blk_dev does not hold the
// block file, nothing is read and no out file is made. With kept_out, *kept_out is the out
// file's descriptor once it was opened (the caller closes it), or -1.
int raw_read_blocks(const file_ref& block_file, const char* blk_dev, const file_ref& out_file,
                    int* kept_out = nullptr);
