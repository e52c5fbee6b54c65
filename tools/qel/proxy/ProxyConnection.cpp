#include "proxy/ProxyConnection.hpp"

#include <algorithm>
#include <array>
#include <chrono>
#include <utility>

namespace qel::tool {

namespace {

constexpr int kTurns = 4; // of a busy connection before the others have theirs

/// How long the sides of a connection that a rule has cut may take to end it too.
constexpr std::chrono::seconds kCutTime(1);

const char* sideText(ProxySide side) { return side == ProxySide::Console ? "the console" : "the server"; }

bool sees(const PollFd& ready, short events) { return (ready.mFd.revents & events) != 0; }

} // namespace

ProxyConnection::ProxyConnection(std::uint64_t number, std::unique_ptr<ProxyEnd> console,
                                 std::unique_ptr<ProxyEnd> server, const FaultPlan& plan, ProxyObserver& observer)
    : mNumber(number),
      mObserver(observer), mConsole{std::move(console), ProxySide::Console, {{number, Way::ToServer}, plan, observer}},
      mServer{std::move(server), ProxySide::Server, {{number, Way::ToConsole}, plan, observer}}
{}

PollFd ProxyConnection::pPollFd(End& end, TimePoint now)
{
    const bool reads = mIsCut ? !end.hasEnded : end.from.wantsInput(now);
    const bool writes = end.isBlocked || end.socket->hasRest();
    if (!reads && !writes && end.isGone) return PollFd::Ignore;
    PollFd fd(end.socket->descriptor(), PollEvents::Error);
    if (reads) fd.mFd.events |= static_cast<short>(PollEvents::Read);
    if (writes) fd.mFd.events |= static_cast<short>(PollEvents::Write);
    return fd;
}

ProxyConnection::TimePoint ProxyConnection::wakeAt(TimePoint now) const
{
    if (mIsCut) return mCutUntil;
    for (const End* end : {&mConsole, &mServer}) {
        if (end->socket->mayHaveMore() && end->from.wantsInput(now)) return now;
    }
    // A flow whose receiver has no room waits for that.
    const TimePoint toServer = mServer.isBlocked ? FrameFlow::kNever : mConsole.from.wakeAt(now);
    const TimePoint toConsole = mConsole.isBlocked ? FrameFlow::kNever : mServer.from.wakeAt(now);
    return std::min(toServer, toConsole);
}

void ProxyConnection::serve(const PollFd& consoleReady, const PollFd& serverReady, TimePoint now)
{
    pNote(mConsole, consoleReady, now);
    pNote(mServer, serverReady, now);
    if (mIsDone) return;
    bool moved = true;
    for (int turn = 0; turn < kTurns && moved && !mIsDone && !mIsCut; ++turn) {
        moved = false;
        for (End* end : {&mConsole, &mServer}) {
            moved = pRead(*end, now) || moved;
            if (mIsDone) return;
        }
        for (End* end : {&mServer, &mConsole}) {
            moved = pSend(*end, now) || moved;
            if (mIsDone) return;
        }
        pCheckEndings();
    }
    if (!mIsCut || mIsDone) return;
    mCutUntil = std::min(mCutUntil, now + kCutTime);
    pDrain(mConsole);
    pDrain(mServer);
    if ((mConsole.hasEnded && mServer.hasEnded) || now >= mCutUntil) pFinish(mWhy);
}

/// Takes what poll(2) has seen of a side.
void ProxyConnection::pNote(End& end, const PollFd& ready, TimePoint now)
{
    if (sees(ready, POLLIN | POLLHUP | POLLERR)) end.isReadable = true;
    if (sees(ready, POLLOUT | POLLHUP | POLLERR)) {
        end.isBlocked = false;
        end.socket->flush();
    }
    if (sees(ready, POLLHUP)) end.isGone = true;
    // A side that is read says by itself what is wrong, after all that it had sent.
    if (mIsDone || !sees(ready, POLLERR) || end.from.wantsInput(now)) return;
    const int error = end.socket->takeError();
    if (error != 0) pReset(std::string(sideText(end.side)) + " has reset it");
}

/// Reads from a side, once. @return whether something came
bool ProxyConnection::pRead(End& end, TimePoint now)
{
    const bool mayRead = end.isReadable || end.socket->mayHaveMore();
    if (!mayRead || !end.from.wantsInput(now)) return false;
    std::size_t room = 0;
    char* const buffer = end.from.room(room);
    const ProxyEnd::Reading reading = end.socket->read(buffer, room);
    switch (reading.got) {
    case ProxyEnd::Got::Bytes: {
        const Way way = end.side == ProxySide::Console ? Way::ToServer : Way::ToConsole;
        mObserver.onBytes(mNumber, end.side, way, {buffer, reading.bytes});
        end.from.take(reading.bytes, now);
        // Without TLS, less than there is room for is all there was: poll(2) says when there is more.
        if (reading.bytes < room) end.isReadable = end.socket->mayHaveMore();
        return true;
    }
    case ProxyEnd::Got::Nothing:
        end.isReadable = false;
        return false;
    case ProxyEnd::Got::End:
        end.isReadable = false;
        end.hasEnded = true;
        end.from.takeEnd(now);
        return true;
    case ProxyEnd::Got::Broken:
        pReset(std::string(sideText(end.side)) + " has reset it");
        return false;
    }
    return false;
}

/// Sends what waits for a side. @return whether something went
bool ProxyConnection::pSend(End& end, TimePoint now)
{
    FrameFlow& flow = pFlowTo(end);
    bool sent = false;
    while (!end.isBlocked) {
        const std::string_view bytes = flow.next(now);
        if (bytes.empty()) break;
        const std::size_t count = end.socket->write(bytes.data(), bytes.size());
        if (end.socket->isBroken()) {
            pReset(std::string(sideText(end.side)) + " takes no more");
            return sent;
        }
        end.isBlocked = count < bytes.size() && (count == 0 || !end.socket->hasRest());
        if (count == 0) {
            end.isBlocked = true;
            break;
        }
        const Way way = end.side == ProxySide::Server ? Way::ToServer : Way::ToConsole;
        mObserver.onBytes(mNumber, end.side, way, bytes.substr(0, count));
        flow.sent(count, now);
        sent = true;
    }
    return sent;
}

/// Drops what a side still sends, so that it reads the end of the connection and no reset.
void ProxyConnection::pDrain(End& end)
{
    std::array<char, 16384> dropped{};
    while (!end.hasEnded) {
        const ProxyEnd::Reading reading = end.socket->read(dropped.data(), dropped.size());
        if (reading.got == ProxyEnd::Got::Nothing) return;
        end.hasEnded = reading.got != ProxyEnd::Got::Bytes;
    }
}

void ProxyConnection::pCheckEndings()
{
    pCheckFlow(mConsole.from, mServer);
    if (!mIsDone) pCheckFlow(mServer.from, mConsole);
    if (mIsDone || mIsCut) return;
    const bool isOver = mConsole.from.isOver() && mServer.from.isOver();
    if (isOver && !mConsole.socket->hasRest() && !mServer.socket->hasRest()) pFinish("both sides have ended it");
}

void ProxyConnection::pCheckFlow(FrameFlow& flow, End& to)
{
    switch (flow.ending()) {
    case FrameFlow::Ending::None:
        break;
    case FrameFlow::Ending::HalfClose:
        if (to.isEnded) break;
        to.isEnded = true;
        to.socket->endWriting();
        mObserver.onEnd({mNumber, to.side == ProxySide::Server ? Way::ToServer : Way::ToConsole});
        break;
    case FrameFlow::Ending::Cut:
        mIsCut = true;
        mWhy = "a rule has cut it";
        mConsole.socket->endWriting();
        mServer.socket->endWriting();
        break;
    case FrameFlow::Ending::Reset:
        pReset("a rule has reset it");
        break;
    }
}

void ProxyConnection::abort(const std::string& why)
{
    if (!mIsDone) pFinish(why);
}

void ProxyConnection::pReset(const std::string& why)
{
    mConsole.socket->reset();
    mServer.socket->reset();
    pFinish(why);
}

void ProxyConnection::pFinish(const std::string& why)
{
    mIsDone = true;
    mObserver.onClosed(mNumber, why, mConsole.from, mServer.from);
}

} // namespace qel::tool
