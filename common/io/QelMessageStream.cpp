#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/io/QelMessageStream.hpp>

#include "LogLine.hpp"

#include <cstring>

namespace qel {

QelMessageStream::QelMessageStream(Stream& stream, QelMessageRegistry& registry) noexcept
    : mStream(stream), mRegistry(registry)
{}

std::unique_ptr<QelMessage> QelMessageStream::read()
{
    // Not initialised: clearing 16 KiB costs more than all other work on a short frame (measured). The registry reads
    // only what fill() has written.
    char buffer[QelMessage::MtuMax];

    mStream.fill(buffer, sizeof(MessageHeader));
    MessageHeader header;
    std::memcpy(&header, buffer, sizeof(header));
    const unsigned int length = header.mMsgLength;

    if (length <= sizeof(MessageHeader) || length > QelMessage::MtuMax) {
        logLine(LogLevel::Error, "QEL message stream cannot deserialize message: invalid message length ",
                decFormat(length));
        throw QelMessageValidationException("Invalid length");
    }

    mStream.fill(buffer + sizeof(MessageHeader), length - sizeof(MessageHeader));
    return mRegistry.deserialize(buffer, length);
}

void QelMessageStream::write(const QelMessage& message) { mStream.write(message.serialize(), message.msgLength()); }

} // namespace qel
