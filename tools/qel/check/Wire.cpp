#include "check/Wire.hpp"

#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "check/Case.hpp"
#include "check/Messages.hpp"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <sys/socket.h>
#include <utility>

namespace qel::tool::check {

namespace {

constexpr std::size_t kPrefix = 8; // ends with the length of the frame
constexpr std::size_t kMaxFrame = 16384;
constexpr std::uint32_t kFirstCallerId = 0x100; // apart for each connection, so that transcripts are easy to read

bool isDeadline(const StreamIOException& error)
{
    if (std::strcmp(error.what(), "I/O deadline") == 0) return true;
    try {
        std::rethrow_if_nested(error);
    } catch (const PosixError& cause) {
        return cause.getErrorCode() == EAGAIN;
    } catch (const std::exception&) {
        return false;
    }
    return false;
}

std::string secondsText(std::chrono::milliseconds time)
{
    std::string text = std::to_string(std::chrono::duration<double>(time).count());
    text.erase(text.find_last_not_of('0') + 1);
    if (text.back() == '.') text.pop_back();
    return text + " s";
}

std::string responseTo(const Draft& draft)
{
    return "the response to " + messageName(draft.getFunction(), draft.getOperation());
}

} // namespace

Wire::Wire(std::unique_ptr<Stream> stream, int descriptor, Options options, Transcript& transcript)
    : mOptions(std::move(options)), mTimeout(mOptions.timeout), mTranscript(transcript), mStream(std::move(stream)),
      mDescriptor(descriptor), mLastCallerId(kFirstCallerId * mOptions.number)
{}

Wire::~Wire() = default;

void Wire::send(const std::string& bytes)
{
    mTranscript.add({mOptions.number, Event::Kind::Sent, bytes, ""});
    mStream->setWriteDeadline(mTimeout);
    try {
        mStream->write(bytes.data(), bytes.size());
    } catch (const StreamIOException& error) {
        if (!isDeadline(error)) return pNote("the connection has ended");
        pFail("the peer to read what is sent", "no room for it within " + secondsText(mTimeout));
    }
}

void Wire::sendByteByByte(const std::string& bytes)
{
    mTranscript.add({mOptions.number, Event::Kind::Sent, bytes, "byte by byte"});
    mStream->setWriteDeadline(mTimeout);
    try {
        for (const char& byte : bytes)
            mStream->write(&byte, 1);
    } catch (const StreamIOException& error) {
        if (!isDeadline(error)) return pNote("the connection has ended");
        pFail("the peer to read what is sent", "no room for it within " + secondsText(mTimeout));
    }
}

std::uint32_t Wire::send(Draft draft)
{
    std::uint32_t id = 0;
    const std::string bytes = prepare(std::move(draft), id);
    send(bytes);
    return id;
}

std::string Wire::prepare(Draft draft, std::uint32_t& id)
{
    if (!draft.getCallerId()) draft.callerId(++mLastCallerId);
    id = *draft.getCallerId();
    return draft.bytes();
}

Frame Wire::receive(const std::string& what)
{
    std::optional<Frame> frame = pReceive(what);
    if (!frame) pFail(what, "the end of the connection");
    return std::move(*frame);
}

Frame Wire::awaitResponse(std::uint32_t callerId, const std::string& what)
{
    for (;;) {
        Frame frame = receive(what);
        if (frame.isResponse() && frame.callerId == callerId) return frame;
        mKept.push_back(std::move(frame));
    }
}

Frame Wire::awaitNotice(unsigned int function, unsigned int operation)
{
    const auto matches = [&](const Frame& frame) { return frame.isNotice() && frame.is(function, operation); };
    const auto kept = std::find_if(mKept.begin(), mKept.end(), matches);
    if (kept != mKept.end()) {
        Frame frame = std::move(*kept);
        mKept.erase(kept);
        return frame;
    }
    for (;;) {
        Frame frame = receive("the notice " + messageName(function, operation));
        if (matches(frame)) return frame;
        mKept.push_back(std::move(frame));
    }
}

Frame Wire::ask(const Draft& draft) { return awaitResponse(send(draft), responseTo(draft)); }

Frame Wire::expectStatus(const Draft& draft, unsigned int status)
{
    Frame response = ask(draft);
    if (response.status == status) return response;
    pFail(responseTo(draft) + " with status " + statusText(status), "status " + statusText(response.status));
}

void Wire::fence() { expectStatus(timeRequest(), 0); }

void Wire::expectNothingKept(const std::string& required)
{
    if (!mKept.empty()) pFail(required, describeFrame(mKept.front().bytes));
}

std::vector<Frame> Wire::takeKept() { return std::exchange(mKept, {}); }

void Wire::expectEnd()
{
    while (std::optional<Frame> frame = pReceive("the end of the connection"))
        mKept.push_back(std::move(*frame));
}

void Wire::expectEndWithoutFrame()
{
    expectEnd();
    expectNothingKept("the end of the connection without another frame");
}

std::string Wire::drain()
{
    mStream->setReadDeadline(mTimeout);
    std::string bytes;
    std::size_t count = 0;
    do {
        std::array<char, 4096> buffer{};
        const ReadEnd end = pFill(buffer.data(), buffer.size(), count);
        bytes.append(buffer.data(), count);
        if (end == ReadEnd::TimedOut) pFail("the end of the connection", "none within " + secondsText(mTimeout));
        mHasEnded = end == ReadEnd::Ended;
    } while (!mHasEnded);
    if (!bytes.empty()) mTranscript.add({mOptions.number, Event::Kind::Seen, bytes, ""});
    pNote("the peer ends the connection");
    return bytes;
}

bool Wire::isQuiet() const { return !awaitInput(std::chrono::milliseconds(0)); }

bool Wire::awaitInput(std::chrono::milliseconds time) const
{
    const PollFd socket(mDescriptor, PollEvents::Read);
    return PollSet{socket}.wait(time).contains(socket);
}

void Wire::endSending()
{
    static_cast<void>(::shutdown(mDescriptor, SHUT_WR));
    pNote("end of stream sent");
}

void Wire::reset()
{
    linger now{};
    now.l_onoff = 1;
    static_cast<void>(::setsockopt(mDescriptor, SOL_SOCKET, SO_LINGER, &now, sizeof(now)));
    mStream.reset();
    mDescriptor = -1;
    pNote("connection reset");
}

void Wire::beginLeaving() noexcept
{
    if (mStream != nullptr && !mHasEnded) static_cast<void>(::shutdown(mDescriptor, SHUT_WR));
}

void Wire::leave() noexcept
{
    if (mStream == nullptr || mHasEnded) return;
    const auto end = TimeProvider::steady() + mTimeout;
    try {
        while (pReceiveAny("the end of the connection") && TimeProvider::steady() < end)
            continue;
    } catch (const std::exception&) {
        mHasEnded = true; // it has had its time
    }
}

/// @param count  set to how many bytes have arrived
Wire::ReadEnd Wire::pFill(char* buffer, std::size_t length, std::size_t& count)
{
    count = 0;
    try {
        while (count < length) {
            const std::size_t more = mStream->read(buffer + count, length - count);
            if (more == 0) return ReadEnd::Ended;
            count += more;
        }
    } catch (const StreamIOException& error) {
        return isDeadline(error) ? ReadEnd::TimedOut : ReadEnd::Ended;
    }
    return ReadEnd::Filled;
}

/// The next frame that is not foreign; none: the connection has ended.
std::optional<Frame> Wire::pReceive(const std::string& what)
{
    for (;;) {
        std::optional<Frame> frame = pReceiveAny(what);
        if (!frame || !pIsForeign(*frame)) return frame;
    }
}

std::optional<Frame> Wire::pReceiveAny(const std::string& what)
{
    if (mHasEnded) return std::nullopt;
    mStream->setReadDeadline(mTimeout);
    std::array<char, kMaxFrame> buffer; // NOLINT(cppcoreguidelines-pro-type-member-init): only read bytes are used
    std::size_t count = 0;
    std::size_t length = kPrefix;
    ReadEnd end = pFill(buffer.data(), kPrefix, count);
    if (end == ReadEnd::Filled) {
        std::uint32_t announced = 0;
        for (std::size_t i = 4; i < kPrefix; ++i)
            announced = announced << 8U | static_cast<unsigned char>(buffer[i]);
        if (announced > kPrefix && announced <= kMaxFrame) {
            length = announced;
            end = pFill(buffer.data() + kPrefix, length - kPrefix, count);
            count += kPrefix;
        }
    }
    std::string bytes(buffer.data(), count);
    if (count > 0) mTranscript.add({mOptions.number, Event::Kind::Seen, bytes, ""});
    if (end == ReadEnd::Ended) {
        mHasEnded = true;
        mTranscript.add({mOptions.number, Event::Kind::Note, "the peer ends the connection", ""});
        if (count == 0) return std::nullopt;
        pFail(what, "the end of the connection inside a frame, after " + std::to_string(count) + " bytes");
    }
    if (end == ReadEnd::TimedOut) {
        const std::string seen = count == 0 ? "nothing" : std::to_string(count) + " bytes of a frame";
        pFail(what, seen + " within " + secondsText(mTimeout));
    }
    return parseFrame(bytes);
}

/// Whether it is a broadcast by a console that does not belong to this case.
bool Wire::pIsForeign(const Frame& frame) const
{
    constexpr std::size_t kToolId = 10; // offset of the sender's tool id
    if (mOptions.toolIdPrefix.empty() || !frame.isNotice() || !frame.is(kToConsole, kBroadcastNotice)) return false;
    return frame.payload.compare(std::min(kToolId, frame.payload.size()), mOptions.toolIdPrefix.size(),
                                 mOptions.toolIdPrefix) != 0;
}

void Wire::pNote(const std::string& text) { mTranscript.add({mOptions.number, Event::Kind::Note, text, ""}); }

void Wire::pFail(const std::string& expected, const std::string& seen) const { throw Failure(expected, seen); }

} // namespace qel::tool::check
