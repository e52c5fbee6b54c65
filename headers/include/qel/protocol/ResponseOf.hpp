#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <cstdint>
#include <ctime>
#include <memory>
#include <string>
#include <typeinfo>

/// @file
/// Which class of message answers which class of request.

namespace qel {

class QelMessageDaxBroadcastReq;
class QelMessageDaxBroadcastRsp;
class QelMessageExchIntCapabilitiesReq;
class QelMessageExchIntCapabilitiesRsp;
class QelMessageGetEnclTypeAndInterfaceVersionReq;
class QelMessageGetEnclTypeAndInterfaceVersionRsp;
class QelMessageGetGlobalModeAttributeReq;
class QelMessageGetGlobalModeAttributeRsp;
class QelMessageGetGlobalSaveAreaMetadataReq;
class QelMessageGetGlobalSaveAreaMetadataRsp;
class QelMessageGetInterfaceLimitsReq;
class QelMessageGetInterfaceLimitsRsp;
class QelMessageGetQelTodReq;
class QelMessageGetQelTodRsp;
class QelMessageInterfaceCmpCloseKrogSessionReq;
class QelMessageInterfaceCmpCloseKrogSessionRsp;
class QelMessageInterfaceCmpOpenKrogSessionReq;
class QelMessageInterfaceCmpOpenKrogSessionRsp;
class QelMessageSetGlobalModeAttributeReq;
class QelMessageSetGlobalSaveAreaMetadataReq;
class QelMessageSetGlobalSaveAreaMetadataRsp;
class QelMessageVirtualSerialCloseReq;
class QelMessageVirtualSerialCloseRsp;
class QelMessageVirtualSerialGetMaxSessionsReq;
class QelMessageVirtualSerialGetMaxSessionsRsp;
class QelMessageVirtualSerialOpenReq;
class QelMessageVirtualSerialOpenRsp;
class QelMessageVirtualSerialSetupSessionReq;
class QelMessageVirtualSerialSetupSessionRsp;

namespace protocol {

/// Names the class of the response to a request: ResponseOf<QelMessageGetQelTodReq>::type is QelMessageGetQelTodRsp.
///
/// Specialise it for requests of your own; name QelMessage, since a console knows the classes of this library only.
template <typename Request>
struct ResponseOf {
    static_assert(sizeof(Request) == 0, "no class is known for the response: use Console::exchange(), or specialise "
                                        "qel::protocol::ResponseOf for this request");
    using type = QelMessage;
};

template <>
struct ResponseOf<QelMessageGetEnclTypeAndInterfaceVersionReq> {
    using type = QelMessageGetEnclTypeAndInterfaceVersionRsp;
};
template <>
struct ResponseOf<QelMessageInterfaceCmpOpenKrogSessionReq> {
    using type = QelMessageInterfaceCmpOpenKrogSessionRsp;
};
template <>
struct ResponseOf<QelMessageInterfaceCmpCloseKrogSessionReq> {
    using type = QelMessageInterfaceCmpCloseKrogSessionRsp;
};
template <>
struct ResponseOf<QelMessageExchIntCapabilitiesReq> {
    using type = QelMessageExchIntCapabilitiesRsp;
};
template <>
struct ResponseOf<QelMessageGetInterfaceLimitsReq> {
    using type = QelMessageGetInterfaceLimitsRsp;
};
template <>
struct ResponseOf<QelMessageDaxBroadcastReq> {
    using type = QelMessageDaxBroadcastRsp;
};
template <>
struct ResponseOf<QelMessageGetQelTodReq> {
    using type = QelMessageGetQelTodRsp;
};
template <>
struct ResponseOf<QelMessageSetGlobalModeAttributeReq> {
    using type = QelMessage; // the protocol has no class for it
};
template <>
struct ResponseOf<QelMessageGetGlobalModeAttributeReq> {
    using type = QelMessageGetGlobalModeAttributeRsp;
};
template <>
struct ResponseOf<QelMessageSetGlobalSaveAreaMetadataReq> {
    using type = QelMessageSetGlobalSaveAreaMetadataRsp;
};
template <>
struct ResponseOf<QelMessageGetGlobalSaveAreaMetadataReq> {
    using type = QelMessageGetGlobalSaveAreaMetadataRsp;
};
template <>
struct ResponseOf<QelMessageVirtualSerialOpenReq> {
    using type = QelMessageVirtualSerialOpenRsp;
};
template <>
struct ResponseOf<QelMessageVirtualSerialCloseReq> {
    using type = QelMessageVirtualSerialCloseRsp;
};
template <>
struct ResponseOf<QelMessageVirtualSerialGetMaxSessionsReq> {
    using type = QelMessageVirtualSerialGetMaxSessionsRsp;
};
template <>
struct ResponseOf<QelMessageVirtualSerialSetupSessionReq> {
    using type = QelMessageVirtualSerialSetupSessionRsp;
};

/// The class of the response to a request.
template <typename Request>
using ResponseTo = typename ResponseOf<Request>::type;

namespace detail {

/// @throws ProtocolBroken, always
[[noreturn]] QEL_PROTOCOL_EXPORT void throwMalformedResponse(const QelMessage& response, const char* typeName,
                                                             const std::string& peer);

/// Turns a received response into an object of its class. The general case: the registry has done so already.
template <typename Response>
struct ResponseReader {
    static std::unique_ptr<Response> read(std::unique_ptr<QelMessage> message, const std::string& peer)
    {
        auto* const typed = dynamic_cast<Response*>(message.get());
        if (typed == nullptr) throwMalformedResponse(*message, typeid(Response).name(), peer);
        static_cast<void>(message.release());
        return std::unique_ptr<Response>(typed);
    }
};

template <>
struct ResponseReader<QelMessage> {
    static std::unique_ptr<QelMessage> read(std::unique_ptr<QelMessage> message, const std::string&) { return message; }
};

// The two responses that no registry builds from bytes.
template <>
struct QEL_PROTOCOL_EXPORT ResponseReader<QelMessageGetQelTodRsp> {
    static std::unique_ptr<QelMessageGetQelTodRsp> read(std::unique_ptr<QelMessage> message, const std::string& peer);
};
template <>
struct QEL_PROTOCOL_EXPORT ResponseReader<QelMessageGetInterfaceLimitsRsp> {
    static std::unique_ptr<QelMessageGetInterfaceLimitsRsp> read(std::unique_ptr<QelMessage> message,
                                                                 const std::string& peer);
};

} // namespace detail

/// Turns a received response with status zero into an object of its class.
/// @param message  not null
/// @param peer     for the exception
/// @return the same frame; never null
/// @throws ProtocolBroken  the message is not a Response: its payload is malformed
template <typename Response>
std::unique_ptr<Response> readResponse(std::unique_ptr<QelMessage> message, const std::string& peer = {})
{
    return detail::ResponseReader<Response>::read(std::move(message), peer);
}

/// The limits of a hypervisor. Sizes in bytes of a whole frame, except that of a broadcast, which is that of its text.
struct InterfaceLimits {
    std::uint16_t largestCommand = 0;
    std::uint16_t largestHypervisorCommand = 0;
    std::uint16_t largestBroadcast = 0;
    std::uint8_t consoles = 0; ///< that may be connected at one time
    std::uint16_t nonpersistentLocks = 0;
    std::uint16_t persistentLocks = 0;
};

/// Reads the contents of the two responses that have no accessors. Thread safety: as reading the message.
QEL_PROTOCOL_EXPORT InterfaceLimits limitsOf(const QelMessageGetInterfaceLimitsRsp& response);
/// @return seconds since 1970-01-01 00:00:00 UTC
/// @throws ProtocolBroken  the response has a month, day, hour, minute or second that does not exist
QEL_PROTOCOL_EXPORT std::time_t timeOf(const QelMessageGetQelTodRsp& response);

} // namespace protocol

} // namespace qel
