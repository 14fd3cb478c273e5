// What libtrc.so calls in its provider, which it loads only when it must record.
#pragma once

#include <stdint.h>

// Of the parameters of trcWriteRec(), those that are recorded.
using WriteRecord = void (*)(uint64_t type, uint64_t id, const void* object, uint64_t length,
                             const void* data);

inline constexpr const char kProviderFile[] = "libtrc-provider.so";
inline constexpr const char kWriteRecord[] = "osutils_lttng_write_record";
