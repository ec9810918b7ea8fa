// The feature switch: status (-s), enable (-e) and disable (-d), on the misc partition's
// enable flag and initial block header items.
#pragma once

// Reads the enable flag and prints "Ramdump enabled" or "Ramdump disabled"; a read error is
// logged and reported as disabled. Returns whether the feature counts as enabled.
bool print_ramdump_status();

int ramdump_status_mode();   // always 0
int ramdump_enable_mode();   // 0, or 1 when the flag cannot be written
int ramdump_disable_mode();  // 0, or 1 when an item cannot be written
