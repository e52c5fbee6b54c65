#pragma once

#include <qel/common/io/Stream.hpp>
#include <qel/common/io/StreamDeadline.hpp>

#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>
#include <string>

namespace qel::protocol {

/// The lowest stream of one connection: below TLS, or below the buffers of a plain connection.
///
/// Reading: says before each read that the reader may have to wait, so that what it has to send goes out first. A
/// deadline reaches the stream below when there is something to wait for, and not before: changing it costs a system
/// call. Its time begins with the first read nevertheless.
///
/// Writing: a thread that must not wait for the peer sends as much as there is room for. The rest is kept, and is sent
/// by a thread that may wait. That needs a socket.
///
/// Thread safety: that of a Stream. onRead() belongs to the reader, setMayWait(), hasRest() and sendRest() to the
/// writer. Who writes may change from one thread to another, if these agree on it under a lock.
class WireStream final : public Stream {
public:
    /// @param stream  owned, not null
    /// @param descriptor  of its socket; -1: it has none, and its writers must wait
    WireStream(std::unique_ptr<Stream> stream, int descriptor);
    ~WireStream() override;

    /// The stream of the constructor, for the steps before anything is buffered.
    Stream& below() const noexcept { return *mStream; }

    /// @param work  called on the reader's thread before each read; what it throws, the read throws
    void onRead(std::function<void()> work) { mOnRead = std::move(work); }

    /// Whether a thread may write that must not wait.
    bool needsNoWait() const noexcept { return mDescriptor >= 0; }

    /// Whether write() may wait for room, as it may at first.
    void setMayWait(bool mayWait) noexcept { mMayWait = mayWait || !needsNoWait(); }

    /// Whether something is left that found no room.
    bool hasRest() const noexcept { return !mRest.empty(); }

    /// Sends what is left, and waits for room. Does nothing if nothing is left.
    /// @throws ...  what a write of the stream below throws; the rest is dropped then
    void sendRest();

    std::size_t read(char* buffer, std::size_t length) override;
    /// @throws std::bad_alloc  without memory for the rest, of which a part may have been sent; and what a write of the
    ///                         stream below throws
    void write(const char* buffer, std::size_t length) override;
    void close() override;
    void setReadDeadline(std::chrono::milliseconds timeout) override;
    void setWriteDeadline(std::chrono::milliseconds timeout) override;

private:
    std::size_t pReceiveAtOnce(char* buffer, std::size_t length) const;
    void pSendAtOnce(const char*& buffer, std::size_t& length) const;

    const std::unique_ptr<Stream> mStream;
    const int mDescriptor;

    // Of the reader.
    std::function<void()> mOnRead;
    bool mHasNewDeadline = false; // the stream below does not know it yet
    StreamDeadline mNewDeadline;

    // Of the writer.
    bool mMayWait = true;
    std::string mRest; // found no room
};

} // namespace qel::protocol
