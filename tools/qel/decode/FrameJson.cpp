#include "decode/FrameJson.hpp"

#include <qel/common/StreamFormatters.hpp>
#include <qel/common/TypeInfo.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Answer.hpp"
#include "base/Library.hpp"

#include <string>
#include <utility>

namespace qel::tool {

namespace {

const char* classificationName(QelMessageClassification::Value classification)
{
    switch (classification) {
    case QelMessageClassification::Request:
        return "Request";
    case QelMessageClassification::Response:
        return "Response";
    case QelMessageClassification::Async:
        return "Async";
    case QelMessageClassification::Unknown:
        break;
    }
    return "Unknown";
}

std::string payloadOf(const QelMessage& message)
{
    return message.dataLength() == 0 ? std::string() : std::string(message.getData(), message.dataLength());
}

} // namespace

nlohmann::ordered_json frameJson(const FrameDecoder::Item& item)
{
    const QelMessage& message = *item.message;
    nlohmann::ordered_json frame;
    if (!item.stream.empty()) frame["stream"] = item.stream;
    frame["offset"] = item.offset;
    frame["length"] = message.msgLength();
    frame["class"] = TypeInfo::getTypeName(message);
    frame["callerId"] = message.getCallerId();
    frame["function"] = static_cast<unsigned int>(message.getFunction());
    frame["functionText"] = toString(message.getFunction());
    frame["operation"] = static_cast<unsigned int>(message.getOperation());
    frame["operationText"] = toString(std::make_pair(message.getFunction(), message.getOperation()));
    frame["classification"] = classificationName(message.getClassification());
    frame["flags"] = static_cast<unsigned int>(message.getFlags());
    frame["status"] = static_cast<unsigned int>(message.getStatus());
    frame["statusName"] = statusName(message.getStatus());
    frame["statusDetail"] = message.getStatusDetail();
    frame["payload"] = hexDigits(payloadOf(message));
    frame["frame"] = hexDigits(std::string(message.serialize(), message.msgLength()));
    frame["dump"] = toString(message.debug());
    return frame;
}

} // namespace qel::tool
