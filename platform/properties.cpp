#include "platform/properties.h"

#ifdef __BIONIC__
#include <android-base/properties.h>

std::string platform_get_property(const std::string& key, const std::string& default_value) {
  return android::base::GetProperty(key, default_value);
}

#else
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/write_all.h"

namespace {

// A key names a file in the property directory, so it must be a plain file name.
bool valid_key(const char* key) {
  return key != nullptr && key[0] != '\0' && key[0] != '.' && strchr(key, '/') == nullptr;
}

std::string property_path(const char* key) { return std::string(RB_HOST_PROPERTY_DIR "/") + key; }

// The value as the property service would hold it: at most PROPERTY_VALUE_MAX - 1 bytes,
// up to the first NUL.
std::string read_property(const char* key) {
  if (!valid_key(key)) return "";
  int fd = open(property_path(key).c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return "";
  char buf[PROPERTY_VALUE_MAX];
  size_t got = 0;
  while (got < sizeof(buf) - 1) {
    ssize_t n = read(fd, buf + got, sizeof(buf) - 1 - got);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    got += static_cast<size_t>(n);
  }
  close(fd);
  return std::string(buf, strnlen(buf, got));
}

}  // namespace

extern "C" int property_get(const char* key, char* value, const char* default_value) {
  std::string v = read_property(key);
  if (v.empty() && default_value != nullptr) {
    v.assign(default_value, strnlen(default_value, PROPERTY_VALUE_MAX - 1));
  }
  memcpy(value, v.data(), v.size());
  value[v.size()] = '\0';
  return static_cast<int>(v.size());
}

extern "C" int property_set(const char* key, const char* value) {
  if (!valid_key(key) || value == nullptr || strlen(value) >= PROPERTY_VALUE_MAX) return -1;
  mkdir(RB_HOST_PROPERTY_DIR, 0755);
  // Readers see either the old or the new value, never a partial one.
  std::string final_path = property_path(key);
  std::string tmp_path = std::string(RB_HOST_PROPERTY_DIR "/.") + key + ".XXXXXX";
  int fd = mkstemp(&tmp_path[0]);
  if (fd < 0) return -1;
  size_t len = strlen(value);
  bool ok = write_all(fd, value, len);
  ok = fchmod(fd, 0644) == 0 && ok;
  ok = close(fd) == 0 && ok;
  if (!ok || rename(tmp_path.c_str(), final_path.c_str()) != 0) {
    unlink(tmp_path.c_str());
    return -1;
  }
  return 0;
}

std::string platform_get_property(const std::string& key, const std::string& default_value) {
  std::string v = read_property(key.c_str());
  return v.empty() ? default_value : v;
}
#endif
