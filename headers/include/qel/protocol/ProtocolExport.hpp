#pragma once

#include <qel/common/QelExport.hpp>

/// @file
/// QEL_PROTOCOL_EXPORT marks the classes and free functions that belong to the binary interface of libqelprotocol, as
/// QEL_EXPORT does for the common library.

#define QEL_PROTOCOL_EXPORT QEL_EXPORT
