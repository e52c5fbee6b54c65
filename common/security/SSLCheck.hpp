#pragma once

#include <qel/common/security/SSLException.hpp>

namespace qel {

/// Reports a failed OpenSSL call: drains the error queue into the log, then throws an exception that names the caller's
/// source file and line.
[[noreturn]] inline void throwSSLError(const char* file = __builtin_FILE(), int line = __builtin_LINE())
{
    SSLException::flushErrorQueue();
    throw SSLException(file, line);
}

/// Throws unless an OpenSSL call succeeded; see throwSSLError().
/// @param succeeded  the comparison that the manual page of the call prescribes; it differs between functions
inline void checkSSL(bool succeeded, const char* file = __builtin_FILE(), int line = __builtin_LINE())
{
    if (!succeeded) throwSSLError(file, line);
}

} // namespace qel
