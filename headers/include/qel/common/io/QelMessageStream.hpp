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
/// Frames follow each other without a separator; the total length in the header of each is the only framing.
///
/// Lifetime: borrows the stream and the registry, which must outlive this object.
/// Thread safety: no locks; one reader thread and one writer thread at a time, as for the stream.
class QEL_EXPORT QelMessageStream {
public:
    /// The part of each frame that is read first; it gives the length of the rest.
    struct MessageHeader {      // offsets from the first byte of the frame
        char mReserved[4];      //  0  eyecatcher and header version, checked with the whole frame
        be_uint32_t mMsgLength; //  4  bytes of the whole frame, this header included
    };

    /// @param stream    carries the frames; borrowed
    /// @param registry  builds the messages that are read; borrowed
    QelMessageStream(Stream& stream, QelMessageRegistry& registry) noexcept;

    /// Blocks until one frame has arrived and been checked.
    ///
    /// Nothing is retried, and no part of a frame is kept for the next call. End of stream between two frames and
    /// inside a frame both give "EOF"; a program that must tell them apart wraps its Stream and counts the bytes.
    /// @return the message, typed if the registry knows and accepts it, otherwise a plain QelMessage; never null
    /// @throws StreamIOException  the stream failed, ended ("EOF"), or its read deadline passed: "I/O deadline" if it
    ///         passed before a read began, else the text of the stream (see SocketStream)
    /// @throws QelMessageValidationException  "Invalid length": the length field is below 9 or above
    ///         QelMessage::MtuMax (16384); only the first 8 bytes of the frame were read, so drop the connection, which
    ///         is out of step with the frames. Any other text is the registry's: the frame was read completely and is
    ///         malformed
    std::unique_ptr<QelMessage> read();

    /// Sends the frame of `message` unchanged, with one OutputStream::write() of msgLength() bytes.
    ///
    /// The length is not checked: a frame of more than QelMessage::MtuMax bytes is sent, and the receiving stream
    /// refuses it.
    /// @throws StreamIOException  the stream failed, or its write deadline passed; part of the frame may have been
    ///         sent, so drop the connection
    void write(const QelMessage& message);

private:
    Stream& mStream;
    QelMessageRegistry& mRegistry;
};

static_assert(sizeof(QelMessageStream::MessageHeader) == 8 && alignof(QelMessageStream::MessageHeader) == 1,
              "the first two fields of every frame");

} // namespace qel
