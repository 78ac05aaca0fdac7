// SPDX-License-Identifier: Apache-2.0
// System properties, as bionic offers them on the phone.
#pragma once

#ifdef __cplusplus
extern "C" {
#endif

#define PROP_VALUE_MAX 92

// Copies the value of name into value (at most PROP_VALUE_MAX bytes with the terminator) and
// returns its length; returns 0 with value set to "" when the property is missing.
int __system_property_get(const char* name, char* value);

#ifdef __cplusplus
}
#endif
