#pragma once

#include <qel/common/io/Stream.hpp>

#include <array>
#include <chrono>
#include <cstddef>
#include <memory>
#include <utility>

namespace qel::protocol {

/// The stream under TLS: waits for bytes without TLS taking part.
///
/// TLS cannot go on after a read that a deadline has ended. awaitBytes() reads into a buffer instead, so a deadline
/// that passes there does no harm, and the next read() takes from the buffer. With setWaiting(false) TLS takes from the
/// buffer alone: so it is known whether the bytes hold data, or only a part of a record, or a record without data such
/// as an update of keys. This costs no system call more than a read. Thread safety: as every stream; awaitBytes() and
/// hasBytes() belong to the reader. close() as that of the stream below.
class ReadAhead final : public Stream {
public:
    explicit ReadAhead(std::unique_ptr<Stream> stream) : mStream(std::move(stream)) {}

    /// Waits until read() has something to return at once: bytes, or the end of the stream.
    /// @param timeout  as setReadDeadline() of the stream below takes it
    /// @return false: the timeout has passed
    /// @throws StreamIOException  the stream failed
    bool awaitBytes(std::chrono::milliseconds timeout);

    /// True when bytes have been read ahead.
    bool hasBytes() const noexcept { return mFirst != mLast; }

    /// True when the stream below has ended, as far as is known.
    bool hasEnded() const noexcept { return mHasEnded; }

    /// What read() does when nothing has been read ahead. True, the default: it reads from the stream below. False: it
    /// returns 0, which an SSLStream takes for the end of its input, and then goes on as soon as there is more.
    void setWaiting(bool isWaiting) noexcept { mIsWaiting = isWaiting; }

    std::size_t read(char* buffer, std::size_t length) override;
    void write(const char* buffer, std::size_t length) override { mStream->write(buffer, length); }
    void setReadDeadline(std::chrono::milliseconds timeout) override { mStream->setReadDeadline(timeout); }
    void setWriteDeadline(std::chrono::milliseconds timeout) override { mStream->setWriteDeadline(timeout); }
    void close() override { mStream->close(); }

private:
    static constexpr std::size_t kBytes = 8192; // what TLS asks for at a time

    const std::unique_ptr<Stream> mStream;
    std::array<char, kBytes> mBuffer;
    std::size_t mFirst = 0; // of the bytes that were read ahead
    std::size_t mLast = 0;
    bool mHasEnded = false;
    bool mIsWaiting = true;
};

} // namespace qel::protocol
