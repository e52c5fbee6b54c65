#pragma once

#include <qel/common/QelMessage.hpp>

#include "support/Bytes.hpp"

#include <cstdint>
#include <string>
#include <vector>

namespace qel::test {

/// A message class that publishes the protected operations of QelMessage.
class MessageProbe : public QelMessage {
public:
    using QelMessage::QelMessage;

    /// Builds a message with a payload of zeros.
    explicit MessageProbe(std::uint64_t payloadLength)
        : QelMessage(0x01020304, 0x6003, 0x0101, MsgResponseExpected, PayloadLength(payloadLength))
    {}
    /// Parses a frame.
    explicit MessageProbe(const std::vector<char>& frame)
        : QelMessage(heapCopy(frame).get(), static_cast<unsigned int>(frame.size()))
    {}
    explicit MessageProbe(const QelMessage& message) : QelMessage(message) {}

    using QelMessage::pAllocData;
    using QelMessage::pGetData;
    using QelMessage::pGetExtendedHeader;
    using QelMessage::pGetHeader;
    using QelMessage::pGetMessage;
    using QelMessage::pPayload;
    using QelMessage::pSetData;
};

/// The frame of a message as hexadecimal digits.
inline std::string frameOf(const QelMessage& message) { return hex(message.serialize(), message.msgLength()); }

/// A copy of the payload of a message, as text.
inline std::string payloadText(const QelMessage& message) { return {message.getData(), message.dataLength()}; }

} // namespace qel::test
