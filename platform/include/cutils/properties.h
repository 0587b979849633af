#pragma once
// Host stand-in for system properties, read afresh from
// $SE_DEVICE_ROOT/properties on every call.

#define PROPERTY_KEY_MAX 32
#define PROPERTY_VALUE_MAX 92

#ifdef __cplusplus
extern "C" {
#endif

// Copies the value of `key` (or `default_value` when unset; "" when that is
// null) into `value`, which must hold PROPERTY_VALUE_MAX bytes. Returns the
// length of the text written, without its NUL.
int property_get(const char* key, char* value, const char* default_value);

#ifdef __cplusplus
}
#endif
