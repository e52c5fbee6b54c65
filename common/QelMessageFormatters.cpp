#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageFormatters.hpp>
#include <qel/common/StreamFormatters.hpp>

#include <ostream>
#include <utility>

namespace qel {

namespace {

const QelMessage::CommonHeader& headerOf(const QelMessage& message)
{
    return *reinterpret_cast<const QelMessage::CommonHeader*>(message.serialize());
}

} // namespace

std::ostream& operator<<(std::ostream& os, const QelMessageIDFormatter& formatter)
{
    const QelMessage& message = *formatter.mMessage;
    os << "[CID: " << hexFormat(message.getCallerId());
    os << ", FN: " << hexFormat(message.getFunction());
    os << ", OP: " << hexFormat(message.getOperation());
    os << ", FL: " << hexFormat(message.getFlags());
    os << ", DL: " << decFormat(message.dataLength());
    os << ", ST: " << hexFormat(message.getStatus());
    if (headerOf(message).hasExtendedFields()) os << ':' << hexFormat(message.getStatusDetail()).noPrefix();
    return os << ']';
}

std::ostream& operator<<(std::ostream& os, const QelMessageDebugFormatter& formatter)
{
    const QelMessage& message = *formatter.mMessage;
    const QelMessage::CommonHeader& header = headerOf(message);
    os << "\nEyeCatcher:     "
       << HexStringFormatter(header.mDesc, sizeof(header.mDesc) + sizeof(header.mHeaderVersion));
    os << "\nMsgLength:      " << hexFormat(message.msgLength());
    os << "\nCallerId:       " << hexFormat(message.getCallerId());
    os << "\nFunction:       " << message.getFunction();
    os << "\nOperation:      " << std::make_pair(message.getFunction(), message.getOperation());
    os << "\nFlags:          " << message.getFlags();
    os << "\nPadByteLen:     " << hexFormat(header.mPadLength);
    os << "\nDataLength:     " << hexFormat(message.dataLength());
    os << "\nStatus:         " << message.getStatus();
    if (header.hasExtendedFields()) os << "\nStatusDetail:   " << hexFormat(message.getStatusDetail());
    os << "\n\nAdditional message details:\n";
    message.pDerivedDebug(os);
    if (message.msgLength() != 0) {
        os << "\n\nCurrent raw message contents:\n"
           << HexDumpFormatter(message.serialize(), message.msgLength(), false);
    }
    return os;
}

} // namespace qel
