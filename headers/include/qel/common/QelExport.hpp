#pragma once

/// @file
/// Which symbols of the shared library its users may see. The library is built with hidden visibility; a class,
/// exception or free function that carries QEL_EXPORT is part of its binary interface. Exceptions need it above all:
/// without it a program could not catch them by type across the border of the library.

#if defined(__GNUC__)
#define QEL_EXPORT __attribute__((visibility("default")))
#else
#define QEL_EXPORT
#endif
