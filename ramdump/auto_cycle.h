// The boot-time ramdump cycle.
#pragma once

#include <stdint.h>

// Makes sure the reserved file exists with room to spare on /data, arms it the first time,
// and when the firmware has marked a dump present in the stored initial block header, reads
// the dump out, extracts its message file and re-arms the chain with the stored initial CRC.
// initial_crc is used only for the first arming of a new reserved file.
// Returns 0 when a stored dump was read out without error; 1 when the mount table or the
// block device is not found; create_file's negative result when creating the reserved file
// failed; -1 otherwise, including no dump, too little space, and a first arming (even a
// successful one).
int process_auto_ramdump(uint32_t initial_crc, uint32_t progress);
