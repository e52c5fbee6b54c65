#pragma once

#include <qel/common/EndianExtensions.hpp>
#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessageMetadata.hpp>

#include <cstddef>
#include <cstdint>
#include <iosfwd>

/// @file
/// The messages of virtual serial sessions, the serial consoles of partitions: function code 0x6002, and 0x7000 for
/// asynchronous messages to the console. The id of a logical partition and a connection number address a session; the
/// programs define both.
///
/// For all of them:
/// - A builder makes a frame of the new header form; reserved fields are sent as zero. It checks its arguments only
///   where the class says so. A response carries the caller id of its request; all others draw a new one.
/// - The constructor from bytes parses a received frame of `i_length` bytes. It checks the frame, then the identity,
///   then the payload, and keeps a copy. Reserved fields are not checked, and a payload longer than needed is accepted.
///   A payload shorter than `Data`, or than `Data` and the serial data, is refused.
/// - The nested `Data` is the fixed part of the payload as it lies in the frame: offsets from the first payload byte,
///   integers big-endian.
/// - Ownership: a message owns its frame; pointers into it live as long as the message. Thread safety: as QelMessage,
///   one thread at a time.

namespace qel {

/// The session address, at the start of every payload of this file except that of the maximum-sessions response.
struct QelVirtualSerialAddress {
    be_uint16_t mLparId;              //  0  logical partition id
    be_uint16_t mVssConnectionNumber; //  2  connection number of the session
};
static_assert(sizeof(QelVirtualSerialAddress) == 4 && alignof(QelVirtualSerialAddress) == 1 &&
                  offsetof(QelVirtualSerialAddress, mVssConnectionNumber) == 2,
              "overlays the frame buffer");

/// Base of the messages whose payload begins with a session address. Use the concrete classes.
/// @tparam Derived the concrete class, with the identity that the other arguments give
template <typename Derived, QelMessageFunctionCodes FunctionCode, QelMessageOpTypes OpType,
          QelMessageClassification::Value Classification>
class QEL_EXPORT QelMessageVirtualSerialAddressed
    : public QelMessageMetadata<Derived, FunctionCode, OpType, Classification> {
public:
    std::uint16_t getLpId() const { return this->template pPayload<QelVirtualSerialAddress>().mLparId; }
    std::uint16_t getVssConnectionNumber() const
    {
        return this->template pPayload<QelVirtualSerialAddress>().mVssConnectionNumber;
    }

protected:
    /// Builds with a new caller id. The rest of the payload, which has the given length in all, is zero.
    QelMessageVirtualSerialAddressed(std::uint16_t lpId, std::uint16_t vssConnectionNumber,
                                     QelMessage::PayloadLength payloadLength)
        : Metadata(payloadLength)
    {
        pStoreAddress(lpId, vssConnectionNumber);
    }

    /// The same with the given caller id.
    QelMessageVirtualSerialAddressed(std::uint32_t callerId, std::uint16_t lpId, std::uint16_t vssConnectionNumber,
                                     QelMessage::PayloadLength payloadLength)
        : Metadata(callerId, payloadLength)
    {
        pStoreAddress(lpId, vssConnectionNumber);
    }

    /// Parses a received frame. The concrete class checks that the payload is long enough.
    /// @throws QelMessageValidationException as QelMessageMetadata does
    QelMessageVirtualSerialAddressed(const char* i_buffer, unsigned int i_length) : Metadata(i_buffer, i_length) {}

    QelMessageVirtualSerialAddressed(const QelMessageVirtualSerialAddressed&) = default;
    QelMessageVirtualSerialAddressed& operator=(const QelMessageVirtualSerialAddressed&) = default;
    ~QelMessageVirtualSerialAddressed() override = default;

private:
    using Metadata = QelMessageMetadata<Derived, FunctionCode, OpType, Classification>;

    void pStoreAddress(std::uint16_t lpId, std::uint16_t vssConnectionNumber)
    {
        QelVirtualSerialAddress& address = this->template pPayload<QelVirtualSerialAddress>();
        address.mLparId = lpId;
        address.mVssConnectionNumber = vssConnectionNumber;
    }
};

/// Opens a session with the serial console of a partition.
class QEL_EXPORT QelMessageVirtualSerialOpenReq
    : public QelMessageVirtualSerialAddressed<QelMessageVirtualSerialOpenReq, QelMessageFunctionVirtualSerial,
                                              QelMessageOpOpenVirtualSerialSession, QelMessageClassification::Request> {
public:
    struct Data {
        QelVirtualSerialAddress mAddress; //  0
        be_uint16_t mFlags;               //  4  bit 15: force open; the others are sent as zero
        be_uint16_t mReserved;            //  6
    };
    static_assert(sizeof(Data) == 8 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mFlags) == 4 && offsetof(Data, mReserved) == 6, "overlays the frame buffer");

    /// @param forceOpen take the session even if another console holds it
    QelMessageVirtualSerialOpenReq(std::uint16_t lpId, std::uint16_t vssConnectionNumber, bool forceOpen);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageMetadata; then "dataLength shorter than actual data size"
    QelMessageVirtualSerialOpenReq(const char* i_buffer, unsigned int i_length);
    ~QelMessageVirtualSerialOpenReq() override;

    bool isForceOpen() const { return (pPayload<Data>().mFlags & kForceOpen) != 0; }

protected:
    void pDerivedDebug(std::ostream& os) const override;

private:
    static constexpr std::uint16_t kForceOpen = 0x8000;
};

/// Response to QelMessageVirtualSerialOpenReq.
class QEL_EXPORT QelMessageVirtualSerialOpenRsp
    : public QelMessageVirtualSerialAddressed<QelMessageVirtualSerialOpenRsp, QelMessageFunctionVirtualSerial,
                                              QelMessageOpOpenVirtualSerialSession,
                                              QelMessageClassification::Response> {
public:
    struct Data {
        QelVirtualSerialAddress mAddress; //  0
        be_uint32_t mReserved;            //  4
    };
    static_assert(sizeof(Data) == 8 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mReserved) == 4, "overlays the frame buffer");

    /// @param callerId that of the request
    QelMessageVirtualSerialOpenRsp(std::uint32_t callerId, std::uint16_t lpId, std::uint16_t vssConnectionNumber);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageMetadata; then "dataLength shorter than actual data size"
    QelMessageVirtualSerialOpenRsp(const char* i_buffer, unsigned int i_length);
    ~QelMessageVirtualSerialOpenRsp() override;

protected:
    void pDerivedDebug(std::ostream& os) const override;
};

/// Closes a session.
class QEL_EXPORT QelMessageVirtualSerialCloseReq
    : public QelMessageVirtualSerialAddressed<QelMessageVirtualSerialCloseReq, QelMessageFunctionVirtualSerial,
                                              QelMessageOpCloseVirtualSerialSession,
                                              QelMessageClassification::Request> {
public:
    struct Data {
        QelVirtualSerialAddress mAddress; //  0
        unsigned char mForceClose;        //  4  0xFF: force close, 0x00: normal close
    };
    static_assert(sizeof(Data) == 5 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mForceClose) == 4, "overlays the frame buffer");

    /// @param forceClose close the session even if another console holds it
    QelMessageVirtualSerialCloseReq(std::uint16_t lpId, std::uint16_t vssConnectionNumber, bool forceClose);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageMetadata; then "dataLength shorter than actual data size"
    QelMessageVirtualSerialCloseReq(const char* i_buffer, unsigned int i_length);
    ~QelMessageVirtualSerialCloseReq() override;

    /// True for 0xFF only; any other byte means a normal close.
    bool isForceClose() const { return pPayload<Data>().mForceClose == kForceClose; }

protected:
    void pDerivedDebug(std::ostream& os) const override;

private:
    static constexpr unsigned char kForceClose = 0xFF;
};

/// Response to QelMessageVirtualSerialCloseReq. No payload.
class QEL_EXPORT QelMessageVirtualSerialCloseRsp
    : public QelMessageMetadata<QelMessageVirtualSerialCloseRsp, QelMessageFunctionVirtualSerial,
                                QelMessageOpCloseVirtualSerialSession, QelMessageClassification::Response> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageVirtualSerialCloseRsp() override;
};

/// Asks for the maximum number of sessions. No payload.
class QEL_EXPORT QelMessageVirtualSerialGetMaxSessionsReq
    : public QelMessageMetadata<QelMessageVirtualSerialGetMaxSessionsReq, QelMessageFunctionVirtualSerial,
                                QelMessageOpGetMaxVirtualSerialSessions, QelMessageClassification::Request> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageVirtualSerialGetMaxSessionsReq() override;
};

/// Responds with the maximum number of sessions.
class QEL_EXPORT QelMessageVirtualSerialGetMaxSessionsRsp
    : public QelMessageMetadata<QelMessageVirtualSerialGetMaxSessionsRsp, QelMessageFunctionVirtualSerial,
                                QelMessageOpGetMaxVirtualSerialSessions, QelMessageClassification::Response> {
public:
    struct Data {
        be_uint16_t mMaxCec;    //  0  maximum number of systems
        unsigned char mMaxLpar; //  2  maximum number of partitions
    };
    static_assert(sizeof(Data) == 3 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mMaxLpar) == 2, "overlays the frame buffer");

    /// @param callerId that of the request
    QelMessageVirtualSerialGetMaxSessionsRsp(std::uint32_t callerId, std::uint16_t maxCec, std::uint8_t maxLpar);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageMetadata; then "dataLength shorter than actual data size"
    QelMessageVirtualSerialGetMaxSessionsRsp(const char* i_buffer, unsigned int i_length);
    ~QelMessageVirtualSerialGetMaxSessionsRsp() override;

    std::uint16_t getMaxCec() const { return pPayload<Data>().mMaxCec; }
    std::uint8_t getMaxLpar() const { return pPayload<Data>().mMaxLpar; }

protected:
    void pDerivedDebug(std::ostream& os) const override;
};

/// Serial data. Each direction has its own class: use the two concrete classes.
///
/// Up to 65535 bytes of data can be built, but a frame longer than QelMessage::MtuMax cannot be sent.
/// @tparam Derived the concrete class, with the identity that the other arguments give
template <typename Derived, QelMessageFunctionCodes FunctionCode, QelMessageOpTypes OpType>
class QEL_EXPORT QelMessageVirtualSerialDataAsync
    : public QelMessageVirtualSerialAddressed<Derived, FunctionCode, OpType, QelMessageClassification::Async> {
public:
    struct Data {
        QelVirtualSerialAddress mAddress; //  0
        be_uint16_t mDataLength;          //  4  bytes of serial data
        /* the serial data                    6  mDataLength raw bytes */
    };
    static_assert(sizeof(Data) == 6 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mDataLength) == 4, "overlays the frame buffer");

    ~QelMessageVirtualSerialDataAsync() override;

    /// Bytes of serial data.
    std::uint16_t getSerialDataLength() const { return this->template pPayload<Data>().mDataLength; }

    /// The serial data, getSerialDataLength() bytes, in place; null when that is 0.
    const char* getSerialData() const { return getSerialDataLength() == 0 ? nullptr : this->getData() + sizeof(Data); }

protected:
    QelMessageVirtualSerialDataAsync(std::uint16_t lpId, std::uint16_t vssConnectionNumber, std::uint16_t dataLength,
                                     const char* data);
    QelMessageVirtualSerialDataAsync(const char* i_buffer, unsigned int i_length);
    QelMessageVirtualSerialDataAsync(const QelMessageVirtualSerialDataAsync&) = default;
    QelMessageVirtualSerialDataAsync& operator=(const QelMessageVirtualSerialDataAsync&) = default;

    void pDerivedDebug(std::ostream& os) const override;

private:
    using Addressed = QelMessageVirtualSerialAddressed<Derived, FunctionCode, OpType, QelMessageClassification::Async>;
};

/// Serial data to the operating system of the partition: keyboard input.
class QEL_EXPORT QelMessageVirtualSerialDataToOsAsync
    : public QelMessageVirtualSerialDataAsync<QelMessageVirtualSerialDataToOsAsync, QelMessageFunctionVirtualSerial,
                                              QelMessageOpSendVirtualSerialDataToOs> {
public:
    /// @param data `dataLength` bytes, copied; may be null when that is 0
    /// @throws std::invalid_argument "data": null with a length other than 0
    QelMessageVirtualSerialDataToOsAsync(std::uint16_t lpId, std::uint16_t vssConnectionNumber,
                                         std::uint16_t dataLength, const char* data);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageMetadata; then "dataLength shorter than actual data size"
    QelMessageVirtualSerialDataToOsAsync(const char* i_buffer, unsigned int i_length);
    ~QelMessageVirtualSerialDataToOsAsync() override;
};

/// Serial data to the console: output of the partition.
class QEL_EXPORT QelMessageVirtualSerialDataToDaxAsync
    : public QelMessageVirtualSerialDataAsync<QelMessageVirtualSerialDataToDaxAsync, QelMessageFunctionDax,
                                              QelMessageOpSendVirtualSerialDataToMc> {
public:
    /// @param data `dataLength` bytes, copied; may be null when that is 0
    /// @throws std::invalid_argument "data": null with a length other than 0
    QelMessageVirtualSerialDataToDaxAsync(std::uint16_t lpId, std::uint16_t vssConnectionNumber,
                                          std::uint16_t dataLength, const char* data);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageMetadata; then "dataLength shorter than actual data size"
    QelMessageVirtualSerialDataToDaxAsync(const char* i_buffer, unsigned int i_length);
    ~QelMessageVirtualSerialDataToDaxAsync() override;
};

/// Sets up an open session for data.
class QEL_EXPORT QelMessageVirtualSerialSetupSessionReq
    : public QelMessageVirtualSerialAddressed<QelMessageVirtualSerialSetupSessionReq, QelMessageFunctionVirtualSerial,
                                              QelMessageOpSetupVirtualSerialSession,
                                              QelMessageClassification::Request> {
public:
    struct Data {
        QelVirtualSerialAddress mAddress; //  0
    };
    static_assert(sizeof(Data) == 4 && alignof(Data) == 1, "overlays the frame buffer");

    QelMessageVirtualSerialSetupSessionReq(std::uint16_t lpId, std::uint16_t vssConnectionNumber);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageMetadata; then "dataLength shorter than actual data size"
    QelMessageVirtualSerialSetupSessionReq(const char* i_buffer, unsigned int i_length);
    ~QelMessageVirtualSerialSetupSessionReq() override;

protected:
    void pDerivedDebug(std::ostream& os) const override;
};

/// Response to QelMessageVirtualSerialSetupSessionReq. No payload.
class QEL_EXPORT QelMessageVirtualSerialSetupSessionRsp
    : public QelMessageMetadata<QelMessageVirtualSerialSetupSessionRsp, QelMessageFunctionVirtualSerial,
                                QelMessageOpSetupVirtualSerialSession, QelMessageClassification::Response> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageVirtualSerialSetupSessionRsp() override;
};

/// Notifies the console that its session was closed, and why.
class QEL_EXPORT QelMessageVirtualSerialSessionClosedAsync
    : public QelMessageVirtualSerialAddressed<QelMessageVirtualSerialSessionClosedAsync, QelMessageFunctionDax,
                                              QelMessageOpSendVirtualSerialSessionClosed,
                                              QelMessageClassification::Async> {
public:
    enum CloseReason : unsigned int {
        CloseReasonMin = 1,
        CloseReasonUnknown = 1,
        CloseReasonForceClose = 2,   ///< another console took the session
        CloseReasonQelShutdown = 3,  ///< the hypervisor side shuts down
        CloseReasonReadFailure = 4,  ///< reading from the partition failed
        CloseReasonWriteFailure = 5, ///< writing to the partition failed
        CloseReasonMax = 5
    };

    struct Data {
        QelVirtualSerialAddress mAddress; //  0
        be_uint32_t mCloseReason;         //  4  a CloseReason
    };
    static_assert(sizeof(Data) == 8 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mCloseReason) == 4, "overlays the frame buffer");

    /// @param reason sent without a check
    QelMessageVirtualSerialSessionClosedAsync(std::uint16_t lpId, std::uint16_t vssConnectionNumber,
                                              CloseReason reason);

    /// Parses a received frame.
    /// @throws QelMessageValidationException as QelMessageMetadata; then "dataLength shorter than actual data size"
    QelMessageVirtualSerialSessionClosedAsync(const char* i_buffer, unsigned int i_length);
    ~QelMessageVirtualSerialSessionClosedAsync() override;

    /// A number outside [CloseReasonMin, CloseReasonMax] reads as CloseReasonUnknown; debug() prints the number.
    CloseReason getCloseReason() const
    {
        const std::uint32_t reason = pPayload<Data>().mCloseReason;
        if (reason < CloseReasonMin || reason > CloseReasonMax) return CloseReasonUnknown;
        return static_cast<CloseReason>(reason);
    }

protected:
    void pDerivedDebug(std::ostream& os) const override;
};

// The library instantiates the template, for these two classes only.
extern template class QelMessageVirtualSerialDataAsync<
    QelMessageVirtualSerialDataToOsAsync, QelMessageFunctionVirtualSerial, QelMessageOpSendVirtualSerialDataToOs>;
extern template class QelMessageVirtualSerialDataAsync<QelMessageVirtualSerialDataToDaxAsync, QelMessageFunctionDax,
                                                       QelMessageOpSendVirtualSerialDataToMc>;

} // namespace qel
