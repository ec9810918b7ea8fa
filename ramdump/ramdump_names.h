// The fixed names every mode shares: paths, property names and flag values. Nothing of this
// is configurable; the boot firmware and the boot scripts rely on each of them.
#pragma once

#include <stdint.h>

#define RAMDUMP_DIR "/data/vendor/ramdump"
#define RAMDUMP_RESERVED_PATH RAMDUMP_DIR "/RAMDUMP_RESERVED"
#define RAMDUMP_STATUS_PATH RAMDUMP_DIR "/RAMDUMP_STATUS"
#define RAMDUMP_OUTPUT_PARENT RAMDUMP_DIR "/apq"
#define RAMDUMP_OUTPUT_DIR RAMDUMP_OUTPUT_PARENT "/00"
#define RAMDUMP_OUTPUT_PATH RAMDUMP_OUTPUT_DIR "/RAMDUMP_OUTPUT"
#define RAMDUMP_MSG_NAME "RAMDUMP_MSG.txt"
#define RAMDUMP_MSG_PATH RAMDUMP_OUTPUT_DIR "/" RAMDUMP_MSG_NAME
#define RAMDUMP_KVDUMP_PATH RAMDUMP_DIR "/kvdump.rdmp"

#define PROP_KVDUMP "debug.kvo.kvdump"
#define PROP_NEW_DIRECTORY "debug.kvo.ramdump_new_directory"

// The enable flag item, a little-endian word: "EnAb" or "DiSa". Only "DiSa" means disabled;
// anything else, zeros of a never-written partition included, counts as enabled.
constexpr uint32_t RAMDUMP_ENABLED = 0x62416E45;
constexpr uint32_t RAMDUMP_DISABLED = 0x61536944;

// The block address item's value when no block address is handed to the firmware.
constexpr uint32_t RAMDUMP_LBA_DISABLED = 0xFFFFFFFF;
