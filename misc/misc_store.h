// Items of the misc partition that the tool shares with the boot firmware. Each access opens
// the partition, transfers one item's bytes and closes it again; the store does not interpret
// the bytes. Messages go to standard output; results are 0, -5 (-EIO, the partition or item
// could not be opened) or -22 (-EINVAL, a null buffer or a length larger than the item).
#pragma once

#include <stdint.h>
#include <stdio.h>

struct misc_item_info {
  uint32_t id;
  uint32_t offset;  // from the start of the partition
  uint32_t length;
};

// Indexed by item number - 1; item 4 lies between items 1 and 2 on the partition.
extern const misc_item_info gPartitionInfo_MISC[4];

// The two device links of the partition, in the order they are tried.
#define MISC_PATH_PRIMARY "/dev/block/platform/msm_sdcc.1/by-name/misc"
#define MISC_PATH_SECONDARY "/dev/block/bootdevice/by-name/misc"

int mfg_open(int item, uint32_t* offset_out, uint32_t* length_out);

// Both transfer the item's full length whatever len asks for; len only guards against a
// caller expecting more than the item holds. The buffer must hold the item's length.
int mfg_emmc_read(int item, uint8_t* buf, int len);
int mfg_emmc_write(int item, const uint8_t* buf, int len);

int MISC_write_RamdumpLBA(const uint8_t* buf);     // item 1, 4 bytes
int MISC_read_RamdumpIBH(uint8_t* buf);            // item 2, 24 bytes
int MISC_write_RamdumpIBH(const uint8_t* buf);     // item 2, 24 bytes
int MISC_read_RamdumpEnable(uint8_t* buf);         // item 3, 4 bytes
int MISC_write_RamdumpEnable(const uint8_t* buf);  // item 3, 4 bytes
