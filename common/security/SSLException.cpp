#include <qel/common/StreamFormatters.hpp>
#include <qel/common/security/SSLException.hpp>

#include "LogLine.hpp"

#include <openssl/err.h>

namespace qel {

namespace {

constexpr std::size_t kErrorTextBytes = 256; // what ERR_error_string(3) asks for

void logError(const char* file, int line, unsigned long code)
{
    if (!QelLogger::get().isLevelEnabled(LogLevel::Error)) return;
    // A buffer of our own: the one that ERR_error_string uses otherwise is shared by all threads.
    char text[kErrorTextBytes];
    ERR_error_string_n(code, text, sizeof(text));
    logLine(LogLevel::Error, "[libssl] ", file, ":", decFormat(line), ": ", text);
}

} // namespace

SSLException::SSLException(const std::string& message) : std::runtime_error(message) {}

SSLException::SSLException(const char* file, int line)
    : std::runtime_error(std::string("An SSL error occurred at ") + file + ":" + std::to_string(line))
{}

// Out of line, so that there is one type information of this class in the whole program and catching by type works.
SSLException::~SSLException() = default;

void SSLException::flushErrorQueue()
{
    // Taking entries until there is none costs an empty queue, the usual case, a look at its head; ERR_clear_error
    // would go over all its places.
    const char* file = nullptr;
    int line = 0;
    try {
        while (const unsigned long code = ERR_get_error_line(&file, &line))
            logError(file, line, code);
    } catch (...) {
        ERR_clear_error();
        throw;
    }
}

} // namespace qel
