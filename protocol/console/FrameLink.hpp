#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/io/BufferedStream.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/io/Stream.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/common/util/Poll.hpp>

#include "base/TimeLeft.hpp"
#include "console/CloseSwitch.hpp"
#include "console/Connector.hpp"

#include <array>
#include <chrono>
#include <cstddef>
#include <exception>
#include <memory>
#include <optional>
#include <string>

namespace qel::protocol {

/// Sends and receives the messages of one connection, with deadlines, and remembers what made it unusable.
///
/// Reads ahead: a short message takes one system call at most. A message begins with its first byte, over TLS with the
/// first byte that is decrypted: neither a part of a record nor an update of keys starts its time. A deadline that
/// passes before that does no harm.
///
/// Sends at once, or gathers short messages until flush(): whoever waits must flush first.
/// Thread safety: one thread.
class FrameLink {
public:
    /// The most bytes that are gathered.
    static constexpr std::size_t kGatherBytes = 8192;

    /// @param connected    the connection; the deadlines of its stream are set by every call here
    /// @param server       for exceptions
    /// @param frameTimeout  for one message, from its first byte to its last
    /// @param closeSwitch  tells whether this end closed the connection; must outlive this
    FrameLink(ConnectedStream connected, const std::string& server, std::chrono::milliseconds frameTimeout,
              CloseSwitch& closeSwitch);
    ~FrameLink();
    FrameLink(const FrameLink&) = delete;
    FrameLink& operator=(const FrameLink&) = delete;

    /// Sends one message after those that were gathered; waits for room for it until `end`, and for at most the frame
    /// timeout.
    /// @throws DeadlinePassed, ClosedByPeer, or Error when this end has closed the connection. Sending fails from then
    ///         on; over TLS receiving too. What was gathered is lost
    void send(const QelMessage& message, TimePoint end);

    /// Keeps a message for the next send() or flush().
    /// @pre hasRoomFor() it
    /// @throws as send(), when sending has failed before
    void gather(const QelMessage& message);
    /// Whether a message can be gathered. Those that go out together fit into one write that needs no more room than a
    /// long message.
    bool hasRoomFor(const QelMessage& message) const noexcept
    {
        return message.msgLength() <= kGatherBytes - mGathered;
    }
    /// Whether messages wait for flush().
    bool hasGathered() const noexcept { return mGathered != 0; }
    /// Sends what was gathered, as send() does; does nothing if there is nothing.
    void flush(TimePoint end);

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
    /// What the peer said in TLS against this console's certificate; empty: nothing.
    std::string certificateAlert() const;

    /// As Console::leave(), and only until `end`. Sends what was gathered if there is room for it. Sending and
    /// receiving fail from then on.
    void leave(TimePoint end) noexcept;

private:
    /// What messages are read from: their first bytes, which were waited for, and the stream. Writes go to the stream.
    class Input : public Stream {
    public:
        explicit Input(BufferedStream& stream) : mStream(stream) {}

        /// Room for the first bytes, which must have been read.
        std::array<char, sizeof(QelMessageStream::MessageHeader)>& firstBytes() noexcept { return mBytes; }
        /// A message has begun with so many of them.
        void begin(std::size_t count) noexcept;

        std::size_t read(char* buffer, std::size_t length) override;
        void fill(char* buffer, std::size_t length) override;
        void write(const char* buffer, std::size_t length) override { mStream.write(buffer, length); }
        void close() override { mStream.close(); }

    private:
        std::size_t pTake(char* buffer, std::size_t length) noexcept;

        BufferedStream& mStream;
        std::array<char, sizeof(QelMessageStream::MessageHeader)> mBytes;
        std::size_t mFirst = 0; // of the bytes in mBytes that were not read yet
        std::size_t mLast = 0;
    };

    bool pBegin(TimePoint begin, TimePoint end);
    std::optional<std::size_t> pReadFirst(TimePoint begin, TimePoint end);
    std::optional<std::size_t> pReadFirstOverTls(TimePoint begin);
    bool pIsReadable() const;
    bool pEndOutput() noexcept;
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
    const std::exception_ptr mHasLeft; // what calls throw after leave(), which cannot fail
    BufferedStream mBuffered;          // over *mStream
    Input mInput;
    QelMessageStream mMessages;
    std::size_t mGathered = 0;          // bytes in mBuffered that were not sent yet
    bool mIsStarved = false;            // TLS holds a part of a record at most
    std::exception_ptr mSendFailure;    // set: sending throws it
    std::exception_ptr mReceiveFailure; // set: receiving throws it
};

} // namespace qel::protocol
