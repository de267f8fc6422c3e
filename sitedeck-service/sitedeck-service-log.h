// The one way the service logs: every line goes to the platform log with the
// service's tag and the "file: function(line) > " prefix, so that log lines of
// every module look alike and point at their source.
#pragma once

#include "dlog.h"

#define SDS_LOG_TAG "BROWSER_SITEDECK_SERVICE"

#define SDS_LOG(prio, fmt, ...)                                                      \
  ((void)__dlog_print(LOG_ID_MAIN, (prio), SDS_LOG_TAG, "%s: %s(%d) > " fmt, __FILE_NAME__, \
                      __func__, __LINE__ __VA_OPT__(, ) __VA_ARGS__))

#define SDS_LOGE(fmt, ...) SDS_LOG(DLOG_ERROR, fmt __VA_OPT__(, ) __VA_ARGS__)
#define SDS_LOGW(fmt, ...) SDS_LOG(DLOG_WARN, fmt __VA_OPT__(, ) __VA_ARGS__)
#define SDS_LOGI(fmt, ...) SDS_LOG(DLOG_INFO, fmt __VA_OPT__(, ) __VA_ARGS__)
