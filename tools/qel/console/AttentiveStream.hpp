#pragma once

#include <qel/common/io/StreamDeadline.hpp>
#include <qel/common/net/SocketStream.hpp>
#include <qel/common/util/Poll.hpp>

#include <chrono>
#include <cstddef>

namespace qel::tool {

/// Something that needs attention while a stream waits for its peer: the keyboard.
class StreamAttendant {
public:
    virtual ~StreamAttendant() = default;

    /// What to wait for besides the stream.
    virtual PollSet attended() const = 0;

    /// One of them is ready. @return false: the stream is to give up its wait
    virtual bool attend(const PollResult& ready) noexcept = 0;
};

/// A connection that attends to something else while it waits. A peer that stops in the middle of a message, or takes
/// nothing, so cannot keep this program from reading its keyboard.
///
/// Deadlines and exceptions are those of SocketStream. A wait that is given up throws StreamIOException too.
///
/// Ownership: owns the socket; borrows the attendant. Thread safety: that of SocketStream.
class AttentiveStream : public SocketStream {
public:
    /// @throws PosixError  as SocketStream
    explicit AttentiveStream(Socket socket) : SocketStream(std::move(socket)) {}

    /// @param attendant  asked during each wait; null: nobody
    void setAttendant(StreamAttendant* attendant) noexcept { mAttendant = attendant; }

    /// From this time on nothing is waited for, whatever the deadlines say.
    void cutAt(std::chrono::steady_clock::time_point end) noexcept { mCut = end; }

    /// Call it before the connection is closed: what the peer has taken no room for is thrown away then, and the peer
    /// is told of the end at once, by a reset. It would hear of an orderly end only after that, if it reads at all.
    void throwAwayUnsent() noexcept;

    void setReadDeadline(std::chrono::milliseconds timeout) override { mReadDeadline = timeout; }
    void setWriteDeadline(std::chrono::milliseconds timeout) override { mWriteDeadline = timeout; }
    std::size_t read(char* buffer, std::size_t length) override;
    void write(const char* buffer, std::size_t length) override;

private:
    void pAwait(PollEvents events, std::chrono::milliseconds timeout) const;

    StreamAttendant* mAttendant = nullptr;
    std::chrono::steady_clock::time_point mCut = StreamDeadline::NoDeadline;
    StreamDeadline mReadDeadline;
    StreamDeadline mWriteDeadline;
};

} // namespace qel::tool
