// System properties. On Android these are the property service's calls from libcutils and
// libbase; on a build host, which has no property service, properties.cpp supplies the same
// calls over one file per property in RB_HOST_PROPERTY_DIR (the file's content is the value;
// an absent or unreadable file reads as empty). The directory is never created: where it does
// not exist (a build host outside a fake device root) every get reads empty and every set
// fails. Every property access of the tool goes through this header.
#pragma once

#include <string>

#ifdef __BIONIC__
#include <cutils/properties.h>
#else
#define PROPERTY_VALUE_MAX 92
#define RB_HOST_PROPERTY_DIR "/dev/__properties__"

// libcutils' contract: copies the value (at most PROPERTY_VALUE_MAX - 1 bytes, terminated)
// or, when it is empty, the default; returns the length copied.
extern "C" int property_get(const char* key, char* value, const char* default_value);
// Returns 0 on success, -1 on failure.
extern "C" int property_set(const char* key, const char* value);
#endif

// libbase's GetProperty: the value, or default_value when it is empty.
std::string platform_get_property(const std::string& key, const std::string& default_value);
