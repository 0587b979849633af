#pragma once
// Log helpers of modem selection, the request engine and the request
// handlers: radio buffer, tag "QvAtChannel".
#include <log/log.h>

#define QV_AT_TAG "QvAtChannel"
#define QV_LOGD(...) __android_log_buf_print(LOG_ID_RADIO, ANDROID_LOG_DEBUG, QV_AT_TAG, __VA_ARGS__)
#define QV_LOGI(...) __android_log_buf_print(LOG_ID_RADIO, ANDROID_LOG_INFO, QV_AT_TAG, __VA_ARGS__)
#define QV_LOGE(...) __android_log_buf_print(LOG_ID_RADIO, ANDROID_LOG_ERROR, QV_AT_TAG, __VA_ARGS__)
