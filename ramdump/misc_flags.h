// The tool's uses of the misc items that switch the feature, each logging its own failure.
#pragma once

#include <stdint.h>

// Reads the enable flag. Only "DiSa" means disabled; a read error is logged and also counts
// as disabled.
bool read_ramdump_enabled();

// Writes RAMDUMP_ENABLED or RAMDUMP_DISABLED into the enable flag item; 0 on success.
int write_enable_flag(uint32_t value);

// Writes the disabled initial block header (24 zero bytes); 0 on success.
int write_disabled_ibh();
