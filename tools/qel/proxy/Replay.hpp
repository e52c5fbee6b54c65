#pragma once

#include <qel/common/io/Stream.hpp>

#include "proxy/FrameView.hpp"

#include <chrono>
#include <cstdint>
#include <functional>
#include <istream>
#include <map>
#include <string>
#include <vector>

namespace qel::tool {

/// A frame of a recording.
struct RecordedFrame {
    Way way = Way::ToServer;
    std::string bytes;
};

/// The frames of one connection, in their order.
using RecordedConnection = std::vector<RecordedFrame>;

/// Reads a recording: a capture (pcapng, pcap), raw frames or hexadecimal text, as "qel decode" does. Requests, and
/// notices to anything but the console's function, go to the server; responses and the other notices go to the console.
/// The steps before TLS are left out.
/// @return one for each connection of a capture
/// @throws CommandFailure  Refused: a frame is malformed, or there is none
std::vector<RecordedConnection> readRecording(std::istream& input);

/// What a replay has found.
struct ReplayResult {
    std::uint64_t sent = 0;
    std::uint64_t compared = 0;  ///< answers
    std::uint64_t different = 0; ///< of them
    std::uint64_t recordedNotices = 0;
    std::uint64_t seenNotices = 0;
};

/// An answer of the server beside the recorded one.
struct ReplayAnswer {
    std::uint64_t number = 0; ///< of the recorded response in the recording, from 1
    std::string recorded;     ///< the frames
    std::string live;
    std::vector<std::string> differences; ///< in words; empty: none
};

/// Says how an answer differs from the recorded one: function, operation, flags, status, status detail, payload. Caller
/// ids and reserved fields may differ, and so may the time in the response to GetQelTod.
std::vector<std::string> differencesOf(const FrameView& recorded, const FrameView& live);

/// Sends the console's frames of a recording to a live server, in their order, with caller ids of its own. Where the
/// recording has a response, waits for the server's response to the same request and compares it.
///
/// Lifetime: borrows the stream. Thread safety: one thread.
class Replay {
public:
    using Sink = std::function<void(const ReplayAnswer&)>;

    /// @param stream  connected; with TLS or without
    /// @param timeout  for each answer
    Replay(Stream& stream, std::chrono::milliseconds timeout, Sink sink);

    /// @throws CommandFailure  DeadlinePassed, ClosedByPeer, ProtocolBroken: names the frame
    ReplayResult play(const RecordedConnection& frames);

private:
    void pSend(const RecordedFrame& frame);
    void pCompare(const RecordedFrame& frame, std::uint64_t number);
    std::string pAwait(std::uint32_t callerId, const std::string& what);
    std::string pReadFrame(const std::string& what);

    Stream& mStream;
    const std::chrono::milliseconds mTimeout;
    const Sink mSink;
    ReplayResult mResult;
    std::uint32_t mNextId = 1;
    std::map<std::uint32_t, std::uint32_t> mLiveIds;    // by the recorded ones
    std::map<std::uint32_t, std::string> mEarlyAnswers; // that came before their turn, by live id
};

} // namespace qel::tool
