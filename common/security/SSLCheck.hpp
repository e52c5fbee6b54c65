#pragma once

#include <qel/common/security/SSLException.hpp>

namespace qel {

/// Reports a failed call of OpenSSL: drains its error queue into the log, then throws an exception that names the
/// caller's source file and line.
[[noreturn]] inline void throwSSLError(const char* file = __builtin_FILE(), int line = __builtin_LINE())
{
    SSLException::flushErrorQueue();
    throw SSLException(file, line);
}

/// Throws unless a call of OpenSSL has succeeded; see throwSSLError().
/// @param succeeded  the comparison that the call's manual page prescribes; what counts as success differs by function
inline void checkSSL(bool succeeded, const char* file = __builtin_FILE(), int line = __builtin_LINE())
{
    if (!succeeded) throwSSLError(file, line);
}

} // namespace qel
