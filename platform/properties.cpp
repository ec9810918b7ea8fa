#include "platform/properties.h"

#ifdef __BIONIC__
#include <android-base/properties.h>

std::string platform_get_property(const std::string& key, const std::string& default_value) {
  return android::base::GetProperty(key, default_value);
}

#else
#include <android-base/file.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>

namespace {

// A key names a file in the property directory, so it must be a plain file name.
bool valid_key(const char* key) {
  return key != nullptr && key[0] != '\0' && key[0] != '.' && strchr(key, '/') == nullptr;
}

std::string property_path(const char* key) { return std::string(RB_HOST_PROPERTY_DIR "/") + key; }

// The value as the property service would hold it: at most PROPERTY_VALUE_MAX - 1 bytes,
// up to the first NUL. Without the directory (a build host outside a fake device root) every
// property reads as empty.
std::string read_property(const char* key) {
  std::string value;
  if (!valid_key(key) ||
      !android::base::ReadFileToString(property_path(key), &value, /*follow_symlinks=*/true)) {
    return "";
  }
  value.resize(strnlen(value.c_str(), std::min(value.size(), size_t{PROPERTY_VALUE_MAX - 1})));
  return value;
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
  // Readers see either the old or the new value, never a partial one. Without the directory
  // the set fails: nothing is created in a build host's /dev.
  std::string final_path = property_path(key);
  std::string tmp_path = std::string(RB_HOST_PROPERTY_DIR "/.") + key + ".XXXXXX";
  int fd = mkstemp(&tmp_path[0]);
  if (fd < 0) return -1;
  bool ok = android::base::WriteFully(fd, value, strlen(value));
  ok = fchmod(fd, 0644) == 0 && ok;
  // Not a unique_fd: the result of close counts, a value that did not reach the file is not
  // renamed into place.
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
