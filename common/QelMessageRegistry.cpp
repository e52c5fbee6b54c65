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
{
    pFillTable();
}

QelMessageRegistry::QelMessageRegistry(const QelMessageRegistry& other) : mEntries(other.mEntries) { pFillTable(); }

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
    const Slot& slot = pSlot(pKey(header.getIdentifier()));
    if (slot.factory != nullptr) {
        try {
            return slot.maker != nullptr ? slot.maker(buffer, length) : (*slot.factory)(buffer, length);
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
    return pSlot(pKey(identifier)).factory;
}

/// Spreads keys, which differ in few bits.
std::size_t QelMessageRegistry::pHash(std::uint64_t key) noexcept
{
    constexpr std::uint64_t kOddFraction = 0x9E3779B97F4A7C15; // 2^64 divided by the golden ratio
    constexpr unsigned int kLowBits = 40;
    return static_cast<std::size_t>(key * kOddFraction >> kLowBits);
}

/// The slot of a key; if there is none, a free one.
inline const QelMessageRegistry::Slot& QelMessageRegistry::pSlot(std::uint64_t key) const noexcept
{
    std::size_t index = pHash(key) & mTableMask;
    while (mTable[index].key != key && mTable[index].factory != nullptr)
        index = (index + 1) & mTableMask;
    return mTable[index];
}

void QelMessageRegistry::pFillTable()
{
    std::size_t slots = 1;
    while (slots < 4 * mEntries.size())
        slots *= 2;
    mTable.resize(slots);
    mTableMask = slots - 1;
    for (const auto& entry : mEntries) {
        const std::uint64_t key = pKey(entry.first);
        std::size_t index = pHash(key) & mTableMask;
        while (mTable[index].factory != nullptr)
            index = (index + 1) & mTableMask;
        const Maker* const maker = entry.second.target<Maker>();
        mTable[index] = {key, &entry.second, maker == nullptr ? nullptr : *maker};
    }
}

std::ostream& operator<<(std::ostream& os, const QelMessageRegistry::FastHeader& header)
{
    return os << "[FN=" << hexFormat(header.mFunction) << " OP=" << hexFormat(header.mOperation)
              << " FL=" << hexFormat(header.mFlags) << ']';
}

} // namespace qel
