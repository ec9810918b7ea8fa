// The boot-time entries: the special form "enable full" and the -a mode.
#pragma once

#include <stdint.h>

#include "ramdump/options.h"

// Exactly two arguments, "enable" and "full", each matched whole.
bool is_enable_full(int argc, char** argv);

int run_enable_full(uint32_t initial_crc);
int run_auto_mode(const ramdump_options& options);
