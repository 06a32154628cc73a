// Symbols of the shared library are hidden unless marked TIDELINK_EXPORT.
#pragma once

#if defined(__GNUC__) || defined(__clang__)
#define TIDELINK_EXPORT __attribute__((visibility("default")))
#else
#define TIDELINK_EXPORT
#endif
