// The fixed names every mode shares: paths, property names and flag values. Nothing of this
// is configurable; the boot firmware and the boot scripts rely on each of them.
#pragma once

#include <stdint.h>

// Each file's name inside its directory goes with its path: the boot-time run reaches the files
// through the directories it opened, the messages show the paths.
#define RAMDUMP_DIR "/data/vendor/ramdump"
#define RAMDUMP_RESERVED_NAME "RAMDUMP_RESERVED"
#define RAMDUMP_RESERVED_PATH RAMDUMP_DIR "/" RAMDUMP_RESERVED_NAME
#define RAMDUMP_STATUS_NAME "RAMDUMP_STATUS"
#define RAMDUMP_STATUS_PATH RAMDUMP_DIR "/" RAMDUMP_STATUS_NAME
#define RAMDUMP_OUTPUT_PARENT_NAME "apq"
#define RAMDUMP_OUTPUT_PARENT RAMDUMP_DIR "/" RAMDUMP_OUTPUT_PARENT_NAME
#define RAMDUMP_OUTPUT_DIR_NAME "00"
#define RAMDUMP_OUTPUT_DIR RAMDUMP_OUTPUT_PARENT "/" RAMDUMP_OUTPUT_DIR_NAME
#define RAMDUMP_OUTPUT_NAME "RAMDUMP_OUTPUT"
#define RAMDUMP_OUTPUT_PATH RAMDUMP_OUTPUT_DIR "/" RAMDUMP_OUTPUT_NAME
#define RAMDUMP_MSG_NAME "RAMDUMP_MSG.txt"
#define RAMDUMP_MSG_PATH RAMDUMP_OUTPUT_DIR "/" RAMDUMP_MSG_NAME
#define RAMDUMP_KVDUMP_NAME "kvdump.rdmp"
#define RAMDUMP_KVDUMP_PATH RAMDUMP_DIR "/" RAMDUMP_KVDUMP_NAME

#define PROP_KVDUMP "debug.kvo.kvdump"
#define PROP_NEW_DIRECTORY "debug.kvo.ramdump_new_directory"

// The enable flag item, a little-endian word: "EnAb" or "DiSa". Only "DiSa" means disabled;
// anything else, zeros of a never-written partition included, counts as enabled.
constexpr uint32_t RAMDUMP_ENABLED = 0x62416E45;
constexpr uint32_t RAMDUMP_DISABLED = 0x61536944;

// The block address item's value when no block address is handed to the firmware.
constexpr uint32_t RAMDUMP_LBA_DISABLED = 0xFFFFFFFF;
