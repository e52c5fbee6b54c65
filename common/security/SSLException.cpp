#include <qel/common/StreamFormatters.hpp>
#include <qel/common/security/SSLException.hpp>

#include "LogLine.hpp"

#include <openssl/err.h>

namespace qel {

namespace {

constexpr std::size_t kErrorTextBytes = 256; // the size that ERR_error_string(3) requires

void logError(const char* file, int line, unsigned long code)
{
    if (!QelLogger::get().isLevelEnabled(LogLevel::Error)) return;
    // A local buffer: the default buffer of ERR_error_string is shared by all threads.
    char text[kErrorTextBytes];
    ERR_error_string_n(code, text, sizeof(text));
    logLine(LogLevel::Error, "[libssl] ", file, ":", decFormat(line), ": ", text);
}

} // namespace

SSLException::SSLException(const std::string& message) : std::runtime_error(message) {}

SSLException::SSLException(const char* file, int line)
    : std::runtime_error(std::string("An SSL error occurred at ") + file + ":" + std::to_string(line))
{}

// Out of line: the program then has a single type information for this class, and catching it by type works.
SSLException::~SSLException() = default;

void SSLException::flushErrorQueue()
{
    // An empty queue, the usual case, costs one check here; ERR_clear_error would visit every slot.
    const char* file = nullptr;
    int line = 0;
    while (const unsigned long code = ERR_get_error_line(&file, &line))
        logError(file, line, code);
}

} // namespace qel
