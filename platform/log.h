// The system log as the tool sees it: its own messages under one tag through liblog, and
// the mount table reader's messages through libbase's streaming logger.
#pragma once

#include <android/log.h>

#define RB_LOG_TAG "reserveblocks"

#define RB_LOGI(...) __android_log_print(ANDROID_LOG_INFO, RB_LOG_TAG, __VA_ARGS__)
#define RB_LOGW(...) __android_log_print(ANDROID_LOG_WARN, RB_LOG_TAG, __VA_ARGS__)
#define RB_LOGE(...) __android_log_print(ANDROID_LOG_ERROR, RB_LOG_TAG, __VA_ARGS__)

// On a build host there is no log daemon. Every record is one line,
// "<priority letter> <tag>: <message>", with a backslash and a line feed inside the message
// written as "\\" and "\n" so that each record keeps its exact bytes and stays on one line.
// It goes to standard error, or is appended to this file when the file already exists (a fake
// device root creates it, as a phone has its log daemon); the file is never created.
#define RB_HOST_LOG_PATH "/dev/__log__"

// Sends liblog and libbase's streaming logger to the system log (on a build host: standard
// error or the file above) with INFO as the minimum severity. Called once at start-up.
void platform_init_logging();
