#pragma once

#include <qel/common/QelExport.hpp>

#include <iosfwd>

namespace qel {

class QelMessage;

/// Prints a message as one short line of raw numbers, for log lines:
/// @code
/// [CID: 0x00000002, FN: 0x6003, OP: 0x0101, FL: 0x80, DL: 48, ST: 0x00000000:0000]
/// @endcode
/// Caller id, function, operation, flags, payload length in bytes (decimal, all else is hexadecimal), status and, from
/// the colon on, the status detail, which a 24-byte header does not have.
/// Lifetime: borrows the message, which must be alive while this is printed; stream it at once, do not keep it.
class QEL_EXPORT QelMessageIDFormatter {
public:
    explicit QelMessageIDFormatter(const QelMessage* message) noexcept : mMessage(message) {}

private:
    friend QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelMessageIDFormatter& formatter);

    const QelMessage* mMessage;
};

/// Prints everything about a message on many lines: each header field with its name, what the message's own type says
/// about the payload, and a hex dump of the whole frame.
/// Lifetime: borrows the message, which must be alive while this is printed; stream it at once, do not keep it.
class QEL_EXPORT QelMessageDebugFormatter {
public:
    explicit QelMessageDebugFormatter(const QelMessage* message) noexcept : mMessage(message) {}

private:
    friend QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelMessageDebugFormatter& formatter);

    const QelMessage* mMessage;
};

/// Leaves the stream in upper-case hexadecimal with fill character '0', as all printing of numbers here does.
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelMessageIDFormatter& formatter);

/// Begins with a newline and ends with the two line ends of the hex dump.
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelMessageDebugFormatter& formatter);

} // namespace qel
