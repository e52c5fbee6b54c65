#pragma once

#include <qel/common/QelExport.hpp>

#include <iosfwd>

namespace qel {

class QelMessage;

/// Prints a message as one short line of raw numbers, for log lines:
/// @code
/// [CID: 0x00000002, FN: 0x6003, OP: 0x0101, FL: 0x80, DL: 48, ST: 0x00000000:0000]
/// @endcode
/// The fields are caller id, function, operation, flags, payload length in bytes, status and, after the colon, status
/// detail. The payload length is decimal, all others are hexadecimal. A 24-byte header has no status detail: colon and
/// detail are left out.
///
/// State of the stream: printing leaves it in upper-case hexadecimal with fill character '0', so a plain integer that
/// is printed next appears in hexadecimal. On a stream whose locale groups digits the numbers are grouped: 0x6.003.
/// Lifetime: borrows the message, which must be alive while this is printed; print it at once, do not keep it.
/// Thread safety: as the message, which belongs to one thread at a time.
class QEL_EXPORT QelMessageIDFormatter {
public:
    explicit QelMessageIDFormatter(const QelMessage* message) noexcept : mMessage(message) {}

private:
    friend QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelMessageIDFormatter& formatter);

    const QelMessage* mMessage;
};

/// Prints all of a message on many lines: each header field with its name, the payload fields that the message's type
/// prints, and a hex dump of the whole frame.
///
/// State of the stream: as QelMessageIDFormatter.
/// Lifetime and thread safety: as QelMessageIDFormatter.
class QEL_EXPORT QelMessageDebugFormatter {
public:
    explicit QelMessageDebugFormatter(const QelMessage* message) noexcept : mMessage(message) {}

private:
    friend QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelMessageDebugFormatter& formatter);

    const QelMessage* mMessage;
};

/// Prints the line without a newline. Leaves the stream in hexadecimal, see QelMessageIDFormatter.
/// @throws std::out_of_range the header version of the message was changed to an invalid one
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelMessageIDFormatter& formatter);

/// Prints the lines. The output begins with a newline and ends with the two newlines of the hex dump. Leaves the stream
/// in hexadecimal, see QelMessageIDFormatter.
/// @throws std::out_of_range the header version of the message was changed to an invalid one
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelMessageDebugFormatter& formatter);

} // namespace qel
