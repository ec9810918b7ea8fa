#include "ramdump/fibmap.h"

#include <linux/fs.h>
#include <sys/ioctl.h>

static_assert(FIBMAP == 1, "the block-mapping ioctl is request 1");

int fibmap(int fd, int* block) { return ioctl(fd, FIBMAP, block); }
