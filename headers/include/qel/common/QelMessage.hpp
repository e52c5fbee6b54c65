#pragma once

#include <qel/common/BCDExtensions.hpp>
#include <qel/common/EndianExtensions.hpp>
#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/QelMessageFormatters.hpp>
#include <qel/common/QelMessageIdentifiers.hpp>

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <iosfwd>
#include <map>
#include <memory>
#include <type_traits>

namespace qel {

namespace test {
class CallerIdScope;
}

/// One frame of the protocol: a fixed header, the payload, and pad bytes, in one owned buffer of exactly
/// msgLength() bytes. Base of every typed message; an object of this very class is a frame that nothing is known about
/// beyond its header.
///
/// A message always holds a complete and consistent frame: it is either built here or copied from bytes that passed
/// CommonHeader::validate(). The frame code sets no upper limit: a frame longer than `MtuMax` can be built, though no
/// message stream accepts it.
///
/// Ownership: owns its frame. Pointers from getData() and serialize() stay valid until the message is assigned to,
/// given another payload, or destroyed. There are no move operations: moving copies the frame and leaves the source
/// whole.
/// Assigning through the base replaces the frame of a typed message without any check of its type; the accessors of the
/// type must not be used afterwards.
/// Thread safety: none; a message belongs to one thread at a time. Messages may be built in any thread at any time.
class QEL_EXPORT QelMessage {
public:
    /// Sizes of frames, in bytes.
    enum Mtu : unsigned int {
        MtuMax = 16384,                               ///< the longest frame that a message stream accepts
        MaxHeaderSize = 32,                           ///< the longer of the two header forms
        MtuWexMax = 4096,                             ///< the longest frame for the hypervisor
        MaxWexPayloadSize = MtuWexMax - MaxHeaderSize ///< the payload that such a frame has room for
    };

    /// The first 24 bytes of every frame; lies directly over the bytes of the frame. All integers are big-endian.
    struct QEL_EXPORT CommonHeader {
        /// The form of the header, which decides where the payload begins.
        enum Version : unsigned char {
            MessageVersion24 = 0x00, ///< 24 bytes ("old"); frames are padded up to 40 bytes
            MessageVersion32 = 0x20  ///< 32 bytes ("new"): an ExtendedHeader follows; the form of all frames built here
        };

        /// The eyecatcher: the first three bytes of every frame.
        static constexpr unsigned char DaxCmdDesc[3] = {0xDE, 0xCA, 0xFF};

        /// The header length in bytes for each version byte: 0x00 gives 24, 0x20 gives 32, and there are no others.
        /// It is filled while the library is loaded, so that it must not be read from another library's static
        /// initialisation that may come earlier; header and frame operations do not depend on that.
        static const std::map<unsigned char, unsigned int> QelHeaderVersionToLength;

        unsigned char mDesc[3];       //  0  the eyecatcher
        unsigned char mHeaderVersion; //  3  a Version
        be_uint32_t mMsgLength;       //  4  bytes of the whole frame: header + payload + pad
        be_uint32_t mCallerId;        //  8  chosen by whoever asks; a response carries the id of its request
        be_uint16_t mFunction;        // 12  QelMessageFunctionCodes
        unsigned char mFlags;         // 14  QelMessageFlags
        unsigned char mPadLength;     // 15  pad bytes after the payload; normally 0 in the new form
        be_uint32_t mDataLength;      // 16  bytes of the payload
        be_uint16_t mOperation;       // 20  QelMessageOpTypes, within the function
        be_uint16_t mStatus;          // 22  QelMessageStatusCodes

        /// Checks received bytes: eyecatcher, header version, and that all lengths agree with each other and fit
        /// `i_length`. Bytes behind the frame's own length are not looked at.
        /// Each failure but the null pointer first writes one line with the values at Error.
        /// @param i_buffer at least `i_length` readable bytes, of any alignment
        /// @return the caller's bytes viewed as a header, never null; valid as long as the bytes are
        /// @throws QelMessageValidationException, checked in this order: "i_buffer" (null pointer),
        ///         "i_length shorter than old header", "i_buffer bad eyecatcher", "i_length shorter than new header",
        ///         "i_length shorter than total message length", "i_buffer bad header version",
        ///         "i_buffer bad header pad length", "i_buffer bad MsgLength in header"
        static const CommonHeader* validate(const char* i_buffer, unsigned int i_length);

        /// Bytes from the start of the frame to the payload: 24 or 32.
        /// @throws std::out_of_range the version byte is not in QelHeaderVersionToLength; never for a checked frame
        unsigned int getHeaderLength() const
        {
            // Every access to a payload comes through here: the two rows of the table need no look-up.
            if (mHeaderVersion == MessageVersion32) return kNewHeaderLength;
            if (mHeaderVersion == MessageVersion24) return kOldHeaderLength;
            return pLookUpHeaderLength();
        }

        /// True when an ExtendedHeader follows. @throws std::out_of_range as getHeaderLength() does
        bool hasExtendedFields() const { return getHeaderLength() >= kNewHeaderLength; }

        /// Stores the payload length and brings pad and frame length in line with it. In the old form the pad is
        /// recomputed to reach a frame of at least 40 bytes; in the new form it stays what it was.
        /// @param i_length bytes
        /// @throws std::invalid_argument "length": the frame length would not fit its 32-bit field; nothing is changed
        /// @throws std::out_of_range as getHeaderLength() does; nothing is changed
        void setDataLength(unsigned int i_length);

    private:
        friend class QelMessage;

        static constexpr unsigned int kOldHeaderLength = 24;
        static constexpr unsigned int kNewHeaderLength = 32;

        void pValidate(unsigned int i_length) const;
        void pCalculateMsgLength();
        unsigned int pLookUpHeaderLength() const;
        unsigned char pPadLengthFor(unsigned int dataLength) const;
        std::uint64_t pMsgLengthFor(unsigned int dataLength) const;
    };

    /// What a header of the new form has beyond the common one; begins at offset 24 of the frame.
    struct QEL_EXPORT ExtendedHeader {
        be_uint16_t mStatusDetail; // 24  more about the status
        be_uint16_t mReserved2;    // 26  sent as zero, not checked when received
        be_uint32_t mReserved3;    // 28  sent as zero, not checked when received
    };

    /// A frame of the new form without payload: eyecatcher, version and frame length, and zeros in all other fields.
    QelMessage();

    /// A frame of the new form without payload.
    QelMessage(unsigned int i_callerId, unsigned short i_function, unsigned short i_operation, QelMessageFlags i_flags);

    /// Checks received bytes and keeps a copy of the frame they begin with; bytes behind it are ignored.
    /// @param i_buffer at least `i_length` readable bytes, of any alignment; not kept
    /// @throws QelMessageValidationException as CommonHeader::validate() does; nothing stays allocated
    QelMessage(const char* i_buffer, unsigned int i_length);

    /// Copies the whole frame.
    QelMessage(const QelMessage& i_message);

    /// Replaces the frame with a copy of the other's. If the memory for it cannot be had, this message stays as it was.
    /// Self-assignment is not provided for: it gives a frame whose bytes mean nothing.
    QelMessage& operator=(const QelMessage& i_message);

    virtual ~QelMessage();

    /// @return a new message of the same dynamic type with a copy of the frame; never null
    virtual std::unique_ptr<QelMessage> clone() const;

    QelMessageFunctionCodes getFunction() const
    {
        return static_cast<QelMessageFunctionCodes>(pGetHeader()->mFunction.value());
    }
    QelMessageOpTypes getOperation() const { return static_cast<QelMessageOpTypes>(pGetHeader()->mOperation.value()); }
    /// All eight bits as they are in the header, the meaningless ones included.
    QelMessageFlags getFlags() const { return static_cast<QelMessageFlags>(pGetHeader()->mFlags); }
    QelMessageStatusCodes getStatus() const
    {
        return static_cast<QelMessageStatusCodes>(pGetHeader()->mStatus.value());
    }
    /// More about the status; 0 for a header of the old form, which has no such field.
    unsigned short getStatusDetail() const
    {
        const ExtendedHeader* const extended = pGetExtendedHeader();
        return extended == nullptr ? static_cast<unsigned short>(0) : extended->mStatusDetail.value();
    }
    /// What the flags say this message is.
    QelMessageClassification::Value getClassification() const
    {
        return QelMessageClassification::fromFlags(getFlags());
    }
    unsigned int getCallerId() const { return pGetHeader()->mCallerId.value(); }

    /// Bytes of the whole frame.
    unsigned int msgLength() const { return pGetHeader()->mMsgLength.value(); }
    /// Bytes of the payload.
    unsigned int dataLength() const { return pGetHeader()->mDataLength.value(); }

    /// @return the payload, dataLength() bytes; null when there is none
    const char* getData() const { return pGetData(); }

    /// @return the frame as it goes over the wire, msgLength() bytes; never null
    const char* serialize() const { return pGetMessage(); }

    /// Turns a status other than zero into an exception.
    /// @throws QelMessageStatusException
    void checkStatus() const;

    /// For printing everything about this message on many lines, the bytes included. Borrows this message.
    QelMessageDebugFormatter debug() const { return QelMessageDebugFormatter(this); }

    /// For printing this message as one short line. Borrows this message.
    QelMessageIDFormatter getLogID() const { return QelMessageIDFormatter(this); }

    /// Takes the next caller id. The first one of a process is 2; they go round modulo 2^32 and are unique within the
    /// process only.
    /// Thread safety: may be called from any thread; lock-free and sequentially consistent.
    static unsigned int generateNextUint32();

protected:
    /// Prints what the type knows about its payload, for debug(): one line per field, each ended by a newline. The
    /// base prints "    <no additional details>" without a line end.
    virtual void pDerivedDebug(std::ostream& os) const;

    /// How many bytes of payload a new frame has. A type of its own so that it is never taken for a caller id, and 64
    /// bits wide so that a sum of lengths does not wrap on the way here.
    class PayloadLength {
    public:
        explicit constexpr PayloadLength(std::uint64_t bytes) noexcept : mBytes(bytes) {}
        constexpr std::uint64_t bytes() const noexcept { return mBytes; }

    private:
        std::uint64_t mBytes;
    };

    /// A frame of the new form with a payload of zeros, for classes that fill it in place: header and payload are one
    /// allocation of their final size.
    /// @throws std::invalid_argument "length": the frame length would not fit its 32-bit field
    QelMessage(unsigned int i_callerId, unsigned short i_function, unsigned short i_operation, QelMessageFlags i_flags,
               PayloadLength i_payloadLength);

    /// The frame, msgLength() bytes; never null.
    char* pGetMessage() { return mMessage.get(); }
    const char* pGetMessage() const { return mMessage.get(); }

    /// The payload, dataLength() bytes; null when there is none.
    char* pGetData() { return dataLength() == 0 ? nullptr : mMessage.get() + pGetHeader()->getHeaderLength(); }
    const char* pGetData() const
    {
        return dataLength() == 0 ? nullptr : mMessage.get() + pGetHeader()->getHeaderLength();
    }

    /// The header, in place. Changing its version or lengths by hand breaks the frame; setDataLength() alone does too,
    /// because the buffer keeps its size.
    CommonHeader* pGetHeader() { return reinterpret_cast<CommonHeader*>(mMessage.get()); }
    const CommonHeader* pGetHeader() const { return reinterpret_cast<const CommonHeader*>(mMessage.get()); }

    /// The rest of a header of the new form, in place; null for the old form.
    ExtendedHeader* pGetExtendedHeader()
    {
        if (!pGetHeader()->hasExtendedFields()) return nullptr;
        return reinterpret_cast<ExtendedHeader*>(mMessage.get() + sizeof(CommonHeader));
    }
    const ExtendedHeader* pGetExtendedHeader() const
    {
        if (!pGetHeader()->hasExtendedFields()) return nullptr;
        return reinterpret_cast<const ExtendedHeader*>(mMessage.get() + sizeof(CommonHeader));
    }

    /// The payload viewed as a record of the wire, in place: at offset 24 or 32 of the frame, by its version.
    /// @tparam Data a record without alignment of its own: bytes, be_uint16_t, be_uint32_t, bcd_uint8_t, bcd_uint16_t
    /// @pre dataLength() covers what is read through it; nothing is checked here. Classes check it once, when they are
    ///      built from bytes.
    template <typename Data>
    Data& pPayload()
    {
        pRequireWireRecord<Data>();
        return *reinterpret_cast<Data*>(mMessage.get() + pGetHeader()->getHeaderLength());
    }
    template <typename Data>
    const Data& pPayload() const
    {
        pRequireWireRecord<Data>();
        return *reinterpret_cast<const Data*>(mMessage.get() + pGetHeader()->getHeaderLength());
    }

    /// Gives the frame a new payload of zeros. The header is kept (24-byte form, caller id, flags, status and detail
    /// included) and its lengths are brought in line; the old payload is dropped.
    /// @param i_length bytes of the new payload
    /// @return the new payload; null when `i_length` is 0
    /// @throws std::invalid_argument "length": the frame length would not fit its 32-bit field; nothing is changed
    char* pAllocData(unsigned int i_length);

    /// Gives the frame a new payload, as pAllocData() does, and copies the bytes into it. They may lie in this
    /// message's own payload.
    /// @param i_data `i_length` bytes; may be null when `i_length` is 0
    /// @throws std::invalid_argument "data": null with a length other than 0; "length" as pAllocData(); nothing is
    ///         changed
    void pSetData(const char* i_data, unsigned int i_length);

private:
    friend QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelMessageDebugFormatter& formatter);
    friend class test::CallerIdScope;

    template <typename Data>
    static constexpr void pRequireWireRecord()
    {
        static_assert(alignof(Data) == 1 && std::is_standard_layout<Data>::value &&
                          std::is_trivially_copyable<Data>::value,
                      "a record that lies over the bytes of a frame must not have an alignment of its own");
    }

    std::unique_ptr<char[]> pMakeFrame(unsigned int i_dataLength) const;

    std::unique_ptr<char[]> mMessage; // the frame: header, payload, pad

    static std::atomic<unsigned int> sCallerIdCounter; // the id handed out last
};

static_assert(sizeof(QelMessage::CommonHeader) == 24 && alignof(QelMessage::CommonHeader) == 1,
              "overlays the frame buffer");
static_assert(offsetof(QelMessage::CommonHeader, mHeaderVersion) == 3, "overlays the frame buffer");
static_assert(offsetof(QelMessage::CommonHeader, mMsgLength) == 4, "overlays the frame buffer");
static_assert(offsetof(QelMessage::CommonHeader, mCallerId) == 8, "overlays the frame buffer");
static_assert(offsetof(QelMessage::CommonHeader, mFunction) == 12, "overlays the frame buffer");
static_assert(offsetof(QelMessage::CommonHeader, mFlags) == 14, "overlays the frame buffer");
static_assert(offsetof(QelMessage::CommonHeader, mPadLength) == 15, "overlays the frame buffer");
static_assert(offsetof(QelMessage::CommonHeader, mDataLength) == 16, "overlays the frame buffer");
static_assert(offsetof(QelMessage::CommonHeader, mOperation) == 20, "overlays the frame buffer");
static_assert(offsetof(QelMessage::CommonHeader, mStatus) == 22, "overlays the frame buffer");
static_assert(sizeof(QelMessage::ExtendedHeader) == 8 && alignof(QelMessage::ExtendedHeader) == 1,
              "overlays the frame buffer");
static_assert(offsetof(QelMessage::ExtendedHeader, mReserved2) == 2, "overlays the frame buffer");
static_assert(offsetof(QelMessage::ExtendedHeader, mReserved3) == 4, "overlays the frame buffer");

} // namespace qel
