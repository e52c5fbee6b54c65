#pragma once

#include <qel/common/EndianExtensions.hpp>
#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <initializer_list>
#include <iosfwd>
#include <map>
#include <memory>
#include <tuple>
#include <utility>
#include <vector>

namespace qel {

/// Turns received frames into objects of their message classes. It has a factory for each identity and falls back to a
/// plain QelMessage for frames of an unknown identity and for frames that their class refuses.
/// Ownership: owns its factories; a message that it returns belongs to the caller and does not refer to it.
/// Thread safety: immutable after construction; any number of threads may deserialize at once.
class QEL_EXPORT QelMessageRegistry {
public:
    /// The identity of a message: function code, operation, classification. As QelMessageMetadata::getMessageID().
    using Identifier = std::tuple<unsigned short, unsigned short, QelMessageClassification::Value>;

    /// Builds a message from a frame (bytes, length). Must not return null; throws QelMessageValidationException to
    /// refuse the frame. Every thread that deserializes calls it, without a lock.
    using Factory = std::function<std::unique_ptr<QelMessage>(const char*, unsigned int)>;

    /// The first 22 bytes of a frame. Only the identity is read; nothing is checked.
    struct QEL_EXPORT FastHeader {
        char mReserved1[12];    //  0  ignored
        be_uint16_t mFunction;  // 12  QelMessageFunctionCodes
        unsigned char mFlags;   // 14  QelMessageFlags
        char mReserved2[5];     // 15  ignored
        be_uint16_t mOperation; // 20  QelMessageOpTypes

        Identifier getIdentifier() const
        {
            return {mFunction.value(), mOperation.value(),
                    QelMessageClassification::fromFlags(static_cast<QelMessageFlags>(mFlags))};
        }
    };

    /// The public registry: the 32 messages that consoles and hypervisors exchange. It leaves out the two responses
    /// that this library only builds (interface limits and time of day) and the two messages of the connection
    /// handshake, which are in QelInternalMessageRegistry.
    QelMessageRegistry();

    /// A registry with exactly these entries. Of several entries with the same identity the first one is used.
    QelMessageRegistry(std::initializer_list<std::pair<const Identifier, Factory>> entries);

    /// A copy has the same entries. There is no assignment: other threads may be reading the entries.
    QelMessageRegistry(const QelMessageRegistry& other);
    QelMessageRegistry& operator=(const QelMessageRegistry&) = delete;

    virtual ~QelMessageRegistry();

    /// @return the entry of a message class, for the list constructor
    /// @tparam T a class with a static getMessageID() and a constructor from (const char*, unsigned int)
    template <typename T>
    static std::pair<const Identifier, Factory> Entry()
    {
        return {T::getMessageID(), &pMake<T>};
    }

    /// Builds the message that a frame holds.
    /// A frame of an unknown identity becomes a plain QelMessage; so does one that its class refuses, which logs a line
    /// at Debug. Callers must be prepared for the base class and read the identity from the header.
    /// @param buffer at least `length` readable bytes, of any alignment; not kept
    /// @param length bytes
    /// @return the message; never null
    /// @throws QelMessageValidationException "length" (fewer than 22 bytes), "i_buffer" (null pointer), or what
    ///         CommonHeader::validate() throws for a malformed frame; all but the null pointer log a line at Error.
    ///         Other exceptions of a factory pass unchanged.
    std::unique_ptr<QelMessage> deserialize(const char* buffer, unsigned int length) const;

    /// Looks up the factory of an identity. A caller that needs to know why a class refuses a frame calls the factory:
    /// its exception holds the reason, which deserialize() only logs.
    /// @return null for an unknown identity; otherwise valid as long as the registry
    const Factory* findFactory(const Identifier& identifier) const;

private:
    using Maker = std::unique_ptr<QelMessage> (*)(const char*, unsigned int);

    /// A place of the look-up table.
    struct Slot {
        std::uint64_t key = 0;            // the identity, see pKey()
        const Factory* factory = nullptr; // in mEntries; null: the slot is free
        Maker maker = nullptr;            // the function in the factory; null: the factory holds something else
    };

    template <typename T>
    static std::unique_ptr<QelMessage> pMake(const char* buffer, unsigned int length)
    {
        return std::make_unique<T>(buffer, length);
    }

    /// The identity as one number.
    static std::uint64_t pKey(const Identifier& identifier) noexcept
    {
        constexpr unsigned int kClassificationShift = 32;
        constexpr unsigned int kFunctionShift = 16;
        return static_cast<std::uint64_t>(std::get<2>(identifier)) << kClassificationShift |
               static_cast<std::uint64_t>(std::get<0>(identifier)) << kFunctionShift |
               static_cast<std::uint64_t>(std::get<1>(identifier));
    }
    static std::size_t pHash(std::uint64_t key) noexcept;
    const Slot& pSlot(std::uint64_t key) const noexcept;
    void pFillTable();

    const std::map<Identifier, Factory> mEntries;

    // The same entries by hash: a frame is looked up with one probe, where the map needs six comparisons. The length is
    // a power of two, and at least three quarters of the slots are free.
    std::vector<Slot> mTable;
    std::size_t mTableMask = 0; // its length - 1
};

static_assert(sizeof(QelMessageRegistry::FastHeader) == 22 && alignof(QelMessageRegistry::FastHeader) == 1,
              "overlays the frame buffer");
static_assert(offsetof(QelMessageRegistry::FastHeader, mFunction) == 12, "overlays the frame buffer");
static_assert(offsetof(QelMessageRegistry::FastHeader, mFlags) == 14, "overlays the frame buffer");
static_assert(offsetof(QelMessageRegistry::FastHeader, mOperation) == 20, "overlays the frame buffer");

/// Prints "[FN=0x6003 OP=0x0101 FL=0x80]". Leaves the stream in upper-case hexadecimal with fill character '0'.
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelMessageRegistry::FastHeader& header);

} // namespace qel
