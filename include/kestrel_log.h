// SPDX-License-Identifier: Apache-2.0
// Every line of the daemon goes to the Android log under one tag.
#pragma once

#ifndef LOG_TAG
#define LOG_TAG "KESTRELD"
#endif
#include <log/log.h>

// Priorities as the daemon uses them: 4 progress, 5 unknown callback type, 6 failures.
#define KLOGI(...) ((void)__android_log_print(ANDROID_LOG_INFO, LOG_TAG, __VA_ARGS__))
#define KLOGW(...) ((void)__android_log_print(ANDROID_LOG_WARN, LOG_TAG, __VA_ARGS__))
#define KLOGE(...) ((void)__android_log_print(ANDROID_LOG_ERROR, LOG_TAG, __VA_ARGS__))
