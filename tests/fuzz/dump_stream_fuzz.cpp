// The dump stream filter and the message extraction. The first byte chooses the mode:
//   even: the input after three bytes is a dump stream, fed to the filter once whole and once in
//         pieces (their size from bytes 1 and 2), with the unused end of each call presented
//         again in front of the next piece; both feeds must end alike and leave the same
//         message file.
//   odd:  the input after one byte is a dump stream, cut into 4080-byte payloads behind chain
//         block headers as a read-out holds it, and extracted from that read-out file; bit 1
//         pads the last partial unit to a whole one.
// Whatever the record names say, nothing but the message file may appear, and only in the
// output directory.
#include <dirent.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "ramdump/chain_format.h"
#include "ramdump/dump_extract.h"
#include "tests/fuzz/fuzz_common.h"

namespace {

constexpr char kWanted[] = "RAMDUMP_MSG.txt";
constexpr size_t kUnit = 4096;
constexpr size_t kPayload = kUnit - CHAIN_BLOCK_HEADER_SIZE;

std::string base_dir;  // holds only out_dir
std::string out_dir;
std::string message_path;

std::string read_file(const std::string& path, bool* exists) {
  FILE* f = fopen(path.c_str(), "rb");
  *exists = f != nullptr;
  std::string bytes;
  if (f == nullptr) return bytes;
  char buf[65536];
  size_t n;
  while ((n = fread(buf, 1, sizeof(buf), f)) > 0) bytes.append(buf, n);
  fclose(f);
  return bytes;
}

// The only names allowed in a directory.
void check_directory(const std::string& dir, const char* allowed) {
  DIR* d = opendir(dir.c_str());
  if (d == nullptr) abort();
  while (const dirent* e = readdir(d)) {
    if (strcmp(e->d_name, ".") == 0 || strcmp(e->d_name, "..") == 0) continue;
    if (strcmp(e->d_name, allowed) != 0) abort();
  }
  closedir(d);
}

// Feeds the stream in pieces of at most piece bytes, carrying the unused end of each call
// into the next one as the extraction does (but from the right place). Returns the last
// result; the message file is left behind.
int64_t feed(const uint8_t* data, size_t size, size_t piece) {
  reset_dump_filter_state_for_test();
  unlink(message_path.c_str());
  FILE* out = nullptr;
  std::vector<uint8_t> pending;
  int64_t result = 0;
  size_t pos = 0;
  do {
    size_t n = size - pos < piece ? size - pos : piece;
    pending.insert(pending.end(), data + pos, data + pos + n);
    pos += n;
    result = process_data_filtered(pending.data(), static_cast<int64_t>(pending.size()), &out,
                                   kWanted, out_dir.c_str());
    if (result < 0) break;
    if (result > static_cast<int64_t>(DUMP_FILE_RECORD_SIZE) - 1) abort();
    pending.erase(pending.begin(), pending.end() - result);
  } while (pos < size);
  if (out != nullptr) fclose(out);
  return result;
}

void extract(const uint8_t* data, size_t size, bool pad_last) {
  std::string readout;
  for (size_t at = 0; at < size; at += kPayload) {
    uint8_t header[CHAIN_BLOCK_HEADER_SIZE] = {};
    encode_chain_block_header({CHAIN_BLOCK_MAGIC, 0, 0, 1, 0}, header);
    readout.append(reinterpret_cast<const char*>(header), sizeof(header));
    size_t n = size - at < kPayload ? size - at : kPayload;
    readout.append(reinterpret_cast<const char*>(data + at), n);
    if (pad_last) readout.append(kPayload - n, '\0');
  }
  int fd = memfd_create("readout", MFD_CLOEXEC);
  if (fd < 0 || write(fd, readout.data(), readout.size()) != static_cast<ssize_t>(readout.size())) {
    abort();
  }
  reset_dump_filter_state_for_test();
  unlink(message_path.c_str());
  const std::string path = "/proc/self/fd/" + std::to_string(fd);
  extract_ramdump_msg(path.c_str(), out_dir.c_str());
  close(fd);
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fuzz_quiet_logging();
  char tmpl[] = "/dev/shm/rb-dump-fuzz.XXXXXX";
  char tmpl_fallback[] = "/tmp/rb-dump-fuzz.XXXXXX";
  const char* made = mkdtemp(tmpl);
  if (made == nullptr) made = mkdtemp(tmpl_fallback);
  if (made == nullptr) abort();
  base_dir = made;
  out_dir = base_dir + "/out";
  message_path = out_dir + "/" + kWanted;
  if (mkdir(out_dir.c_str(), 0755) != 0) abort();
  // The directory is per process; whatever a run leaves goes with it.
  atexit([] {
    unlink(message_path.c_str());
    rmdir(out_dir.c_str());
    rmdir(base_dir.c_str());
  });
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 1) return 0;
  const uint8_t mode = data[0];
  if ((mode & 1) != 0) {
    extract(data + 1, size - 1, (mode & 2) != 0);
  } else {
    if (size < 3) return 0;
    const size_t piece = 1 + ((data[1] | data[2] << 8) & 0x1FFF);
    data += 3;
    size -= 3;
    bool whole_exists;
    bool pieces_exist;
    const int64_t whole = feed(data, size, size > 0 ? size : 1);
    const std::string whole_message = read_file(message_path, &whole_exists);
    const int64_t pieces = feed(data, size, piece);
    const std::string pieces_message = read_file(message_path, &pieces_exist);
    if (whole != pieces || whole_exists != pieces_exist || whole_message != pieces_message) {
      abort();
    }
  }
  check_directory(base_dir, "out");
  check_directory(out_dir, kWanted);
  return 0;
}
