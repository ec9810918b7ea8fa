// Conversion mode: optionally create the block file, find its block device, then arm its
// chain, read the chain out (-r) or test the chain's integrity (-t).
#pragma once

#include "ramdump/options.h"

int run_conversion(const ramdump_options& options, const char* program);
