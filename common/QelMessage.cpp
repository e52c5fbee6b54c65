#include <qel/common/QelMessage.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "LogLine.hpp"

#include <cstring>
#include <limits>
#include <ostream>
#include <stdexcept>

namespace qel {

namespace {

// Frames of the old form are padded up to this many bytes.
constexpr unsigned int kOldFrameMinimum = 40;

constexpr std::uint64_t kFrameLengthMaximum = std::numeric_limits<unsigned int>::max();

/// Logs the values at Error and throws the fixed phrase. Out of line, and with the values by value: the checks of a
/// good frame then need no stack.
template <typename... Parts>
[[noreturn, gnu::cold, gnu::noinline]] void reject(const char* phrase, Parts... logged)
{
    logLine(LogLevel::Error, logged...);
    throw QelMessageValidationException(phrase);
}

} // namespace

// Constant-initialised in one source file: the program and every module that it loads share this counter.
std::atomic<unsigned int> QelMessage::sCallerIdCounter{1};

const std::map<unsigned char, unsigned int> QelMessage::CommonHeader::QelHeaderVersionToLength = {
    {MessageVersion24, kOldHeaderLength},
    {MessageVersion32, kNewHeaderLength},
};

const QelMessage::CommonHeader* QelMessage::CommonHeader::validate(const char* i_buffer, unsigned int i_length)
{
    if (i_buffer == nullptr) throw QelMessageValidationException("i_buffer");
    if (i_length < kOldHeaderLength) {
        reject("i_length shorter than old header", "bad length = ", hexFormat(i_length));
    }
    const CommonHeader* const header = reinterpret_cast<const CommonHeader*>(i_buffer);
    header->pValidate(i_length);
    return header;
}

void QelMessage::CommonHeader::pValidate(unsigned int i_length) const
{
    if (std::memcmp(mDesc, DaxCmdDesc, sizeof(DaxCmdDesc)) != 0) {
        reject("i_buffer bad eyecatcher", "bad eyecatcher = ", HexStringFormatter(mDesc, sizeof(mDesc)));
    }
    // The version is checked later: until then, every version but the old one needs a header of the new form.
    if (i_length < kNewHeaderLength && mHeaderVersion != MessageVersion24) {
        reject("i_length shorter than new header", "bad length = ", hexFormat(i_length));
    }
    if (mMsgLength.value() > i_length) {
        reject("i_length shorter than total message length", "i_length shorter than message length field in header");
    }
    if (mHeaderVersion != MessageVersion24 && mHeaderVersion != MessageVersion32) {
        reject("i_buffer bad header version", "bad header version = ", hexFormat(mHeaderVersion));
    }
    if (mHeaderVersion == MessageVersion24) {
        const unsigned char expected = pPadLengthFor(mDataLength);
        if (mPadLength < expected) {
            reject("i_buffer bad header pad length", "bad header pad length (old) = ", hexFormat(mPadLength),
                   " < expected ", hexFormat(expected));
        }
    }
    // In 64 bits, so that a payload length near 2^32 cannot wrap to a matching frame length.
    if (mMsgLength.value() != std::uint64_t{getHeaderLength()} + mDataLength.value() + mPadLength) {
        reject("i_buffer bad MsgLength in header", "bad header MsgLength = ", hexFormat(mMsgLength));
    }
}

void QelMessage::CommonHeader::setDataLength(unsigned int i_length)
{
    if (pMsgLengthFor(i_length) > kFrameLengthMaximum) throw std::invalid_argument("length");
    mDataLength = i_length;
    pCalculateMsgLength();
}

void QelMessage::CommonHeader::pCalculateMsgLength()
{
    mPadLength = pPadLengthFor(mDataLength);
    mMsgLength = static_cast<unsigned int>(pMsgLengthFor(mDataLength));
}

unsigned int QelMessage::CommonHeader::pLookUpHeaderLength() const
{
    return QelHeaderVersionToLength.at(mHeaderVersion);
}

unsigned char QelMessage::CommonHeader::pPadLengthFor(unsigned int dataLength) const
{
    if (mHeaderVersion != MessageVersion24) return mPadLength;
    constexpr unsigned int room = kOldFrameMinimum - kOldHeaderLength;
    return static_cast<unsigned char>(dataLength <= room ? room - dataLength : 0);
}

std::uint64_t QelMessage::CommonHeader::pMsgLengthFor(unsigned int dataLength) const
{
    return std::uint64_t{getHeaderLength()} + dataLength + pPadLengthFor(dataLength);
}

QelMessage::QelMessage()
    : QelMessage(0, QelMessageFunctionInvalid, QelMessageOpUnspecified, NoFlagSet, PayloadLength(0))
{}

QelMessage::QelMessage(unsigned int i_callerId, unsigned short i_function, unsigned short i_operation,
                       QelMessageFlags i_flags)
    : QelMessage(i_callerId, i_function, i_operation, i_flags, PayloadLength(0))
{}

QelMessage::QelMessage(unsigned int i_callerId, unsigned short i_function, unsigned short i_operation,
                       QelMessageFlags i_flags, PayloadLength i_payloadLength)
{
    constexpr unsigned int headerLength = CommonHeader::kNewHeaderLength;
    if (i_payloadLength.bytes() > kFrameLengthMaximum - headerLength) throw std::invalid_argument("length");
    const unsigned int dataLength = static_cast<unsigned int>(i_payloadLength.bytes());

    mMessage =
        std::make_unique<char[]>(headerLength + dataLength); // zeros: fields that are not set below are sent as zero
    CommonHeader* const header = pGetHeader();
    std::memcpy(header->mDesc, CommonHeader::DaxCmdDesc, sizeof(header->mDesc));
    header->mHeaderVersion = CommonHeader::MessageVersion32;
    header->mMsgLength = headerLength + dataLength;
    header->mCallerId = i_callerId;
    header->mFunction = i_function;
    header->mFlags = i_flags;
    header->mDataLength = dataLength;
    header->mOperation = i_operation;
}

QelMessage::QelMessage(const char* i_buffer, unsigned int i_length)
    : mMessage(new char[CommonHeader::validate(i_buffer, i_length)->mMsgLength]) // not cleared: it is copied over
{
    std::memcpy(mMessage.get(), i_buffer, reinterpret_cast<const CommonHeader*>(i_buffer)->mMsgLength);
}

QelMessage::QelMessage(const QelMessage& i_message) : mMessage(new char[i_message.msgLength()])
{
    std::memcpy(mMessage.get(), i_message.mMessage.get(), i_message.msgLength());
}

QelMessage& QelMessage::operator=(const QelMessage& i_message)
{
    // Self-assignment releases the source here. The new buffer is therefore a valid frame before it is installed: its
    // lengths match its size, and its payload of zeros holds no length or offset that points outside.
    mMessage = i_message.pMakeBlankFrame();
    std::memmove(mMessage.get(), i_message.mMessage.get(), msgLength());
    return *this;
}

QelMessage::~QelMessage() = default;

std::unique_ptr<QelMessage> QelMessage::clone() const { return std::make_unique<QelMessage>(*this); }

void QelMessage::pDerivedDebug(std::ostream& os) const { os << "    <no additional details>"; }

void QelMessage::checkStatus() const
{
    if (getStatus() != QelMessageStatusNoError) throw QelMessageStatusException(*this);
}

unsigned int QelMessage::generateNextUint32() { return ++sCallerIdCounter; }

char* QelMessage::pAllocData(unsigned int i_length)
{
    mMessage = pMakeFrame(i_length);
    return pGetData();
}

void QelMessage::pSetData(const char* i_data, unsigned int i_length)
{
    if (i_length != 0 && i_data == nullptr) throw std::invalid_argument("data");
    std::unique_ptr<char[]> previous = pMakeFrame(i_length);
    previous.swap(mMessage);
    // The bytes may lie in the previous frame, so it is released after the copy.
    if (i_length != 0) std::memcpy(pGetData(), i_data, i_length);
}

/// A new frame with this header, the lengths updated, and a payload of zeros.
std::unique_ptr<char[]> QelMessage::pMakeFrame(unsigned int i_dataLength) const
{
    char headerBytes[MaxHeaderSize];
    const unsigned int headerLength = pGetHeader()->getHeaderLength();
    std::memcpy(headerBytes, pGetMessage(), headerLength);
    CommonHeader* const header = reinterpret_cast<CommonHeader*>(headerBytes);
    header->setDataLength(i_dataLength);

    std::unique_ptr<char[]> frame(new char[header->mMsgLength]());
    std::memcpy(frame.get(), headerBytes, headerLength);
    return frame;
}

/// A new frame of the same form and the same lengths; everything else is zero.
std::unique_ptr<char[]> QelMessage::pMakeBlankFrame() const
{
    const CommonHeader* const header = pGetHeader();
    std::unique_ptr<char[]> frame(new char[header->mMsgLength]());
    CommonHeader* const blank = reinterpret_cast<CommonHeader*>(frame.get());
    std::memcpy(blank->mDesc, header->mDesc, sizeof(blank->mDesc));
    blank->mHeaderVersion = header->mHeaderVersion;
    blank->mMsgLength = header->mMsgLength;
    blank->mPadLength = header->mPadLength;
    blank->mDataLength = header->mDataLength;
    return frame;
}

} // namespace qel
