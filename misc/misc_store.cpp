#include "misc/misc_store.h"

#include <errno.h>

const misc_item_info gPartitionInfo_MISC[4] = {
    {1, 3136, 4},   // block address
    {2, 3184, 24},  // initial block header
    {3, 3216, 4},   // enable flag
    {4, 3160, 4},   // not used by the tool
};

namespace {

FILE* misc_stream = nullptr;

// 0: nothing opened yet; 1: the primary path is in use; 2: the secondary path is in use.
// The choice is made at the first access and kept for the life of the process.
int misc_path_state = 0;

// The stream slot is cleared on every close, so a close on an already closed stream is
// skipped rather than repeated.
void close_misc_stream() {
  if (misc_stream != nullptr) {
    fclose(misc_stream);
    misc_stream = nullptr;
  }
}

}  // namespace

int mfg_open(int item, uint32_t* offset_out, uint32_t* length_out) {
  if (static_cast<unsigned>(item) - 1u >= 4) {
    printf("Error: item number is out of range, %d\n", item);
    close_misc_stream();
    return -1;
  }
  const char* path;
  if (misc_path_state == 1) {
    path = MISC_PATH_PRIMARY;
    misc_stream = fopen(path, "rb+");
  } else if (misc_path_state == 0) {
    misc_path_state = 1;
    path = MISC_PATH_PRIMARY;
    misc_stream = fopen(path, "rb+");
    if (misc_stream == nullptr) {
      misc_path_state = 2;
      path = MISC_PATH_SECONDARY;
      misc_stream = fopen(path, "rb+");
    }
  } else {
    path = MISC_PATH_SECONDARY;
    misc_stream = fopen(path, "rb+");
  }
  if (misc_stream == nullptr) {
    printf("Error: %s open failed.\n", path);
    return -1;
  }
  const misc_item_info& info = gPartitionInfo_MISC[item - 1];
  if (info.id != static_cast<uint32_t>(item)) {
    printf("ID is not correct: mfg_item=%d, index=%d, id=%d\n", item, item - 1,
           static_cast<int>(info.id));
    close_misc_stream();
    return -1;
  }
  *offset_out = info.offset;
  *length_out = info.length;
  return 0;
}

int mfg_emmc_read(int item, uint8_t* buf, int len) {
  uint32_t offset = 0;
  uint32_t length = 0;
  int result;
  if (mfg_open(item, &offset, &length) != 0) {
    printf("Error: open partition failed, item=%d\n", item);
    result = -EIO;
  } else if (static_cast<int>(length) < len) {
    printf("Error: read data length too large, read_len=%d, data_len=%d\n", len,
           static_cast<int>(length));
    result = -EINVAL;
  } else {
    // Seek and transfer results are not checked: the firmware's items are read as they are.
    fseek(misc_stream, static_cast<long>(static_cast<int32_t>(offset)), SEEK_SET);
    size_t ignored = fread(buf, length, 1, misc_stream);
    (void)ignored;
    result = 0;
  }
  close_misc_stream();
  return result;
}

int mfg_emmc_write(int item, const uint8_t* buf, int len) {
  uint32_t offset = 0;
  uint32_t length = 0;
  int result;
  if (mfg_open(item, &offset, &length) != 0) {
    printf("Error: open partition failed, item=%d.\n", item);
    result = -EIO;
  } else if (static_cast<int>(length) < len) {
    printf("Error: write data length too large, write_len=%d, data_len=%d\n", len,
           static_cast<int>(length));
    result = -EINVAL;
  } else {
    // No flush or sync besides the close: the bytes are handed to the stream, and the
    // close writes them out.
    fseek(misc_stream, static_cast<long>(static_cast<int32_t>(offset)), SEEK_SET);
    fwrite(buf, length, 1, misc_stream);
    result = 0;
  }
  close_misc_stream();
  return result;
}

int MISC_write_RamdumpLBA(const uint8_t* buf) {
  return buf == nullptr ? -EINVAL : mfg_emmc_write(1, buf, 4);
}

int MISC_read_RamdumpIBH(uint8_t* buf) {
  return buf == nullptr ? -EINVAL : mfg_emmc_read(2, buf, 24);
}

int MISC_write_RamdumpIBH(const uint8_t* buf) {
  return buf == nullptr ? -EINVAL : mfg_emmc_write(2, buf, 24);
}

int MISC_read_RamdumpEnable(uint8_t* buf) {
  return buf == nullptr ? -EINVAL : mfg_emmc_read(3, buf, 4);
}

int MISC_write_RamdumpEnable(const uint8_t* buf) {
  return buf == nullptr ? -EINVAL : mfg_emmc_write(3, buf, 4);
}
