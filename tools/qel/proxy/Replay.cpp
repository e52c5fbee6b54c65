#include "proxy/Replay.hpp"

#include <qel/common/QelMessage.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Failures.hpp"
#include "decode/CaptureDecoder.hpp"
#include "decode/FrameDecoder.hpp"
#include "decode/HexText.hpp"
#include "decode/PcapReader.hpp"
#include "decode/PrefixedInput.hpp"
#include "proxy/FrameNames.hpp"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <utility>

namespace qel::tool {

namespace {

using Kind = QelMessageClassification::Value;

[[noreturn]] void refuse(const std::string& reason) { throw CommandFailure(ExitStatus::Refused, reason); }

/// Requests go to the server, which sends none itself.
Way wayOf(const FrameView& frame)
{
    if (frame.kind() == Kind::Request) return Way::ToServer;
    if (frame.kind() == Kind::Response) return Way::ToConsole;
    return frame.function() == QelMessageFunctionDax ? Way::ToConsole : Way::ToServer;
}

/// Both directions of a connection have the same: "A > B" and "B > A".
std::string connectionOf(const std::string& stream)
{
    constexpr const char* kArrow = " > ";
    const std::size_t arrow = stream.find(kArrow);
    if (arrow == std::string::npos) return stream;
    const std::string from = stream.substr(0, arrow);
    const std::string to = stream.substr(arrow + std::strlen(kArrow));
    return std::min(from, to) + kArrow + std::max(from, to);
}

/// Collects frames by connection, in the order in which connections begin.
class Recording {
public:
    void add(const FrameDecoder::Item& item)
    {
        if (item.message == nullptr) {
            refuse("the recording has a malformed frame at offset " + std::to_string(item.offset) +
                   (item.stream.empty() ? "" : " of " + item.stream) + ": " + item.reason);
        }
        const std::string bytes(item.message->serialize(), item.message->msgLength());
        const FrameView frame(bytes.data(), bytes.size());
        if (frame.function() == QelMessageFunctionQel) return; // the steps before TLS
        const auto place = mPlaces.emplace(connectionOf(item.stream), mConnections.size());
        if (place.second) mConnections.emplace_back();
        mConnections[place.first->second].push_back({wayOf(frame), bytes});
    }

    void addBytes(std::istream& bytes)
    {
        FrameDecoder decoder(bytes);
        for (FrameDecoder::Item item; decoder.next(item);)
            add(item);
    }

    std::vector<RecordedConnection> take()
    {
        if (mConnections.empty()) refuse("the recording has no frame");
        return std::move(mConnections);
    }

private:
    std::map<std::string, std::size_t> mPlaces;
    std::vector<RecordedConnection> mConnections;
};

bool isTime(const FrameView& frame)
{
    return frame.function() == QelMessageFunctionQelInterfaceCmp && frame.operation() == QelMessageOpGetQelTod;
}

std::string payloadOf(const FrameView& frame)
{
    const std::size_t begin = std::min(frame.headerLength(), frame.length());
    return {frame.bytes() + begin, std::min<std::size_t>(frame.dataLength(), frame.length() - begin)};
}

std::string statusText(std::uint16_t status)
{
    const std::string& name = shortStatusName(status);
    return std::to_string(status) + (name.empty() ? "" : " (" + name + ")");
}

std::string hexNumber(std::uint32_t number, std::size_t width)
{
    std::string bytes;
    for (std::size_t i = width; i > 0; --i)
        bytes += static_cast<char>(number >> 8 * (i - 1));
    return "0x" + hexDigits(bytes);
}

void comparePayloads(const FrameView& recorded, const FrameView& live, std::vector<std::string>& differences)
{
    const std::string before = payloadOf(recorded);
    const std::string now = payloadOf(live);
    if (before.size() != now.size()) {
        differences.push_back("payload of " + std::to_string(now.size()) + " bytes instead of " +
                              std::to_string(before.size()));
        return;
    }
    if (before == now || isTime(recorded)) return;
    const auto at =
        static_cast<std::size_t>(std::mismatch(before.begin(), before.end(), now.begin()).first - before.begin());
    differences.push_back("payload differs from byte " + std::to_string(at) + ": " + hexDigits(now.substr(at, 1)) +
                          " instead of " + hexDigits(before.substr(at, 1)));
}

void setCallerId(std::string& frame, std::uint32_t id)
{
    constexpr std::size_t kAt = 8;
    for (std::size_t i = 0; i < sizeof(id); ++i)
        frame[kAt + i] = static_cast<char>(id >> 8 * (sizeof(id) - 1 - i));
}

bool isDeadline(const StreamIOException& error)
{
    if (std::strcmp(error.what(), "I/O deadline") == 0) return true;
    try {
        std::rethrow_if_nested(error);
    } catch (const PosixError& cause) {
        return cause.getErrorCode() == PosixErrorCode(EAGAIN);
    } catch (...) {
    }
    return false;
}

} // namespace

std::vector<RecordedConnection> readRecording(std::istream& input)
{
    Recording recording;
    PrefixedInput buffer(input, PcapReader::kMagicBytes);
    std::istream bytes(&buffer);
    const bool isPcapng = PcapReader::isPcapng(buffer.prefix());
    if (isPcapng || PcapReader::isPcap(buffer.prefix())) {
        CaptureDecoder(bytes, isPcapng, [&](const FrameDecoder::Item& item) { recording.add(item); }).run();
    } else if (looksLikeHexText(bytes)) {
        HexTextBuffer text(bytes);
        std::istream decoded(&text);
        decoded.exceptions(std::ios::badbit); // without it the stream hides what its buffer throws
        recording.addBytes(decoded);
    } else {
        recording.addBytes(bytes);
    }
    return recording.take();
}

std::vector<std::string> differencesOf(const FrameView& recorded, const FrameView& live)
{
    std::vector<std::string> differences;
    const auto compare = [&](const char* what, std::uint32_t before, std::uint32_t now, std::size_t width) {
        if (before != now)
            differences.push_back(std::string(what) + " " + hexNumber(now, width) + " instead of " +
                                  hexNumber(before, width));
    };
    compare("function", recorded.function(), live.function(), 2);
    compare("operation", recorded.operation(), live.operation(), 2);
    compare("flags", recorded.flags(), live.flags(), 1);
    if (recorded.status() != live.status())
        differences.push_back("status " + statusText(live.status()) + " instead of " + statusText(recorded.status()));
    const auto detail = [](const FrameView& frame) { return frame.headerLength() == 32 ? frame.number(24, 2) : 0; };
    compare("status detail", detail(recorded), detail(live), 2);
    comparePayloads(recorded, live, differences);
    return differences;
}

Replay::Replay(Stream& stream, std::chrono::milliseconds timeout, Sink sink)
    : mStream(stream), mTimeout(timeout), mSink(std::move(sink))
{}

ReplayResult Replay::play(const RecordedConnection& frames)
{
    for (std::size_t i = 0; i < frames.size(); ++i) {
        const FrameView frame(frames[i].bytes.data(), frames[i].bytes.size());
        if (frames[i].way == Way::ToServer) {
            pSend(frames[i]);
        } else if (frame.kind() == Kind::Response) {
            pCompare(frames[i], i + 1);
        } else {
            ++mResult.recordedNotices;
        }
    }
    return mResult;
}

void Replay::pSend(const RecordedFrame& frame)
{
    std::string bytes = frame.bytes;
    const std::uint32_t recorded = FrameView(bytes.data(), bytes.size()).callerId();
    mLiveIds[recorded] = mNextId;
    setCallerId(bytes, mNextId++);
    mStream.setWriteDeadline(mTimeout);
    try {
        mStream.write(bytes.data(), bytes.size());
    } catch (const StreamIOException& error) {
        const ExitStatus status = isDeadline(error) ? ExitStatus::DeadlinePassed : ExitStatus::ClosedByPeer;
        throw CommandFailure(status, std::string("the server takes no more frames: ") + explain(error));
    }
    ++mResult.sent;
}

void Replay::pCompare(const RecordedFrame& frame, std::uint64_t number)
{
    const FrameView recorded(frame.bytes.data(), frame.bytes.size());
    const auto id = mLiveIds.find(recorded.callerId());
    if (id == mLiveIds.end()) return; // the recording does not have its request
    const std::string& name = operationName(recorded.function(), recorded.operation());
    ReplayAnswer answer;
    answer.number = number;
    answer.recorded = frame.bytes;
    answer.live = pAwait(id->second, "frame " + std::to_string(number) + " of the recording" +
                                         (name.empty() ? "" : ", the response to " + name));
    answer.differences = differencesOf(recorded, FrameView(answer.live.data(), answer.live.size()));
    ++mResult.compared;
    if (!answer.differences.empty()) ++mResult.different;
    mSink(answer);
}

/// The response to a request, which others may precede.
std::string Replay::pAwait(std::uint32_t callerId, const std::string& what)
{
    mStream.setReadDeadline(mTimeout);
    for (;;) {
        const auto early = mEarlyAnswers.find(callerId);
        if (early != mEarlyAnswers.end()) {
            std::string frame = std::move(early->second);
            mEarlyAnswers.erase(early);
            return frame;
        }
        std::string frame = pReadFrame(what);
        const FrameView view(frame.data(), frame.size());
        if (view.kind() != Kind::Response) {
            ++mResult.seenNotices;
        } else {
            mEarlyAnswers[view.callerId()] = std::move(frame);
        }
    }
}

std::string Replay::pReadFrame(const std::string& what)
{
    constexpr std::size_t kPrefix = 8;
    std::string frame(kPrefix, '\0');
    try {
        mStream.fill(frame.data(), kPrefix);
        const std::size_t length = FrameView(frame.data(), kPrefix).number(4, 4);
        if (length <= kPrefix || length > QelMessage::MtuMax)
            throw CommandFailure(ExitStatus::ProtocolBroken,
                                 "the server sends a frame that gives " + std::to_string(length) + " as its length");
        frame.resize(length);
        mStream.fill(frame.data() + kPrefix, length - kPrefix);
    } catch (const StreamIOException& error) {
        if (isDeadline(error)) throw CommandFailure(ExitStatus::DeadlinePassed, "no answer in time: " + what);
        throw CommandFailure(ExitStatus::ClosedByPeer, "connection lost before " + what + ": " + explain(error));
    }
    return frame;
}

} // namespace qel::tool
