// The system log as the tool sees it: its own messages under one tag through liblog, and
// the mount table reader's messages through libbase's streaming logger.
#pragma once

#include <android/log.h>

#define RB_LOG_TAG "reserveblocks"

#define RB_LOGI(...) __android_log_print(ANDROID_LOG_INFO, RB_LOG_TAG, __VA_ARGS__)
#define RB_LOGW(...) __android_log_print(ANDROID_LOG_WARN, RB_LOG_TAG, __VA_ARGS__)
#define RB_LOGE(...) __android_log_print(ANDROID_LOG_ERROR, RB_LOG_TAG, __VA_ARGS__)

// On a build host there is no log daemon: every record is appended as one line to this file,
// "<priority letter> <tag>: <message>", with a backslash and a line feed inside the message
// written as "\\" and "\n" so that each record keeps its exact bytes and stays on one line.
// When the file cannot be opened the same line goes to standard error.
#define RB_HOST_LOG_PATH "/dev/__log__"

// Sends liblog and libbase's streaming logger to the system log (on a build host: the file
// above) with INFO as the minimum severity. Called once at start-up.
void platform_init_logging();
