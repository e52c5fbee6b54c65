#pragma once

#include <qel/common/io/Stream.hpp>

#include "check/Draft.hpp"
#include "check/Frame.hpp"
#include "check/Transcript.hpp"

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace qel::tool::check {

/// One connection of a case: sends bytes as they are, takes frames, and records both.
///
/// Everything that the peer has to do has a timeout; when it passes, and when the peer does something else, a Failure
/// is thrown. Reset and end of stream are the same thing here: the end of the connection. Sending over a connection
/// that the peer has ended is not a failure: what was seen decides.
///
/// Notices of broadcasts by consoles of others are recorded and skipped: a case may run beside them.
/// Thread safety: one thread.
class Wire {
public:
    struct Options {
        unsigned int number = 1;                 ///< within the case, from 1
        std::chrono::milliseconds timeout{2000}; ///< for each thing that the peer has to do
        std::string toolIdPrefix;                ///< of the consoles of this case; empty: no broadcast is skipped
    };

    /// @param stream  connected  @param descriptor  of its socket
    /// @param transcript  borrowed
    Wire(std::unique_ptr<Stream> stream, int descriptor, Options options, Transcript& transcript);
    ~Wire();
    Wire(const Wire&) = delete;
    Wire& operator=(const Wire&) = delete;

    // Sending.

    void send(const std::string& bytes);
    /// A write for each byte.
    void sendByteByByte(const std::string& bytes);
    /// Sends a frame. A draft without a caller id gets a new one. @return the caller id
    std::uint32_t send(Draft draft);
    /// The bytes of a draft with a caller id, to be sent with others. @param id  set
    std::string prepare(Draft draft, std::uint32_t& id);

    // Receiving.

    /// The next frame. @param what  that is awaited, for the failure: "the response to ..."
    Frame receive(const std::string& what);

    /// The response with this caller id. Other frames are kept.
    Frame awaitResponse(std::uint32_t callerId, const std::string& what);

    /// A notice, from those that are kept or from the connection. Other frames are kept.
    Frame awaitNotice(unsigned int function, unsigned int operation);

    /// Sends a request and takes its response. Other frames are kept.
    Frame ask(const Draft& draft);

    /// The same; the response must have this status.
    Frame expectStatus(const Draft& draft, unsigned int status);

    /// Asks for the time of day, and so waits until all that was sent before has been dealt with. What arrives in
    /// between is kept.
    void fence();

    /// After fence(): fails if any frame has arrived that no one has taken. @param required  what had to happen instead
    void expectNothingKept(const std::string& required);

    /// Takes what is kept.
    std::vector<Frame> takeKept();

    /// The connection must end. Frames before its end are kept.
    void expectEnd();
    /// The connection must end without a frame before.
    void expectEndWithoutFrame();

    /// Reads whatever comes until the connection ends, frames or not. @return the bytes
    std::string drain();

    /// Whether nothing, not even the end, has arrived at this moment.
    bool isQuiet() const;

    /// Waits until something arrives. @return false: nothing has within this time
    bool awaitInput(std::chrono::milliseconds time) const;

    /// For what follows.
    void setTimeout(std::chrono::milliseconds timeout) { mTimeout = timeout; }

    // Ending.

    /// Half-closes the connection: the end of stream follows what was sent.
    void endSending();
    /// Ends the connection with a TCP reset.
    void reset();
    /// Half-closes it, without a word in the transcript.
    void beginLeaving() noexcept;
    /// Waits for the end of the peer's stream, but not longer than the timeout.
    void leave() noexcept;

    Stream& stream() noexcept { return *mStream; }

private:
    enum class ReadEnd { Filled, Ended, TimedOut };

    ReadEnd pFill(char* buffer, std::size_t length, std::size_t& count);
    std::optional<Frame> pReceive(const std::string& what);
    std::optional<Frame> pReceiveAny(const std::string& what);
    bool pIsForeign(const Frame& frame) const;
    void pNote(const std::string& text);
    [[noreturn]] void pFail(const std::string& expected, const std::string& seen) const;

    const Options mOptions;
    std::chrono::milliseconds mTimeout;
    Transcript& mTranscript;
    std::unique_ptr<Stream> mStream; // null after reset()
    int mDescriptor;
    std::uint32_t mLastCallerId;
    std::vector<Frame> mKept;
    bool mHasEnded = false;
};

} // namespace qel::tool::check
