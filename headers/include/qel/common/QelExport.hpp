#pragma once

/// @file
/// QEL_EXPORT marks the classes and free functions that belong to the binary interface of the shared library, which is
/// built with hidden visibility. Exceptions need it too: without it, a program cannot catch them by type.

#if defined(__GNUC__)
#define QEL_EXPORT __attribute__((visibility("default")))
#else
#define QEL_EXPORT
#endif
