#include "base/RefusalReason.hpp"

#include <qel/common/StreamFormatters.hpp>

#include <cstdint>

namespace qel::tool {

namespace {

constexpr std::uint16_t kConnection = QelMessageFunctionQelInterfaceCmp;
constexpr std::uint16_t kSerial = QelMessageFunctionVirtualSerial;
constexpr std::uint16_t kAny = 0;

struct Row {
    std::uint16_t function;
    std::uint16_t operation;
    QelMessageStatusCodes status;
    const char* reason; ///< "$" stands for the subject
};

/// The first row that fits applies: what a status means for one request comes before what it means in general.
constexpr Row kReasons[] = {
    {kConnection, QelMessageOpGetEnclTypeAndInterfaceVersion, QelMessageStatusDaxAlreadyConnected,
     "a console with this tool type and id is connected already; choose another --tool-id"},
    {kConnection, QelMessageOpGetEnclTypeAndInterfaceVersion, QelMessageStatusTooManyConnections,
     "the server takes no more consoles, or its rules do not let this certificate in; its log says which"},
    {kConnection, QelMessageOpOpenKrogSession, QelMessageStatusKrogSessionAlreadyOpen,
     "this console has opened its session already"},
    {kConnection, QelMessageOpDaxBroadcast, QelMessageStatusConnectionNotAvailable,
     "no other console has this tool type and id"},
    {kConnection, QelMessageOpDaxBroadcast, QelMessageStatusInvalidOperation,
     "the rules of the server do not let this console send messages to others"},
    {kConnection, QelMessageOpSetGlobalModeAttribute, QelMessageStatusInvalidOperation,
     "the rules of the server do not let this console change what all consoles share"},
    {kConnection, QelMessageOpSetGlobalSaveAreaMetadata, QelMessageStatusInvalidOperation,
     "the rules of the server do not let this console change what all consoles share"},
    {kConnection, QelMessageOpDaxBroadcast, QelMessageStatusCmdFailed,
     "the addressed console takes no more messages at the moment; try again later"},

    {kSerial, QelMessageOpOpenVirtualSerialSession, QelMessageStatusConnectionNotAvailable,
     "$ is held by another console; --force takes it, --watch looks on"},
    {kSerial, QelMessageOpOpenVirtualSerialSession, QelMessageStatusInvalidOperation,
     "the rules of the server do not let this console type in $, or take it by force; --watch looks on"},
    {kSerial, QelMessageOpCloseVirtualSerialSession, QelMessageStatusInvalidOperation,
     "the rules of the server do not let this console close $ by force"},
    {kSerial, QelMessageOpOpenVirtualSerialSession, QelMessageStatusCmdFailed,
     "the command of $ cannot be started; the log of the server says why"},
    {kSerial, QelMessageOpSetupVirtualSerialSession, QelMessageStatusInvalidCmdSequence,
     "another console has taken $ in the meantime"},
    {kSerial, QelMessageOpCloseVirtualSerialSession, QelMessageStatusConnectionClosureFailure,
     "this console does not hold $"},
    {kSerial, kAny, QelMessageStatusInvalidLparId, "the server does not have $"},
    {kSerial, kAny, QelMessageStatusInvalidConnectionNumber,
     "$ does not have this serial connection; --connection 0 types, 1 to 15 watch"},

    {kAny, kAny, QelMessageStatusInvalidFunction, "the server does not know this kind of request"},
    {kAny, kAny, QelMessageStatusInvalidOperation, "the server does not know this request"},
    {kAny, kAny, QelMessageStatusInvalidDestination, "the server does not know the destination of the request"},
    {kAny, kAny, QelMessageStatusInvalidData, "the server does not accept the values in the request"},
    {kAny, kAny, QelMessageStatusInvalidCmdSequence, "the server expects another request first"},
    {kAny, kAny, QelMessageStatusCmdFailed, "the server could not carry out the request; its log may say why"},
    {kAny, kAny, QelMessageStatusCmdTimeout, "the server could not carry out the request in time; try again later"},
    {kAny, kAny, QelMessageStatusVttyBufferFull, "the partition takes no more input at the moment; try again later"},
    {kAny, kAny, QelMessageStatusIncompatibleClient, "the server does not work with this version of the program"},
    {kAny, kAny, QelMessageStatusHypervisorGenericError, "the hypervisor failed; its log may say why"},
};

struct Name {
    std::uint16_t function;
    std::uint16_t operation;
    const char* name;
};

constexpr Name kNames[] = {
    {kConnection, QelMessageOpGetEnclTypeAndInterfaceVersion, "version request"},
    {kConnection, QelMessageOpOpenKrogSession, "open session"},
    {kConnection, QelMessageOpCloseKrogSession, "close session"},
    {kConnection, QelMessageOpExchIntCapabilities, "capabilities"},
    {kConnection, QelMessageOpGetInterfaceImplementationLimits, "limits"},
    {kConnection, QelMessageOpDaxBroadcast, "broadcast"},
    {kConnection, QelMessageOpGetQelTod, "time"},
    {kConnection, QelMessageOpSetGlobalModeAttribute, "set-mode"},
    {kConnection, QelMessageOpGetGlobalModeAttribute, "get-mode"},
    {kConnection, QelMessageOpSetGlobalSaveAreaMetadata, "set-metadata"},
    {kConnection, QelMessageOpGetGlobalSaveAreaMetadata, "get-metadata"},
    {kSerial, QelMessageOpOpenVirtualSerialSession, "open serial session"},
    {kSerial, QelMessageOpCloseVirtualSerialSession, "close serial session"},
    {kSerial, QelMessageOpGetMaxVirtualSerialSessions, "max-sessions"},
    {kSerial, QelMessageOpSetupVirtualSerialSession, "set up serial session"},
};

bool fits(const Row& row, const QelMessage& response)
{
    return (row.function == kAny || row.function == response.getFunction()) &&
           (row.operation == kAny || row.operation == response.getOperation()) && row.status == response.getStatus();
}

} // namespace

std::string refusalReason(const QelMessage& response, const std::string& subject)
{
    for (const Row& row : kReasons) {
        if (!fits(row, response)) continue;
        std::string text = row.reason;
        const std::size_t place = text.find('$');
        if (place != std::string::npos) text.replace(place, 1, subject.empty() ? "the partition" : subject);
        return text;
    }
    return {};
}

std::string requestName(const QelMessage& response)
{
    for (const Name& entry : kNames) {
        if (entry.function == response.getFunction() && entry.operation == response.getOperation()) return entry.name;
    }
    return {};
}

std::string refusalText(const QelMessage& response, const std::string& subject)
{
    std::string reason = refusalReason(response, subject);
    if (reason.empty()) {
        const std::string name = requestName(response);
        reason = (name.empty() ? "the request was" : name) + " refused";
    }
    return reason + ": " + toString(response.getStatus());
}

} // namespace qel::tool
