#ifndef ORVANE_UTILS_ORVANE_LOG_H
#define ORVANE_UTILS_ORVANE_LOG_H

#include <android/log.h>

// Every line of the daemon goes to the system log under one tag, and its format begins with
// "%s", filled with the name of the operation that logs. The plain macros fill it with the
// enclosing function's name; OLOG_AS names the operation explicitly where that differs.
#define ORVANE_LOG_TAG "orvane"

#define OLOG_AS(prio, op, fmt, ...) __android_log_print(prio, ORVANE_LOG_TAG, fmt, op, ##__VA_ARGS__)

#define OLOGD(fmt, ...) OLOG_AS(ANDROID_LOG_DEBUG, __func__, fmt, ##__VA_ARGS__)
#define OLOGI(fmt, ...) OLOG_AS(ANDROID_LOG_INFO, __func__, fmt, ##__VA_ARGS__)
#define OLOGW(fmt, ...) OLOG_AS(ANDROID_LOG_WARN, __func__, fmt, ##__VA_ARGS__)
#define OLOGE(fmt, ...) OLOG_AS(ANDROID_LOG_ERROR, __func__, fmt, ##__VA_ARGS__)

#endif  // ORVANE_UTILS_ORVANE_LOG_H
