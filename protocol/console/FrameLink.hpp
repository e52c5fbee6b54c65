#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/io/Stream.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/common/util/Poll.hpp>

#include "console/CloseSwitch.hpp"
#include "console/Connector.hpp"
#include "console/TimeLeft.hpp"

#include <array>
#include <chrono>
#include <cstddef>
#include <exception>
#include <memory>
#include <string>

namespace qel::protocol {

/// Sends and receives the messages of one connection, with deadlines, and remembers what made it unusable.
///
/// A deadline that passes before a message has begun does no harm, except over TLS on a stream without a descriptor:
/// TLS cannot go on after a read that a deadline has ended, so one must not begin before there is something to read.
/// Thread safety: one thread.
class FrameLink {
public:
    /// @param connected    the connection; the deadlines of its stream are set by every call here
    /// @param server       for exceptions
    /// @param frameTimeout  for one message, from its first byte to its last
    /// @param closeSwitch  tells whether this end closed the connection; must outlive this
    FrameLink(ConnectedStream connected, const std::string& server, std::chrono::milliseconds frameTimeout,
              CloseSwitch& closeSwitch);
    ~FrameLink();
    FrameLink(const FrameLink&) = delete;
    FrameLink& operator=(const FrameLink&) = delete;

    /// Sends one message; waits for room for it until `end`, and for at most the frame timeout.
    /// @throws DeadlinePassed, ClosedByPeer, or Error when this end has closed the connection. Sending fails from then
    /// on;
    ///         over TLS receiving too
    void send(const QelMessage& message, TimePoint end);

    /// Receives one message.
    /// @param begin  by when it must have begun
    /// @param end    by when it must have ended; it has at most the frame timeout
    /// @return null: none has begun in time
    /// @throws DeadlinePassed, ClosedByPeer, ProtocolBroken, or Error when this end has closed the connection. Sending
    ///         and receiving fail from then on
    std::unique_ptr<QelMessage> receive(TimePoint begin, TimePoint end);

    /// Waits until a message can be sent or, if wanted, received. A stream that cannot tell can always be tried.
    /// @return neither: not by the deadline
    Ready await(bool wantsToReceive, TimePoint end);
    /// Whether await() knows more than that it can be tried.
    bool canTell() const noexcept { return mDescriptor >= 0 || mReadiness != nullptr; }

    /// Makes the connection unusable: sending and receiving throw this from now on.
    void fail(const std::exception_ptr& failure) noexcept;
    /// What receiving throws from now on; null: nothing.
    const std::exception_ptr& receiveFailure() const noexcept { return mReceiveFailure; }
    /// Throws it.
    void requireReceiving() const
    {
        if (mReceiveFailure) std::rethrow_exception(mReceiveFailure);
    }
    /// False after any failure.
    bool isUsable() const noexcept { return mSendFailure == nullptr && mReceiveFailure == nullptr; }

    PollFd getPollFd(PollEvents events) const;
    /// True when receive() may have bytes to read although the descriptor is not readable.
    bool hasPending() const;
    bool isProtected() const noexcept { return mTls != nullptr; }

    /// As Console::leave(), and only until `end`. Sending and receiving fail from then on.
    void leave(TimePoint end) noexcept;

private:
    /// What has arrived. On a plain connection it is read in large pieces: a short message takes one system call
    /// instead of two. There it also limits the first byte of a message by one deadline and the rest by another; over
    /// TLS receive() waits for the first byte.
    class Input : public Stream {
    public:
        /// @param isDirect  over TLS: read no more than is asked for, since TLS keeps the rest
        Input(Stream& stream, bool isDirect) : mStream(stream), mIsDirect(isDirect) {}

        /// A message may begin now.
        /// @param frameTimeout  for the rest of it once it has begun
        /// @param end           the same; whatever is earlier
        void begin(std::chrono::milliseconds frameTimeout, TimePoint end);
        bool hasBegun() const noexcept { return mHasBegun; }
        bool hasBytes() const noexcept { return mFirst != mLast; }

        std::size_t read(char* buffer, std::size_t length) override;
        void write(const char* buffer, std::size_t length) override { mStream.write(buffer, length); }
        void close() override { mStream.close(); }

    private:
        bool pFill();
        void pNote(std::size_t count);

        Stream& mStream;
        const bool mIsDirect;
        std::array<char, QelMessage::MtuMax> mBuffer;
        std::size_t mFirst = 0; // of the bytes that were not asked for yet
        std::size_t mLast = 0;
        std::chrono::milliseconds mFrameTimeout{0};
        TimePoint mEnd;
        bool mHasBegun = false;
    };

    bool pHasInput() const;
    void pAwaitEnd(TimePoint end);
    [[noreturn]] void pFail(const std::exception_ptr& failure);
    [[noreturn]] void pFailSending(const StreamIOException& error);
    std::exception_ptr pFailure(const StreamIOException& error) const;

    const std::unique_ptr<Stream> mStream;
    ReadAhead* const mReadAhead; // under mTls; null for a plain connection
    SSLStream* const mTls;       // points to *mStream; null for a plain connection
    const int mDescriptor;
    Readiness* const mReadiness; // of a stream without a descriptor; null: it cannot tell
    const std::string mServer;
    const std::chrono::milliseconds mFrameTimeout;
    CloseSwitch& mCloseSwitch;
    Input mInput;
    QelMessageStream mMessages;
    std::exception_ptr mSendFailure;    // set: sending throws it
    std::exception_ptr mReceiveFailure; // set: receiving throws it
};

} // namespace qel::protocol
