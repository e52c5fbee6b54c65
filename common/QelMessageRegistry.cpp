#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "LogLine.hpp"

#include <ostream>

namespace qel {

QelMessageRegistry::QelMessageRegistry()
    : QelMessageRegistry({
          Entry<QelMessageGetEnclTypeAndInterfaceVersionReq>(),
          Entry<QelMessageGetEnclTypeAndInterfaceVersionRsp>(),
          Entry<QelMessageInterfaceCmpOpenKrogSessionReq>(),
          Entry<QelMessageInterfaceCmpOpenKrogSessionRsp>(),
          Entry<QelMessageInterfaceCmpCloseKrogSessionReq>(),
          Entry<QelMessageInterfaceCmpCloseKrogSessionRsp>(),
          Entry<QelMessageExchIntCapabilitiesReq>(),
          Entry<QelMessageExchIntCapabilitiesRsp>(),
          Entry<QelMessageDaxBroadcastReq>(),
          Entry<QelMessageDaxBroadcastRsp>(),
          Entry<QelMessageGetGlobalModeAttributeReq>(),
          Entry<QelMessageGetGlobalModeAttributeRsp>(),
          Entry<QelMessageSetGlobalSaveAreaMetadataReq>(),
          Entry<QelMessageSetGlobalSaveAreaMetadataRsp>(),
          Entry<QelMessageGetGlobalSaveAreaMetadataReq>(),
          Entry<QelMessageGetGlobalSaveAreaMetadataRsp>(),
          Entry<QelMessageGetInterfaceLimitsReq>(),
          Entry<QelMessageGetQelTodReq>(),
          Entry<QelMessageSetGlobalModeAttributeReq>(),

          Entry<QelMessageVirtualSerialOpenReq>(),
          Entry<QelMessageVirtualSerialOpenRsp>(),
          Entry<QelMessageVirtualSerialCloseReq>(),
          Entry<QelMessageVirtualSerialCloseRsp>(),
          Entry<QelMessageVirtualSerialGetMaxSessionsReq>(),
          Entry<QelMessageVirtualSerialGetMaxSessionsRsp>(),
          Entry<QelMessageVirtualSerialSetupSessionReq>(),
          Entry<QelMessageVirtualSerialSetupSessionRsp>(),
          Entry<QelMessageVirtualSerialDataToOsAsync>(),
          Entry<QelMessageVirtualSerialDataToDaxAsync>(),
          Entry<QelMessageVirtualSerialSessionClosedAsync>(),

          Entry<QelMessageDaxBroadcastOutboundAsync>(),
          Entry<QelMessageKrogConnectionClosedAsync>(),
      })
{}

QelMessageRegistry::QelMessageRegistry(std::initializer_list<std::pair<const Identifier, Factory>> entries)
    : mEntries(entries)
{}

QelMessageRegistry::~QelMessageRegistry() = default;

std::unique_ptr<QelMessage> QelMessageRegistry::deserialize(const char* buffer, unsigned int length) const
{
    // A shorter buffer does not cover the overlay.
    if (length < sizeof(FastHeader)) {
        logLine(LogLevel::Error, "Encountered message with invalid length");
        throw QelMessageValidationException("length");
    }
    if (buffer == nullptr) throw QelMessageValidationException("i_buffer");

    const FastHeader& header = *reinterpret_cast<const FastHeader*>(buffer);
    const auto entry = mEntries.find(header.getIdentifier());
    if (entry != mEntries.end()) {
        try {
            return entry->second(buffer, length);
        } catch (const QelMessageValidationException& e) {
            logLine(LogLevel::Debug, "Failed to deserialize message ", header, ": ", e.what());
        }
    }
    try {
        return std::make_unique<QelMessage>(buffer, length);
    } catch (const QelMessageValidationException& e) {
        logLine(LogLevel::Error, "Default message deserialization failed ", header, ": ", e.what());
        throw;
    }
}

const QelMessageRegistry::Factory* QelMessageRegistry::findFactory(const Identifier& identifier) const
{
    const auto entry = mEntries.find(identifier);
    return entry == mEntries.end() ? nullptr : &entry->second;
}

std::ostream& operator<<(std::ostream& os, const QelMessageRegistry::FastHeader& header)
{
    return os << "[FN=" << hexFormat(header.mFunction) << " OP=" << hexFormat(header.mOperation)
              << " FL=" << hexFormat(header.mFlags) << ']';
}

} // namespace qel
