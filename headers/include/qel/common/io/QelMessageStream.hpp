#pragma once

#include <qel/common/EndianExtensions.hpp>
#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/io/Stream.hpp>

#include <memory>

namespace qel {

/// Reads and writes whole frames over any byte stream.
///
/// Frames stand on the stream back to back; the total length in a frame's own header is the only framing.
///
/// Lifetime: borrows `stream` and `registry`; both must outlive this object.
/// Thread safety: one reader thread and one writer thread at a time, as the stream below; takes no lock.
class QEL_EXPORT QelMessageStream {
public:
    /// What is read first of each frame: enough to know how much more there is.
    struct MessageHeader {      // offsets from the first byte of the frame
        char mReserved[4];      //  0  eyecatcher and header version, looked at only when the whole frame is checked
        be_uint32_t mMsgLength; //  4  bytes of the whole frame, this header included
    };

    QelMessageStream(Stream& stream, QelMessageRegistry& registry) noexcept;

    /// Blocks until one frame has arrived and been checked.
    ///
    /// Nothing is retried and no part of a frame is kept for the next call. A peer that closes the connection between
    /// two frames and one that cuts a frame short both give "EOF"; a program that must tell them apart wraps its Stream
    /// and counts the bytes.
    /// @return the message, typed if the registry knows and accepts it, otherwise a plain QelMessage; never null
    /// @throws StreamIOException  the stream failed, ended ("EOF"), or its read deadline passed: "I/O deadline" when it
    ///         had passed before a call of the stream began, else what the stream says of it (see SocketStream)
    /// @throws QelMessageValidationException  "Invalid length": the frame says it has less than 9 or more than
    ///         QelMessage::MtuMax (16384) bytes; only its first 8 bytes were read, so the stream is out of step with
    ///         the frames and the connection is to be dropped. Any other text is the registry's: the frame was read
    ///         whole and is malformed
    std::unique_ptr<QelMessage> read();

    /// Sends the frame of `message` as it stands, with one OutputStream::write() of msgLength() bytes.
    ///
    /// The length is not limited here: a frame of more than QelMessage::MtuMax bytes goes out and is refused by the
    /// stream that receives it.
    /// @throws StreamIOException  the stream failed, or its write deadline passed; part of the frame may have gone out
    ///         then, so that the connection is of no further use
    void write(const QelMessage& message);

private:
    Stream& mStream;
    QelMessageRegistry& mRegistry;
};

static_assert(sizeof(QelMessageStream::MessageHeader) == 8 && alignof(QelMessageStream::MessageHeader) == 1,
              "the first two fields of every frame");

} // namespace qel
