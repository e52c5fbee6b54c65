#pragma once

#include <qel/common/EndianExtensions.hpp>
#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>

#include <cstddef>
#include <functional>
#include <initializer_list>
#include <iosfwd>
#include <map>
#include <memory>
#include <tuple>
#include <utility>

namespace qel {

/// Turns received frames into objects of their message classes. It knows a factory for each identity and falls back to
/// a plain QelMessage for frames it does not know or that their own class refuses.
/// Thread safety: filled when built and never changed afterwards; any number of threads may deserialize at once.
class QEL_EXPORT QelMessageRegistry {
public:
    /// What a message is: function code, operation, classification. The same as QelMessageMetadata::getMessageID().
    using Identifier = std::tuple<unsigned short, unsigned short, QelMessageClassification::Value>;

    /// Builds a message from a frame (bytes, length), never null; throws QelMessageValidationException when it refuses
    /// the frame. Called by every thread that deserializes, without a lock.
    using Factory = std::function<std::unique_ptr<QelMessage>(const char*, unsigned int)>;

    /// The first 22 bytes of a frame, of which only the identity is read; nothing is checked.
    struct QEL_EXPORT FastHeader {
        char mReserved1[12];    //  0  not looked at
        be_uint16_t mFunction;  // 12  QelMessageFunctionCodes
        unsigned char mFlags;   // 14  QelMessageFlags
        char mReserved2[5];     // 15  not looked at
        be_uint16_t mOperation; // 20  QelMessageOpTypes

        Identifier getIdentifier() const
        {
            return {mFunction.value(), mOperation.value(),
                    QelMessageClassification::fromFlags(static_cast<QelMessageFlags>(mFlags))};
        }
    };

    /// The public registry: the 32 messages that consoles and hypervisors exchange. Not among them are the two
    /// responses that this library only builds (interface limits and time of day) and the two messages of the
    /// connection handshake, which QelInternalMessageRegistry knows.
    QelMessageRegistry();

    /// A registry with exactly these entries; of several with the same identity the first one stands.
    QelMessageRegistry(std::initializer_list<std::pair<const Identifier, Factory>> entries);

    /// A copy has the same entries. There is no assignment: others may be reading the entries.
    QelMessageRegistry(const QelMessageRegistry&) = default;
    QelMessageRegistry& operator=(const QelMessageRegistry&) = delete;

    virtual ~QelMessageRegistry();

    /// The entry for a message class, for the list of the constructor above.
    /// @tparam T a class with a static getMessageID() and a constructor from (const char*, unsigned int)
    template <typename T>
    static std::pair<const Identifier, Factory> Entry()
    {
        return {T::getMessageID(), [](const char* buffer, unsigned int length) -> std::unique_ptr<QelMessage> {
                    return std::make_unique<T>(buffer, length);
                }};
    }

    /// Builds the message that the bytes are a frame of.
    /// A frame of an unknown identity, or one that its own class refuses (which writes a line at Debug), becomes a
    /// plain QelMessage: be prepared for the base class, and tell what it is by its header.
    /// @param buffer at least `length` readable bytes, of any alignment; not kept
    /// @return the message; never null
    /// @throws QelMessageValidationException "length" (fewer than 22 bytes), "i_buffer" (null pointer), or what
    ///         CommonHeader::validate() throws for bytes that are no frame; all but the null pointer write a line at
    ///         Error. Whatever else a factory throws passes unchanged.
    std::unique_ptr<QelMessage> deserialize(const char* buffer, unsigned int length) const;

    /// Looks up the factory of an identity. Calling it tells by its exception what deserialize() tells only the log:
    /// why a class refuses a frame.
    /// @return null for an identity that is not known; otherwise lives as long as the registry
    const Factory* findFactory(const Identifier& identifier) const;

private:
    const std::map<Identifier, Factory> mEntries;
};

static_assert(sizeof(QelMessageRegistry::FastHeader) == 22 && alignof(QelMessageRegistry::FastHeader) == 1,
              "overlays the frame buffer");
static_assert(offsetof(QelMessageRegistry::FastHeader, mFunction) == 12, "overlays the frame buffer");
static_assert(offsetof(QelMessageRegistry::FastHeader, mFlags) == 14, "overlays the frame buffer");
static_assert(offsetof(QelMessageRegistry::FastHeader, mOperation) == 20, "overlays the frame buffer");

/// Prints "[FN=0x6003 OP=0x0101 FL=0x80]".
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelMessageRegistry::FastHeader& header);

} // namespace qel
