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
#include <map>
#include <memory>
#include <ostream> // derived classes print in pDerivedDebug()
#include <type_traits>

namespace qel {

/// One frame of the protocol: a fixed header, the payload, and pad bytes, in one owned buffer of exactly
/// msgLength() bytes. Base of every typed message. An object of this class itself is an untyped frame: only its header
/// is interpreted.
///
/// A message always holds a complete and consistent frame: it is either built here or copied from bytes that passed
/// CommonHeader::validate(). The frame code sets no upper limit: a frame longer than `MtuMax` can be built, but no
/// message stream accepts it.
///
/// Ownership: owns its frame. Pointers from getData() and serialize() stay valid until the message is assigned to, gets
/// another payload, or is destroyed. There are no move operations: a move copies the frame and leaves the source
/// unchanged.
/// Assignment through the base replaces the frame of a typed message without a check of its type. Do not call the
/// accessors of the type afterwards.
/// Thread safety: none; a message belongs to one thread at a time. Any thread may build messages at any time.
class QEL_EXPORT QelMessage {
public:
    /// Sizes of frames, in bytes.
    enum Mtu : unsigned int {
        MtuMax = 16384,                               ///< the longest frame that a message stream accepts
        MaxHeaderSize = 32,                           ///< the longer of the two header forms
        MtuWexMax = 4096,                             ///< the longest frame for the hypervisor
        MaxWexPayloadSize = MtuWexMax - MaxHeaderSize ///< the longest payload of such a frame
    };

    /// The first 24 bytes of every frame; lies directly over the bytes of the frame. All integers are big-endian.
    struct QEL_EXPORT CommonHeader {
        /// The form of the header. It determines where the payload begins.
        enum Version : unsigned char {
            MessageVersion24 = 0x00, ///< 24 bytes ("old"); frames are padded up to 40 bytes
            MessageVersion32 = 0x20  ///< 32 bytes ("new"): an ExtendedHeader follows; the form of all frames built here
        };

        /// The eyecatcher: the first three bytes of every frame.
        static constexpr unsigned char DaxCmdDesc[3] = {0xDE, 0xCA, 0xFF};

        /// The header length in bytes for each version byte: 0x00 gives 24, 0x20 gives 32; all others are invalid.
        /// Static initialisation of the library fills it: static initialisers of other libraries may run earlier and
        /// must not read it. Header and frame operations do not depend on it.
        static const std::map<unsigned char, unsigned int> QelHeaderVersionToLength;

        unsigned char mDesc[3];       //  0  the eyecatcher
        unsigned char mHeaderVersion; //  3  a Version
        be_uint32_t mMsgLength;       //  4  bytes of the whole frame: header + payload + pad
        be_uint32_t mCallerId;        //  8  chosen by the sender of a request; a response carries the same id
        be_uint16_t mFunction;        // 12  QelMessageFunctionCodes
        unsigned char mFlags;         // 14  QelMessageFlags
        unsigned char mPadLength;     // 15  pad bytes after the payload; normally 0 in the new form
        be_uint32_t mDataLength;      // 16  bytes of the payload
        be_uint16_t mOperation;       // 20  QelMessageOpTypes, within the function
        be_uint16_t mStatus;          // 22  QelMessageStatusCodes

        /// Checks received bytes: eyecatcher, header version, and that all lengths agree with each other and fit
        /// `i_length`. Bytes after the end of the frame are ignored.
        /// Each failure except the null pointer first logs one line at Error. The line holds the offending value,
        /// except for a frame length above `i_length`: that line is a fixed text.
        /// Thread safety: any thread.
        /// @param i_buffer at least `i_length` readable bytes, of any alignment
        /// @param i_length bytes
        /// @return the caller's bytes viewed as a header, never null; valid as long as the bytes are
        /// @throws QelMessageValidationException the first check that fails, in this order: "i_buffer" (null pointer),
        ///         "i_length shorter than old header", "i_buffer bad eyecatcher", "i_length shorter than new header",
        ///         "i_length shorter than total message length", "i_buffer bad header version",
        ///         "i_buffer bad header pad length", "i_buffer bad MsgLength in header"
        static const CommonHeader* validate(const char* i_buffer, unsigned int i_length);

        /// Bytes from the start of the frame to the payload: 24 or 32.
        /// @throws std::out_of_range the version byte is not in QelHeaderVersionToLength; never for a checked frame
        unsigned int getHeaderLength() const
        {
            // Every payload access calls this, so the two rows of the table are compiled in. Without the hint,
            // compilers put the new form, which nearly all frames have, behind two jumps.
            if (__builtin_expect(mHeaderVersion == MessageVersion32, 1)) return kNewHeaderLength;
            if (mHeaderVersion == MessageVersion24) return kOldHeaderLength;
            return pLookUpHeaderLength();
        }

        /// @return true if an ExtendedHeader follows
        /// @throws std::out_of_range as getHeaderLength() does
        bool hasExtendedFields() const { return getHeaderLength() >= kNewHeaderLength; }

        /// Stores the payload length and updates pad length and frame length. In the old form the pad is recomputed so
        /// that the frame has at least 40 bytes; in the new form it is kept.
        /// @param i_length bytes
        /// @throws std::invalid_argument "length": the frame length would not fit its 32-bit field; nothing changes
        /// @throws std::out_of_range as getHeaderLength() does; nothing changes
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

    /// The rest of a header of the new form; begins at offset 24 of the frame.
    struct QEL_EXPORT ExtendedHeader {
        be_uint16_t mStatusDetail; // 24  further detail of the status
        be_uint16_t mReserved2;    // 26  sent as zero, not checked when received
        be_uint32_t mReserved3;    // 28  sent as zero, not checked when received
    };

    /// Builds a frame of the new form without payload: eyecatcher, version and frame length; all other fields are zero.
    QelMessage();

    /// Builds a frame of the new form without payload.
    QelMessage(unsigned int i_callerId, unsigned short i_function, unsigned short i_operation, QelMessageFlags i_flags);

    /// Checks received bytes and copies the frame that they begin with; bytes after its end are ignored and not kept.
    /// @param i_buffer at least `i_length` readable bytes, of any alignment; not kept
    /// @param i_length bytes
    /// @throws QelMessageValidationException as CommonHeader::validate() does; nothing stays allocated
    QelMessage(const char* i_buffer, unsigned int i_length);

    /// Copies the whole frame.
    QelMessage(const QelMessage& i_message);

    /// Replaces the frame with a copy of the other's. If memory runs out, this message stays as it was.
    /// Self-assignment loses the contents: it leaves a valid frame of the same form and lengths in which caller id,
    /// function, operation, flags, status and every payload byte are zero.
    QelMessage& operator=(const QelMessage& i_message);

    virtual ~QelMessage();

    /// @return a new message of the same dynamic type with a copy of the frame; never null
    virtual std::unique_ptr<QelMessage> clone() const;

    QelMessageFunctionCodes getFunction() const
    {
        return static_cast<QelMessageFunctionCodes>(pGetHeader()->mFunction.value());
    }
    QelMessageOpTypes getOperation() const { return static_cast<QelMessageOpTypes>(pGetHeader()->mOperation.value()); }
    /// All eight bits of the header field, the meaningless ones included.
    QelMessageFlags getFlags() const { return static_cast<QelMessageFlags>(pGetHeader()->mFlags); }
    QelMessageStatusCodes getStatus() const
    {
        return static_cast<QelMessageStatusCodes>(pGetHeader()->mStatus.value());
    }
    /// Further detail of the status; 0 for a header of the old form, which has no such field.
    unsigned short getStatusDetail() const
    {
        const ExtendedHeader* const extended = pGetExtendedHeader();
        return extended == nullptr ? static_cast<unsigned short>(0) : extended->mStatusDetail.value();
    }
    /// The classification that the flags give.
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

    /// @return the frame as it is sent, msgLength() bytes; never null
    const char* serialize() const { return pGetMessage(); }

    /// Throws if the status is not zero.
    /// @throws QelMessageStatusException the status is not zero
    void checkStatus() const;

    /// @return a formatter that prints all header fields, the payload fields and a hex dump of the frame on many lines;
    ///         borrows this message
    QelMessageDebugFormatter debug() const { return QelMessageDebugFormatter(this); }

    /// @return a formatter that prints this message as one short line; borrows this message. Printing leaves the stream
    ///         in hexadecimal, see QelMessageIDFormatter
    QelMessageIDFormatter getLogID() const { return QelMessageIDFormatter(this); }

    /// Draws the next caller id. The first one of a process is 2; ids wrap modulo 2^32 and are unique only within the
    /// process.
    /// Thread safety: any thread; one atomic increment, lock-free and sequentially consistent.
    static unsigned int generateNextUint32();

protected:
    /// Prints the payload fields of the type, for debug(): one line per field, each with a newline at its end. The base
    /// prints "    <no additional details>" without a newline.
    virtual void pDerivedDebug(std::ostream& os) const;

    /// The payload length of a new frame, in bytes. A separate type so that it is never mistaken for a caller id, and
    /// 64 bits wide so that a sum of lengths cannot wrap.
    class PayloadLength {
    public:
        explicit constexpr PayloadLength(std::uint64_t bytes) noexcept : mBytes(bytes) {}
        constexpr std::uint64_t bytes() const noexcept { return mBytes; }

    private:
        std::uint64_t mBytes;
    };

    /// Builds a frame of the new form with a payload of zeros, for classes that fill it in place: header and payload
    /// are one allocation of the final size.
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

    /// The header, in place. A caller that changes its version or lengths breaks the frame; so does setDataLength() by
    /// itself, because the buffer keeps its size.
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

    /// The payload viewed as a wire record, in place: at offset 24 or 32 of the frame, depending on the version.
    /// @tparam Data a record of alignment 1: bytes, be_uint16_t, be_uint32_t, bcd_uint8_t, bcd_uint16_t
    /// @pre dataLength() covers every field that is accessed through it. This is not checked here: a class checks it
    ///      once, when it is built from bytes.
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

    /// Replaces the payload with zeros. The header is kept, its version included, and its lengths are updated; the old
    /// payload is dropped.
    /// @param i_length bytes of the new payload
    /// @return the new payload; null when `i_length` is 0
    /// @throws std::invalid_argument "length": the frame length would not fit its 32-bit field; nothing changes
    char* pAllocData(unsigned int i_length);

    /// Replaces the payload with a copy of the bytes. They may lie in this message's own payload.
    /// @param i_data `i_length` bytes; may be null when `i_length` is 0
    /// @param i_length bytes of the new payload
    /// @throws std::invalid_argument "data": null with a length other than 0; "length" as pAllocData(); nothing changes
    void pSetData(const char* i_data, unsigned int i_length);

    /// The id that generateNextUint32() returned last, for the whole process. A derived class may set where the ids
    /// continue; ids that are in use then may be drawn again.
    static std::atomic<unsigned int> sCallerIdCounter;

private:
    friend QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelMessageDebugFormatter& formatter);

    template <typename Data>
    static constexpr void pRequireWireRecord()
    {
        static_assert(alignof(Data) == 1 && std::is_standard_layout<Data>::value &&
                          std::is_trivially_copyable<Data>::value,
                      "a record that lies over the bytes of a frame must have alignment 1");
    }

    std::unique_ptr<char[]> pMakeFrame(unsigned int i_dataLength) const;
    std::unique_ptr<char[]> pMakeBlankFrame() const;

    std::unique_ptr<char[]> mMessage; // the frame: header, payload, pad
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
