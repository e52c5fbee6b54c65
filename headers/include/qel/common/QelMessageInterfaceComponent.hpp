#pragma once

#include <qel/common/BCDExtensions.hpp>
#include <qel/common/EndianExtensions.hpp>
#include <qel/common/QelCapabilities.hpp>
#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessageMetadata.hpp>

#include <cstddef>
#include <cstdint>
#include <ctime>
#include <iosfwd>
#include <string>

/// @file
/// The messages of the interface component, function code 0x6003: identification of both peers, the session with the
/// hypervisor, capabilities, limits, broadcasts, the time of day and two global attributes.
///
/// For all of them:
/// - A builder makes a frame of the new header form. Reserved fields and the unused tails of character fields are sent
///   as zero. A request draws a new caller id. A response carries the caller id of its request: pass it to the builder.
/// - The constructor from bytes parses a received frame of `i_length` bytes. It checks the frame, then the identity,
///   then the payload, and keeps a copy. Reserved fields are not checked, and a payload longer than needed is accepted.
///   It throws QelMessageValidationException: what QelMessageMetadata throws, then the texts named at the class.
/// - The nested `Data` is the fixed part of the payload as it lies in the frame: offsets from the first payload byte,
///   integers big-endian, characters without a terminating NUL.
/// - Texts are raw bytes of any value, passed and returned as std::string, embedded NULs included.
/// - Lengths from 16-bit fields allow frames longer than QelMessage::MtuMax, which can be built but not sent.
/// - Ownership: a message owns its frame; pointers into it live as long as the message. Thread safety: as QelMessage,
///   one thread at a time.

namespace qel {

/// The console identifies itself and names its interface version; the first message on a connection.
class QEL_EXPORT QelMessageGetEnclTypeAndInterfaceVersionReq
    : public QelMessageMetadata<QelMessageGetEnclTypeAndInterfaceVersionReq, QelMessageFunctionQelInterfaceCmp,
                                QelMessageOpGetEnclTypeAndInterfaceVersion, QelMessageClassification::Request> {
public:
    struct Data {
        be_uint32_t mInterfaceVersion; //  0  interface version of the sender
        be_uint32_t mToolType;         //  4  type of the sending tool
        be_uint16_t mToolIdLength;     //  8  meaningful bytes of mToolId, at most 32
        be_uint16_t mMajorVersion;     // 10
        be_uint16_t mMinorVersion;     // 12
        unsigned char mReserved[2];    // 14
        char mToolId[32];              // 16  a received payload may end after the last meaningful byte
    };
    static_assert(sizeof(Data) == 48 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mToolType) == 4 && offsetof(Data, mToolIdLength) == 8 &&
                      offsetof(Data, mMajorVersion) == 10 && offsetof(Data, mMinorVersion) == 12 &&
                      offsetof(Data, mReserved) == 14 && offsetof(Data, mToolId) == 16,
                  "overlays the frame buffer");

    /// Builds a payload of the full 48 bytes.
    /// @param toolId at most 32 bytes. Its length is taken modulo 65536, and only that many bytes are sent.
    /// @throws QelMessageValidationException "Tool ID is too long"
    QelMessageGetEnclTypeAndInterfaceVersionReq(std::uint32_t interfaceVersion, std::uint32_t toolType,
                                                std::uint16_t majorVersion, std::uint16_t minorVersion,
                                                const std::string& toolId);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageMetadata does; then "dataLength smaller than minimum
    ///         acceptable size" (below 16 bytes), "Tool ID length is invalid" (above 32, or more than there is)
    QelMessageGetEnclTypeAndInterfaceVersionReq(const char* i_buffer, unsigned int i_length);
    ~QelMessageGetEnclTypeAndInterfaceVersionReq() override;

    std::uint32_t getInterfaceVersion() const { return pPayload<Data>().mInterfaceVersion; }
    std::uint32_t getToolType() const { return pPayload<Data>().mToolType; }
    std::uint16_t getMajorVersion() const { return pPayload<Data>().mMajorVersion; }
    std::uint16_t getMinorVersion() const { return pPayload<Data>().mMinorVersion; }
    std::string getToolId() const { return std::string(pPayload<Data>().mToolId, pGetToolIdLen()); }

protected:
    void pDerivedDebug(std::ostream& os) const override;

private:
    std::uint16_t pGetToolIdLen() const { return pPayload<Data>().mToolIdLength; }
};

/// The hypervisor side answers with its enclosure, its versions and the identity of the system.
class QEL_EXPORT QelMessageGetEnclTypeAndInterfaceVersionRsp
    : public QelMessageMetadata<QelMessageGetEnclTypeAndInterfaceVersionRsp, QelMessageFunctionQelInterfaceCmp,
                                QelMessageOpGetEnclTypeAndInterfaceVersion, QelMessageClassification::Response> {
public:
    struct Data {
        char mInterfaceVersionFamily;   //  0  a character
        unsigned char mEnclosureType;   //  1
        be_uint16_t mMajorVersion;      //  2
        be_uint16_t mMinorVersion;      //  4
        unsigned char mReserved[6];     //  6
        be_uint16_t mSysMachineTypeLen; // 12  meaningful bytes of mSysMachineType, at most 16
        be_uint16_t mSysSerialNumLen;   // 14  meaningful bytes of mSerialNum, at most 16
        char mSysMachineType[16];       // 16
        char mSerialNum[16];            // 32  a received payload may end after the last meaningful byte
    };
    static_assert(sizeof(Data) == 48 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mEnclosureType) == 1 && offsetof(Data, mMajorVersion) == 2 &&
                      offsetof(Data, mMinorVersion) == 4 && offsetof(Data, mReserved) == 6 &&
                      offsetof(Data, mSysMachineTypeLen) == 12 && offsetof(Data, mSysSerialNumLen) == 14 &&
                      offsetof(Data, mSysMachineType) == 16 && offsetof(Data, mSerialNum) == 32,
                  "overlays the frame buffer");

    /// The enclosure type of every response that this class builds.
    static constexpr std::uint8_t kEnclosureType = 2;

    /// Builds a payload of the full 48 bytes.
    /// @param callerId that of the request
    /// @param machineType at most 16 bytes
    /// @param serialNum at most 16 bytes
    /// @throws QelMessageValidationException "System serial size is too large"; after it "System machine type is too
    ///         large"
    QelMessageGetEnclTypeAndInterfaceVersionRsp(std::uint32_t callerId, char interfaceVersionFamily,
                                                std::uint16_t majorVersion, std::uint16_t minorVersion,
                                                const std::string& machineType, const std::string& serialNum);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageMetadata does; then "dataLength smaller than minimum
    ///         acceptable size" (below 32 bytes), "Invalid machine type length", "Invalid system serial length" (above
    ///         16), "dataLength not long enough to encapsulate final string field"
    QelMessageGetEnclTypeAndInterfaceVersionRsp(const char* i_buffer, unsigned int i_length);
    ~QelMessageGetEnclTypeAndInterfaceVersionRsp() override;

    char getInterfaceVersionFamily() const { return pPayload<Data>().mInterfaceVersionFamily; }
    std::uint8_t getEnclosureType() const { return pPayload<Data>().mEnclosureType; }
    std::uint16_t getMajorVersion() const { return pPayload<Data>().mMajorVersion; }
    std::uint16_t getMinorVersion() const { return pPayload<Data>().mMinorVersion; }
    std::string getSystemMachineType() const
    {
        return std::string(pPayload<Data>().mSysMachineType, pGetSystemMachineTypeLen());
    }
    std::string getSystemSerialNum() const
    {
        return std::string(pPayload<Data>().mSerialNum, pGetSystemSerialNumLen());
    }

protected:
    void pDerivedDebug(std::ostream& os) const override;

private:
    std::uint16_t pGetSystemMachineTypeLen() const { return pPayload<Data>().mSysMachineTypeLen; }
    std::uint16_t pGetSystemSerialNumLen() const { return pPayload<Data>().mSysSerialNumLen; }
};

/// Opens the session with the hypervisor. No payload.
class QEL_EXPORT QelMessageInterfaceCmpOpenKrogSessionReq
    : public QelMessageMetadata<QelMessageInterfaceCmpOpenKrogSessionReq, QelMessageFunctionQelInterfaceCmp,
                                QelMessageOpOpenKrogSession, QelMessageClassification::Request> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageInterfaceCmpOpenKrogSessionReq() override;
};

/// Response to QelMessageInterfaceCmpOpenKrogSessionReq. No payload.
class QEL_EXPORT QelMessageInterfaceCmpOpenKrogSessionRsp
    : public QelMessageMetadata<QelMessageInterfaceCmpOpenKrogSessionRsp, QelMessageFunctionQelInterfaceCmp,
                                QelMessageOpOpenKrogSession, QelMessageClassification::Response> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageInterfaceCmpOpenKrogSessionRsp() override;
};

/// Closes the session with the hypervisor. No payload.
class QEL_EXPORT QelMessageInterfaceCmpCloseKrogSessionReq
    : public QelMessageMetadata<QelMessageInterfaceCmpCloseKrogSessionReq, QelMessageFunctionQelInterfaceCmp,
                                QelMessageOpCloseKrogSession, QelMessageClassification::Request> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageInterfaceCmpCloseKrogSessionReq() override;
};

/// Response to QelMessageInterfaceCmpCloseKrogSessionReq. No payload.
class QEL_EXPORT QelMessageInterfaceCmpCloseKrogSessionRsp
    : public QelMessageMetadata<QelMessageInterfaceCmpCloseKrogSessionRsp, QelMessageFunctionQelInterfaceCmp,
                                QelMessageOpCloseKrogSession, QelMessageClassification::Response> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageInterfaceCmpCloseKrogSessionRsp() override;
};

/// The payload of both capability messages: a length and that many bytes of capability bits.
///
/// Bit n of a QelCapabilities is the bit 0x80 >> (n % 8) of byte n / 8. Bytes after the fourth are sent as zero and
/// ignored when received. Use the two concrete classes.
/// @tparam Derived the concrete class
/// @tparam Classification request or response
template <typename Derived, QelMessageClassification::Value Classification>
class QEL_EXPORT QelMessageExchIntCapabilitiesBase
    : public QelMessageMetadata<Derived, QelMessageFunctionQelInterfaceCmp, QelMessageOpExchIntCapabilities,
                                Classification> {
public:
    struct Data {
        be_uint32_t mCapabilityLen; //  0  bytes of capability bits, a multiple of 4; may be 0
        /* mSupportedCapabilities       4  mCapabilityLen bytes, bit 0 is the top bit of the first */
    };
    static_assert(sizeof(Data) == 4 && alignof(Data) == 1, "overlays the frame buffer");

    ~QelMessageExchIntCapabilitiesBase() override;

    /// Bytes of capability bits that the message carries, including those that are ignored.
    std::uint32_t getCapabilityLen() const { return this->template pPayload<Data>().mCapabilityLen; }
    /// The first 32 capability bits; bits that the message does not carry are clear.
    QelCapabilities getCapabilities() const;

protected:
    /// Builds with a new caller id, or with the given one.
    QelMessageExchIntCapabilitiesBase(std::uint32_t capabilityLen, const QelCapabilities& capabilities);
    QelMessageExchIntCapabilitiesBase(std::uint32_t callerId, std::uint32_t capabilityLen,
                                      const QelCapabilities& capabilities);
    QelMessageExchIntCapabilitiesBase(const char* i_buffer, unsigned int i_length);
    QelMessageExchIntCapabilitiesBase(const QelMessageExchIntCapabilitiesBase&) = default;
    QelMessageExchIntCapabilitiesBase& operator=(const QelMessageExchIntCapabilitiesBase&) = default;

    void pDerivedDebug(std::ostream& os) const override;

private:
    using Metadata =
        QelMessageMetadata<Derived, QelMessageFunctionQelInterfaceCmp, QelMessageOpExchIntCapabilities, Classification>;

    void pStore(std::uint32_t capabilityLen, const QelCapabilities& capabilities);
};

/// A peer sends the capabilities that it supports.
class QEL_EXPORT QelMessageExchIntCapabilitiesReq
    : public QelMessageExchIntCapabilitiesBase<QelMessageExchIntCapabilitiesReq, QelMessageClassification::Request> {
public:
    /// Builds 4 bytes of capability bits.
    explicit QelMessageExchIntCapabilitiesReq(const QelCapabilities& capabilities);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageMetadata does; then "dataLength smaller than minimum
    ///         acceptable size" (below 4 bytes), "Given capability length is invalid (length % 4 wasn't 0)",
    ///         "capabilityLen larger than acceptable" (more than there is)
    QelMessageExchIntCapabilitiesReq(const char* i_buffer, unsigned int i_length);
    ~QelMessageExchIntCapabilitiesReq() override;
};

/// The other peer responds with its own capabilities, or with those that both support.
class QEL_EXPORT QelMessageExchIntCapabilitiesRsp
    : public QelMessageExchIntCapabilitiesBase<QelMessageExchIntCapabilitiesRsp, QelMessageClassification::Response> {
public:
    /// Builds with a new caller id, or with the caller id of the request.
    /// @param capabilityLen bytes of capability bits, a multiple of 4; 0 carries no bits, and bytes after the fourth
    ///        are zero
    /// @throws QelMessageValidationException "Given capability length is invalid (length % 4 wasn't 0)"
    /// @throws std::invalid_argument "length": the frame length would not fit its 32-bit field
    QelMessageExchIntCapabilitiesRsp(std::uint32_t capabilityLen, const QelCapabilities& capabilities);
    QelMessageExchIntCapabilitiesRsp(std::uint32_t callerId, std::uint32_t capabilityLen,
                                     const QelCapabilities& capabilities);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageExchIntCapabilitiesReq does
    QelMessageExchIntCapabilitiesRsp(const char* i_buffer, unsigned int i_length);
    ~QelMessageExchIntCapabilitiesRsp() override;
};

/// Asks for the limits of the hypervisor side. No payload.
class QEL_EXPORT QelMessageGetInterfaceLimitsReq
    : public QelMessageMetadata<QelMessageGetInterfaceLimitsReq, QelMessageFunctionQelInterfaceCmp,
                                QelMessageOpGetInterfaceImplementationLimits, QelMessageClassification::Request> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageGetInterfaceLimitsReq() override;
};

/// Responds with the limits of this library; the values never change.
///
/// This class is only built, never parsed: a received response is a plain QelMessage. Compare its dataLength() with
/// sizeof(Data), then view its payload as `Data`. debug() prints no payload fields.
class QEL_EXPORT QelMessageGetInterfaceLimitsRsp
    : public QelMessageMetadata<QelMessageGetInterfaceLimitsRsp, QelMessageFunctionQelInterfaceCmp,
                                QelMessageOpGetInterfaceImplementationLimits, QelMessageClassification::Response> {
public:
    struct Data {
        be_uint16_t mMaxCommandSize;              //  0  bytes of the longest frame: 16384
        be_uint16_t mMaxKrogCommandSize;          //  2  bytes of the longest frame for the hypervisor: 4096
        be_uint16_t mBroadcastMsgPacketSize;      //  4  bytes of the longest broadcast message: 16306
        unsigned char mReserved1[2];              //  6
        unsigned char mDaxsSupported;             //  8  consoles that may be connected at one time
        unsigned char mReserved2[3];              //  9
        be_uint16_t mNonpersistentLocksSupported; // 12
        be_uint16_t mPersistentLocksSupported;    // 14
    };
    static_assert(sizeof(Data) == 16 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mMaxKrogCommandSize) == 2 && offsetof(Data, mBroadcastMsgPacketSize) == 4 &&
                      offsetof(Data, mReserved1) == 6 && offsetof(Data, mDaxsSupported) == 8 &&
                      offsetof(Data, mReserved2) == 9 && offsetof(Data, mNonpersistentLocksSupported) == 12 &&
                      offsetof(Data, mPersistentLocksSupported) == 14,
                  "overlays the frame buffer");

    static constexpr unsigned int DAXS_SUPPORTED = 2;
    static constexpr unsigned int NON_PERSISTENT_LOCKS_SUPPORTED = 0;
    static constexpr unsigned int PERSISTENT_LOCKS_SUPPORTED = 0;

    /// Builds with a new caller id, or with the caller id of the request.
    QelMessageGetInterfaceLimitsRsp();
    explicit QelMessageGetInterfaceLimitsRsp(std::uint32_t callerId);

    ~QelMessageGetInterfaceLimitsRsp() override;
};

/// A console broadcasts a message to the other consoles. The hypervisor side relays the bytes, unchanged, as a
/// QelMessageDaxBroadcastOutboundAsync.
class QEL_EXPORT QelMessageDaxBroadcastReq
    : public QelMessageMetadata<QelMessageDaxBroadcastReq, QelMessageFunctionQelInterfaceCmp, QelMessageOpDaxBroadcast,
                                QelMessageClassification::Request> {
public:
    struct Data {
        be_uint16_t mOffset;          //  0  offset of the message in the payload: 46 when built, or more
        unsigned char mBroadcastType; //  2
        unsigned char mReserved0;     //  3
        be_uint16_t mBroadcastMsgLen; //  4  bytes of the message
        unsigned char mReserved1[2];  //  6
        be_uint32_t mToolType;        //  8  tool type of the addressee
        be_uint16_t mToolIdLen;       // 12  meaningful bytes of mToolId, at most 32
        char mToolId[32];             // 14  tool id of the addressee
        /* bytes of a later protocol level, skipped; then the message, mBroadcastMsgLen bytes at mOffset */
    };
    static_assert(sizeof(Data) == 46 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mBroadcastType) == 2 && offsetof(Data, mReserved0) == 3 &&
                      offsetof(Data, mBroadcastMsgLen) == 4 && offsetof(Data, mReserved1) == 6 &&
                      offsetof(Data, mToolType) == 8 && offsetof(Data, mToolIdLen) == 12 &&
                      offsetof(Data, mToolId) == 14,
                  "overlays the frame buffer");

    /// The broadcast type that addresses one tool; it needs a tool id. The programs define the other types.
    static constexpr std::uint8_t kUnicast = 1;

    /// Builds a message; the checks run in the order of the texts.
    /// @param toolId of the addressee, at most 32 bytes; may be empty unless the type is kUnicast
    /// @param broadcastMsg `broadcastMsgLen` bytes, copied; may be null when that is 0
    /// @throws QelMessageValidationException "Unicast message has no valid toolID"; "toolIdLen greater than maximum
    ///         acceptable size"
    /// @throws std::invalid_argument "data": null with a length other than 0
    QelMessageDaxBroadcastReq(std::uint8_t broadcastType, std::uint16_t broadcastMsgLen, std::uint32_t toolType,
                              const std::string& toolId, const char* broadcastMsg);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageMetadata does; then "dataLength smaller than minimum
    ///         acceptable size" (below 46 bytes), "message offset less than minimum acceptable size" (below 46),
    ///         "message greater than maximum acceptable size" (ends past the payload), "Unicast message has no valid
    ///         toolID", "toolIdLen greater than maximum acceptable size" (above 32)
    QelMessageDaxBroadcastReq(const char* i_buffer, unsigned int i_length);
    ~QelMessageDaxBroadcastReq() override;

    /// The broadcast type.
    std::uint8_t getBroadcastMode() const { return pPayload<Data>().mBroadcastType; }
    std::uint32_t getToolType() const { return pPayload<Data>().mToolType; }
    std::uint16_t getBroadcastMsgLen() const { return pPayload<Data>().mBroadcastMsgLen; }
    std::string getToolId() const { return std::string(pPayload<Data>().mToolId, pPayload<Data>().mToolIdLen); }
    /// The message, getBroadcastMsgLen() bytes, in place. Never null, but not to be read when the length is 0.
    const char* getDaxPacket() const { return getData() + pGetDataOffset(); }

protected:
    void pDerivedDebug(std::ostream& os) const override;

private:
    std::uint16_t pGetDataOffset() const { return pPayload<Data>().mOffset; }
};

/// Response to QelMessageDaxBroadcastReq. No payload.
class QEL_EXPORT QelMessageDaxBroadcastRsp
    : public QelMessageMetadata<QelMessageDaxBroadcastRsp, QelMessageFunctionQelInterfaceCmp, QelMessageOpDaxBroadcast,
                                QelMessageClassification::Response> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageDaxBroadcastRsp() override;
};

/// Asks for the time of day. No payload.
class QEL_EXPORT QelMessageGetQelTodReq
    : public QelMessageMetadata<QelMessageGetQelTodReq, QelMessageFunctionQelInterfaceCmp, QelMessageOpGetQelTod,
                                QelMessageClassification::Request> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageGetQelTodReq() override;
};

/// Responds with the time of day, in UTC.
///
/// This class is only built, never parsed: a received response is a plain QelMessage. Compare its dataLength() with
/// sizeof(Data), then view its payload as `Data`.
class QEL_EXPORT QelMessageGetQelTodRsp
    : public QelMessageMetadata<QelMessageGetQelTodRsp, QelMessageFunctionQelInterfaceCmp, QelMessageOpGetQelTod,
                                QelMessageClassification::Response> {
public:
    struct Data {            // all in binary-coded decimal
        bcd_uint16_t mYear;  //  0  four digits: 0x20 0x24 is the year 2024
        bcd_uint8_t mMonth;  //  2  1 to 12
        bcd_uint8_t mDay;    //  3  1 to 31
        bcd_uint8_t mHour;   //  4  0 to 23
        bcd_uint8_t mMinute; //  5  0 to 59
        bcd_uint8_t mSecond; //  6  0 to 60
        bcd_uint8_t mRsvd;   //  7
    };
    static_assert(sizeof(Data) == 8 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mMonth) == 2 && offsetof(Data, mDay) == 3 && offsetof(Data, mHour) == 4 &&
                      offsetof(Data, mMinute) == 5 && offsetof(Data, mSecond) == 6 && offsetof(Data, mRsvd) == 7,
                  "overlays the frame buffer");

    /// Builds with a new caller id, or with the caller id of the request.
    /// @param time seconds since the epoch, 1970-01-01 00:00:00 UTC; the local time zone has no effect
    /// @throws std::range_error "type cannot be represented in BCD": the year is not in [0, 9999], or the C library
    ///         cannot convert the time
    explicit QelMessageGetQelTodRsp(const std::time_t& time);
    QelMessageGetQelTodRsp(std::uint32_t callerId, const std::time_t& time);

    ~QelMessageGetQelTodRsp() override;

protected:
    void pDerivedDebug(std::ostream& os) const override;
};

/// The payload of the global mode attribute: a mode and the text that names a machine (type, model and serial number).
///
/// Builders do not limit the text: the payload holds all of it, the length field its length modulo 65536. Use the two
/// concrete classes.
/// @tparam Derived the concrete class, with the identity that the other arguments give
template <typename Derived, QelMessageOpTypes OpType, QelMessageClassification::Value Classification>
class QEL_EXPORT QelMessageGlobalModeAttributeBase
    : public QelMessageMetadata<Derived, QelMessageFunctionQelInterfaceCmp, OpType, Classification> {
public:
    struct Data {
        unsigned char mMode;     //  0
        unsigned char mReserved; //  1
        be_uint16_t mMTMSLen;    //  2  bytes of mMTMS
        /* mMTMS                     4  mMTMSLen bytes */
    };
    static_assert(sizeof(Data) == 4 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mReserved) == 1 && offsetof(Data, mMTMSLen) == 2, "overlays the frame buffer");

    ~QelMessageGlobalModeAttributeBase() override;

    /// The programs define what a mode means.
    std::uint8_t getMode() const { return this->template pPayload<Data>().mMode; }
    std::uint16_t getMTMSLen() const { return this->template pPayload<Data>().mMTMSLen; }
    std::string getMTMS() const { return std::string(this->getData() + sizeof(Data), getMTMSLen()); }

protected:
    /// Builds with a new caller id, or with the given one.
    QelMessageGlobalModeAttributeBase(std::uint8_t mode, const std::string& mtms);
    QelMessageGlobalModeAttributeBase(std::uint32_t callerId, std::uint8_t mode, const std::string& mtms);
    QelMessageGlobalModeAttributeBase(const char* i_buffer, unsigned int i_length);
    QelMessageGlobalModeAttributeBase(const QelMessageGlobalModeAttributeBase&) = default;
    QelMessageGlobalModeAttributeBase& operator=(const QelMessageGlobalModeAttributeBase&) = default;

    void pDerivedDebug(std::ostream& os) const override;

private:
    using Metadata = QelMessageMetadata<Derived, QelMessageFunctionQelInterfaceCmp, OpType, Classification>;

    void pStore(std::uint8_t mode, const std::string& mtms);
};

/// Sets the global mode attribute. This library has no class for the response: a received one is a plain QelMessage.
class QEL_EXPORT QelMessageSetGlobalModeAttributeReq
    : public QelMessageGlobalModeAttributeBase<QelMessageSetGlobalModeAttributeReq, QelMessageOpSetGlobalModeAttribute,
                                               QelMessageClassification::Request> {
public:
    /// @param mtms any length. From 65536 bytes on the length field wraps, and the receiver reads a shorter text.
    /// @throws std::invalid_argument "length": the frame length would not fit its 32-bit field
    QelMessageSetGlobalModeAttributeReq(std::uint8_t mode, const std::string& mtms);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageMetadata does; then "dataLength smaller than minimum
    ///         acceptable size" (below 4 bytes), "mtmsLen larger than acceptable" (more than there is)
    QelMessageSetGlobalModeAttributeReq(const char* i_buffer, unsigned int i_length);
    ~QelMessageSetGlobalModeAttributeReq() override;
};

/// Asks for the global mode attribute. No payload.
class QEL_EXPORT QelMessageGetGlobalModeAttributeReq
    : public QelMessageMetadata<QelMessageGetGlobalModeAttributeReq, QelMessageFunctionQelInterfaceCmp,
                                QelMessageOpGetGlobalModeAttribute, QelMessageClassification::Request> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageGetGlobalModeAttributeReq() override;
};

/// Responds with the global mode attribute.
class QEL_EXPORT QelMessageGetGlobalModeAttributeRsp
    : public QelMessageGlobalModeAttributeBase<QelMessageGetGlobalModeAttributeRsp, QelMessageOpGetGlobalModeAttribute,
                                               QelMessageClassification::Response> {
public:
    /// Builds with a new caller id, or with the caller id of the request.
    /// @param mtms as in QelMessageSetGlobalModeAttributeReq
    /// @throws std::invalid_argument "length": the frame length would not fit its 32-bit field
    QelMessageGetGlobalModeAttributeRsp(std::uint8_t mode, const std::string& mtms);
    QelMessageGetGlobalModeAttributeRsp(std::uint32_t callerId, std::uint8_t mode, const std::string& mtms);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageSetGlobalModeAttributeReq does
    QelMessageGetGlobalModeAttributeRsp(const char* i_buffer, unsigned int i_length);
    ~QelMessageGetGlobalModeAttributeRsp() override;
};

/// The payload of the global save-area metadata: a length and that many opaque bytes.
///
/// Builders do not limit the metadata: the payload holds all bytes, the length field their number modulo 65536. Use the
/// two concrete classes.
/// @tparam Derived the concrete class, with the identity that the other arguments give
template <typename Derived, QelMessageOpTypes OpType, QelMessageClassification::Value Classification>
class QEL_EXPORT QelMessageGlobalSaveAreaMetadataBase
    : public QelMessageMetadata<Derived, QelMessageFunctionQelInterfaceCmp, OpType, Classification> {
public:
    struct Data {
        be_uint16_t mMetadataLen; //  0  bytes of mMetadata
        /* mMetadata                  2  mMetadataLen bytes */
    };
    static_assert(sizeof(Data) == 2 && alignof(Data) == 1, "overlays the frame buffer");

    ~QelMessageGlobalSaveAreaMetadataBase() override;

    std::uint16_t getMetadataLen() const { return this->template pPayload<Data>().mMetadataLen; }
    std::string getMetadata() const { return std::string(this->getData() + sizeof(Data), getMetadataLen()); }

protected:
    /// Builds with a new caller id, or with the given one.
    explicit QelMessageGlobalSaveAreaMetadataBase(const std::string& metadata);
    QelMessageGlobalSaveAreaMetadataBase(std::uint32_t callerId, const std::string& metadata);
    QelMessageGlobalSaveAreaMetadataBase(const char* i_buffer, unsigned int i_length);
    QelMessageGlobalSaveAreaMetadataBase(const QelMessageGlobalSaveAreaMetadataBase&) = default;
    QelMessageGlobalSaveAreaMetadataBase& operator=(const QelMessageGlobalSaveAreaMetadataBase&) = default;

    void pDerivedDebug(std::ostream& os) const override;

private:
    using Metadata = QelMessageMetadata<Derived, QelMessageFunctionQelInterfaceCmp, OpType, Classification>;

    void pStore(const std::string& metadata);
};

/// Sets the global save-area metadata.
class QEL_EXPORT QelMessageSetGlobalSaveAreaMetadataReq
    : public QelMessageGlobalSaveAreaMetadataBase<QelMessageSetGlobalSaveAreaMetadataReq,
                                                  QelMessageOpSetGlobalSaveAreaMetadata,
                                                  QelMessageClassification::Request> {
public:
    /// @param metadata any length. From 65536 bytes on the length field wraps, and the receiver reads fewer bytes.
    /// @throws std::invalid_argument "length": the frame length would not fit its 32-bit field
    explicit QelMessageSetGlobalSaveAreaMetadataReq(const std::string& metadata);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageMetadata does; then "dataLength smaller than minimum
    ///         acceptable size" (below 2 bytes), "metadataLen larger than acceptable" (more than there is)
    QelMessageSetGlobalSaveAreaMetadataReq(const char* i_buffer, unsigned int i_length);
    ~QelMessageSetGlobalSaveAreaMetadataReq() override;
};

/// Response to QelMessageSetGlobalSaveAreaMetadataReq. No payload.
class QEL_EXPORT QelMessageSetGlobalSaveAreaMetadataRsp
    : public QelMessageMetadata<QelMessageSetGlobalSaveAreaMetadataRsp, QelMessageFunctionQelInterfaceCmp,
                                QelMessageOpSetGlobalSaveAreaMetadata, QelMessageClassification::Response> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageSetGlobalSaveAreaMetadataRsp() override;
};

/// Asks for the global save-area metadata. No payload.
class QEL_EXPORT QelMessageGetGlobalSaveAreaMetadataReq
    : public QelMessageMetadata<QelMessageGetGlobalSaveAreaMetadataReq, QelMessageFunctionQelInterfaceCmp,
                                QelMessageOpGetGlobalSaveAreaMetadata, QelMessageClassification::Request> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageGetGlobalSaveAreaMetadataReq() override;
};

/// Responds with the global save-area metadata.
class QEL_EXPORT QelMessageGetGlobalSaveAreaMetadataRsp
    : public QelMessageGlobalSaveAreaMetadataBase<QelMessageGetGlobalSaveAreaMetadataRsp,
                                                  QelMessageOpGetGlobalSaveAreaMetadata,
                                                  QelMessageClassification::Response> {
public:
    /// Builds with a new caller id, or with the caller id of the request.
    /// @param metadata as in QelMessageSetGlobalSaveAreaMetadataReq
    /// @throws std::invalid_argument "length": the frame length would not fit its 32-bit field
    explicit QelMessageGetGlobalSaveAreaMetadataRsp(const std::string& metadata);
    QelMessageGetGlobalSaveAreaMetadataRsp(std::uint32_t callerId, const std::string& metadata);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageSetGlobalSaveAreaMetadataReq does
    QelMessageGetGlobalSaveAreaMetadataRsp(const char* i_buffer, unsigned int i_length);
    ~QelMessageGetGlobalSaveAreaMetadataRsp() override;
};

// The library instantiates the templates, for these six classes only.
extern template class QelMessageExchIntCapabilitiesBase<QelMessageExchIntCapabilitiesReq,
                                                        QelMessageClassification::Request>;
extern template class QelMessageExchIntCapabilitiesBase<QelMessageExchIntCapabilitiesRsp,
                                                        QelMessageClassification::Response>;
extern template class QelMessageGlobalModeAttributeBase<
    QelMessageSetGlobalModeAttributeReq, QelMessageOpSetGlobalModeAttribute, QelMessageClassification::Request>;
extern template class QelMessageGlobalModeAttributeBase<
    QelMessageGetGlobalModeAttributeRsp, QelMessageOpGetGlobalModeAttribute, QelMessageClassification::Response>;
extern template class QelMessageGlobalSaveAreaMetadataBase<
    QelMessageSetGlobalSaveAreaMetadataReq, QelMessageOpSetGlobalSaveAreaMetadata, QelMessageClassification::Request>;
extern template class QelMessageGlobalSaveAreaMetadataBase<
    QelMessageGetGlobalSaveAreaMetadataRsp, QelMessageOpGetGlobalSaveAreaMetadata, QelMessageClassification::Response>;

} // namespace qel
