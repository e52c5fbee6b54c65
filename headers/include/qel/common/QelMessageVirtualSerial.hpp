#pragma once

#include <qel/common/EndianExtensions.hpp>
#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessageMetadata.hpp>

#include <cstddef>
#include <cstdint>
#include <iosfwd>

/// @file
/// The messages of virtual serial sessions, the serial consoles of partitions: function code 0x6002, and 0x7000 for
/// what goes to the console unasked. A session is addressed by the id of a logical partition and a connection number;
/// what both mean is up to the programs.
///
/// What holds for all of them:
/// - A builder makes a frame of the new header form; reserved fields are sent as zero. It checks nothing but what is
///   said at the class. Responses are given the caller id of their request; all others take a new one.
/// - The constructor from bytes takes any frame of the class's identity. It checks the frame, then the identity, then
///   the payload, and keeps a copy. Reserved fields are not checked, and a payload longer than needed is accepted; a
///   payload shorter than `Data`, or than `Data` and the serial data together, is refused with
///   QelMessageValidationException "dataLength shorter than actual data size".
/// - The nested `Data` is the fixed part of the payload as it lies in the frame: offsets from the first payload byte,
///   integers big-endian.
/// - Ownership: a message owns its frame; pointers into it live as long as the message. Thread safety: none, as in
///   QelMessage.

namespace qel {

/// Asks for a session with the serial console of a partition.
class QEL_EXPORT QelMessageVirtualSerialOpenReq
    : public QelMessageMetadata<QelMessageVirtualSerialOpenReq, QelMessageFunctionVirtualSerial,
                                QelMessageOpOpenVirtualSerialSession, QelMessageClassification::Request> {
public:
    struct Data {
        be_uint16_t mLparId;              //  0  logical partition id
        be_uint16_t mVssConnectionNumber; //  2  connection number of the session
        be_uint16_t mFlags;               //  4  bit 15: force open; the others are sent as zero
        be_uint16_t mReserved;            //  6
    };
    static_assert(sizeof(Data) == 8 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mVssConnectionNumber) == 2 && offsetof(Data, mFlags) == 4 &&
                      offsetof(Data, mReserved) == 6,
                  "overlays the frame buffer");

    /// @param forceOpen take the session away from whoever holds it
    QelMessageVirtualSerialOpenReq(std::uint16_t lpId, std::uint16_t vssConnectionNumber, bool forceOpen);

    /// Takes a received frame of `i_length` bytes.
    /// @throws QelMessageValidationException as QelMessageMetadata does, then as the top of this file says
    QelMessageVirtualSerialOpenReq(const char* i_buffer, unsigned int i_length);

    ~QelMessageVirtualSerialOpenReq() override;

    std::uint16_t getLpId() const { return pPayload<Data>().mLparId; }
    std::uint16_t getVssConnectionNumber() const { return pPayload<Data>().mVssConnectionNumber; }
    bool isForceOpen() const { return (pPayload<Data>().mFlags & kForceOpen) != 0; }

protected:
    void pDerivedDebug(std::ostream& os) const override;

private:
    static constexpr std::uint16_t kForceOpen = 0x8000;
};

/// Answers that the session is open.
class QEL_EXPORT QelMessageVirtualSerialOpenRsp
    : public QelMessageMetadata<QelMessageVirtualSerialOpenRsp, QelMessageFunctionVirtualSerial,
                                QelMessageOpOpenVirtualSerialSession, QelMessageClassification::Response> {
public:
    struct Data {
        be_uint16_t mLparId;              //  0  logical partition id
        be_uint16_t mVssConnectionNumber; //  2  connection number of the session
        be_uint32_t mReserved;            //  4
    };
    static_assert(sizeof(Data) == 8 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mVssConnectionNumber) == 2 && offsetof(Data, mReserved) == 4,
                  "overlays the frame buffer");

    /// @param callerId that of the request
    QelMessageVirtualSerialOpenRsp(std::uint32_t callerId, std::uint16_t lpId, std::uint16_t vssConnectionNumber);

    /// Takes a received frame of `i_length` bytes.
    /// @throws QelMessageValidationException as QelMessageMetadata does, then as the top of this file says
    QelMessageVirtualSerialOpenRsp(const char* i_buffer, unsigned int i_length);

    ~QelMessageVirtualSerialOpenRsp() override;

    std::uint16_t getLpId() const { return pPayload<Data>().mLparId; }
    std::uint16_t getVssConnectionNumber() const { return pPayload<Data>().mVssConnectionNumber; }

protected:
    void pDerivedDebug(std::ostream& os) const override;
};

/// Asks to close a session.
class QEL_EXPORT QelMessageVirtualSerialCloseReq
    : public QelMessageMetadata<QelMessageVirtualSerialCloseReq, QelMessageFunctionVirtualSerial,
                                QelMessageOpCloseVirtualSerialSession, QelMessageClassification::Request> {
public:
    struct Data {
        be_uint16_t mLparId;              //  0  logical partition id
        be_uint16_t mVssConnectionNumber; //  2  connection number of the session
        unsigned char mForceClose;        //  4  0xFF: force close, 0x00: normal close
    };
    static_assert(sizeof(Data) == 5 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mVssConnectionNumber) == 2 && offsetof(Data, mForceClose) == 4,
                  "overlays the frame buffer");

    /// @param forceClose close the session whoever holds it
    QelMessageVirtualSerialCloseReq(std::uint16_t lpId, std::uint16_t vssConnectionNumber, bool forceClose);

    /// Takes a received frame of `i_length` bytes.
    /// @throws QelMessageValidationException as QelMessageMetadata does, then as the top of this file says
    QelMessageVirtualSerialCloseReq(const char* i_buffer, unsigned int i_length);

    ~QelMessageVirtualSerialCloseReq() override;

    std::uint16_t getLpId() const { return pPayload<Data>().mLparId; }
    std::uint16_t getVssConnectionNumber() const { return pPayload<Data>().mVssConnectionNumber; }
    /// True for 0xFF only; any other byte means a normal close.
    bool isForceClose() const { return pPayload<Data>().mForceClose == kForceClose; }

protected:
    void pDerivedDebug(std::ostream& os) const override;

private:
    static constexpr unsigned char kForceClose = 0xFF;
};

/// Answers that the session is closed. No payload.
class QEL_EXPORT QelMessageVirtualSerialCloseRsp
    : public QelMessageMetadata<QelMessageVirtualSerialCloseRsp, QelMessageFunctionVirtualSerial,
                                QelMessageOpCloseVirtualSerialSession, QelMessageClassification::Response> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageVirtualSerialCloseRsp() override;
};

/// Asks how many sessions there can be. No payload.
class QEL_EXPORT QelMessageVirtualSerialGetMaxSessionsReq
    : public QelMessageMetadata<QelMessageVirtualSerialGetMaxSessionsReq, QelMessageFunctionVirtualSerial,
                                QelMessageOpGetMaxVirtualSerialSessions, QelMessageClassification::Request> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageVirtualSerialGetMaxSessionsReq() override;
};

/// Answers how many sessions there can be.
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

    /// Takes a received frame of `i_length` bytes.
    /// @throws QelMessageValidationException as QelMessageMetadata does, then as the top of this file says
    QelMessageVirtualSerialGetMaxSessionsRsp(const char* i_buffer, unsigned int i_length);

    ~QelMessageVirtualSerialGetMaxSessionsRsp() override;

    std::uint16_t getMaxCec() const { return pPayload<Data>().mMaxCec; }
    std::uint8_t getMaxLpar() const { return pPayload<Data>().mMaxLpar; }

protected:
    void pDerivedDebug(std::ostream& os) const override;
};

/// Serial data on its way; one direction is one class.
///
/// With 65535 bytes of data the frame is longer than QelMessage::MtuMax: it can be built, but no stream will accept it.
/// Not built by itself: users take the two concrete classes.
/// @tparam Derived the concrete class
/// @tparam FunctionCode,OpType its identity; the classification is always asynchronous
template <typename Derived, QelMessageFunctionCodes FunctionCode, QelMessageOpTypes OpType>
class QEL_EXPORT QelMessageVirtualSerialDataAsync
    : public QelMessageMetadata<Derived, FunctionCode, OpType, QelMessageClassification::Async> {
public:
    struct Data {
        be_uint16_t mLparId;              //  0  logical partition id
        be_uint16_t mVssConnectionNumber; //  2  connection number of the session
        be_uint16_t mDataLength;          //  4  bytes of serial data
        /* the serial data                    6  mDataLength raw bytes */
    };
    static_assert(sizeof(Data) == 6 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mVssConnectionNumber) == 2 && offsetof(Data, mDataLength) == 4,
                  "overlays the frame buffer");

    ~QelMessageVirtualSerialDataAsync() override;

    std::uint16_t getLpId() const { return this->template pPayload<Data>().mLparId; }
    std::uint16_t getVssConnectionNumber() const { return this->template pPayload<Data>().mVssConnectionNumber; }

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
    using Metadata = QelMessageMetadata<Derived, FunctionCode, OpType, QelMessageClassification::Async>;
};

/// Serial data for the operating system of the partition: what was typed.
class QEL_EXPORT QelMessageVirtualSerialDataToOsAsync
    : public QelMessageVirtualSerialDataAsync<QelMessageVirtualSerialDataToOsAsync, QelMessageFunctionVirtualSerial,
                                              QelMessageOpSendVirtualSerialDataToOs> {
public:
    /// @param data `dataLength` bytes, copied; may be null when that is 0
    /// @throws std::invalid_argument "data": null with a length other than 0
    QelMessageVirtualSerialDataToOsAsync(std::uint16_t lpId, std::uint16_t vssConnectionNumber,
                                         std::uint16_t dataLength, const char* data);

    /// Takes a received frame of `i_length` bytes.
    /// @throws QelMessageValidationException as QelMessageMetadata does, then as the top of this file says
    QelMessageVirtualSerialDataToOsAsync(const char* i_buffer, unsigned int i_length);

    ~QelMessageVirtualSerialDataToOsAsync() override;
};

/// Serial data for the console: what the partition printed.
class QEL_EXPORT QelMessageVirtualSerialDataToDaxAsync
    : public QelMessageVirtualSerialDataAsync<QelMessageVirtualSerialDataToDaxAsync, QelMessageFunctionDax,
                                              QelMessageOpSendVirtualSerialDataToMc> {
public:
    /// @param data `dataLength` bytes, copied; may be null when that is 0
    /// @throws std::invalid_argument "data": null with a length other than 0
    QelMessageVirtualSerialDataToDaxAsync(std::uint16_t lpId, std::uint16_t vssConnectionNumber,
                                          std::uint16_t dataLength, const char* data);

    /// Takes a received frame of `i_length` bytes.
    /// @throws QelMessageValidationException as QelMessageMetadata does, then as the top of this file says
    QelMessageVirtualSerialDataToDaxAsync(const char* i_buffer, unsigned int i_length);

    ~QelMessageVirtualSerialDataToDaxAsync() override;
};

/// Asks to make an open session ready for data.
class QEL_EXPORT QelMessageVirtualSerialSetupSessionReq
    : public QelMessageMetadata<QelMessageVirtualSerialSetupSessionReq, QelMessageFunctionVirtualSerial,
                                QelMessageOpSetupVirtualSerialSession, QelMessageClassification::Request> {
public:
    struct Data {
        be_uint16_t mLparId;              //  0  logical partition id
        be_uint16_t mVssConnectionNumber; //  2  connection number of the session
    };
    static_assert(sizeof(Data) == 4 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mVssConnectionNumber) == 2, "overlays the frame buffer");

    QelMessageVirtualSerialSetupSessionReq(std::uint16_t lpId, std::uint16_t vssConnectionNumber);

    /// Takes a received frame of `i_length` bytes.
    /// @throws QelMessageValidationException as QelMessageMetadata does, then as the top of this file says
    QelMessageVirtualSerialSetupSessionReq(const char* i_buffer, unsigned int i_length);

    ~QelMessageVirtualSerialSetupSessionReq() override;

    std::uint16_t getLpId() const { return pPayload<Data>().mLparId; }
    std::uint16_t getVssConnectionNumber() const { return pPayload<Data>().mVssConnectionNumber; }

protected:
    void pDerivedDebug(std::ostream& os) const override;
};

/// Answers that the session is ready for data. No payload.
class QEL_EXPORT QelMessageVirtualSerialSetupSessionRsp
    : public QelMessageMetadata<QelMessageVirtualSerialSetupSessionRsp, QelMessageFunctionVirtualSerial,
                                QelMessageOpSetupVirtualSerialSession, QelMessageClassification::Response> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageVirtualSerialSetupSessionRsp() override;
};

/// Tells the console that its session was closed, and why.
class QEL_EXPORT QelMessageVirtualSerialSessionClosedAsync
    : public QelMessageMetadata<QelMessageVirtualSerialSessionClosedAsync, QelMessageFunctionDax,
                                QelMessageOpSendVirtualSerialSessionClosed, QelMessageClassification::Async> {
public:
    enum CloseReason : unsigned int {
        CloseReasonMin = 1,
        CloseReasonUnknown = 1,
        CloseReasonForceClose = 2,   ///< another console took the session
        CloseReasonQelShutdown = 3,  ///< the hypervisor side goes down
        CloseReasonReadFailure = 4,  ///< nothing can be read from the partition any more
        CloseReasonWriteFailure = 5, ///< nothing can be written to the partition any more
        CloseReasonMax = 5
    };

    struct Data {
        be_uint16_t mLparId;              //  0  logical partition id
        be_uint16_t mVssConnectionNumber; //  2  connection number of the session
        be_uint32_t mCloseReason;         //  4  a CloseReason
    };
    static_assert(sizeof(Data) == 8 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mVssConnectionNumber) == 2 && offsetof(Data, mCloseReason) == 4,
                  "overlays the frame buffer");

    /// @param reason is sent as it is
    QelMessageVirtualSerialSessionClosedAsync(std::uint16_t lpId, std::uint16_t vssConnectionNumber,
                                              CloseReason reason);

    /// Takes a received frame of `i_length` bytes.
    /// @throws QelMessageValidationException as QelMessageMetadata does, then as the top of this file says
    QelMessageVirtualSerialSessionClosedAsync(const char* i_buffer, unsigned int i_length);

    ~QelMessageVirtualSerialSessionClosedAsync() override;

    std::uint16_t getLpId() const { return pPayload<Data>().mLparId; }
    std::uint16_t getVssConnectionNumber() const { return pPayload<Data>().mVssConnectionNumber; }

    /// A number outside CloseReasonMin to CloseReasonMax reads as CloseReasonUnknown; debug() prints it as it is.
    CloseReason getCloseReason() const
    {
        const std::uint32_t reason = pPayload<Data>().mCloseReason;
        if (reason < CloseReasonMin || reason > CloseReasonMax) return CloseReasonUnknown;
        return static_cast<CloseReason>(reason);
    }

protected:
    void pDerivedDebug(std::ostream& os) const override;
};

// The template is made for these two classes only, in the library.
extern template class QelMessageVirtualSerialDataAsync<
    QelMessageVirtualSerialDataToOsAsync, QelMessageFunctionVirtualSerial, QelMessageOpSendVirtualSerialDataToOs>;
extern template class QelMessageVirtualSerialDataAsync<QelMessageVirtualSerialDataToDaxAsync, QelMessageFunctionDax,
                                                       QelMessageOpSendVirtualSerialDataToMc>;

} // namespace qel
