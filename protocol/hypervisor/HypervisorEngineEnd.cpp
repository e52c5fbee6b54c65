// How connections end: the consoles leave, say nothing for too long, or the hypervisor shuts down.

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Logging.hpp>

#include "base/Guard.hpp"
#include "base/MessageKind.hpp"
#include "hypervisor/DeferredWakeUps.hpp"
#include "hypervisor/HypervisorEngine.hpp"

#include <algorithm>
#include <string>

namespace qel::protocol {

void HypervisorEngine::disconnect(ConsoleId id, DisconnectReason why)
{
    const DeferredWakeUps wakeUps; // until the lock is released
    const MutexLock lock(mMutex);
    const auto found = mConsoles.find(id);
    if (found == mConsoles.end()) return;
    ConsoleEntry& console = found->second;
    mPartitions.release(console);
    if (console.announced) {
        static_cast<void>(
            runGuarded([&] { mMachine.onDisconnected(console.peer, console.end.value_or(why)); }, "console ", id));
    }
    pForgetIdentified(console);
    mConsoles.erase(found);
    logLine(LogLevel::Info, "console ", id, " disconnected");
    mWakeSerial();
}

void HypervisorEngine::shutDown()
{
    const DeferredWakeUps wakeUps; // until the lock is released
    const MutexLock lock(mMutex);
    mShutDown = true;
    mPartitions.shutDown();
    for (auto& entry : mConsoles) {
        ConsoleEntry& console = entry.second;
        if (console.state == ConsoleState::Identified) {
            console.link.post(std::make_unique<QelMessageKrogConnectionClosedAsync>());
        }
        if (console.state == ConsoleState::Closing) continue;
        console.end = DisconnectReason::Shutdown;
        pClose(console);
    }
    mWakeSerial();
}

void HypervisorEngine::pForgetIdentified(const ConsoleEntry& console)
{
    if (console.state == ConsoleState::Identified) mIdentified.erase({console.peer.toolType, console.peer.toolId});
}

void HypervisorEngine::pClose(ConsoleEntry& console)
{
    pForgetIdentified(console);
    console.state = ConsoleState::Closing;
    console.link.finish();
}

/// Notes that a console has said something. The request for the time does not count: consoles ask for it by themselves,
/// to see whether the server is there.
void HypervisorEngine::pNoteHeard(ConsoleEntry& console, const QelMessage& message)
{
    if (mIdle.timeout.count() == 0 || console.state != ConsoleState::Identified) return;
    if (isKind<QelMessageGetQelTodReq>(message)) return;
    console.heardAt = TimeProvider::steady();
    const PollDeadline next(console.heardAt + mIdle.timeout);
    if (mLookAtIdle <= next) return;
    mLookAtIdle = next;
    mWakeSerial();
}

/// Lets consoles go that have said nothing for too long, and cuts those that do not take what is queued for them.
void HypervisorEngine::pServiceIdle(TimePoint now)
{
    PollDeadline next;
    for (auto& entry : mConsoles)
        next = std::min(next, pServiceIdle(entry.second, now));
    mLookAtIdle = next;
}

/// @return when to look at the console again
PollDeadline HypervisorEngine::pServiceIdle(ConsoleEntry& console, TimePoint now)
{
    if (console.cutAt.isExpired(now)) {
        console.cutAt = PollDeadline();
        console.link.cut();
    }
    if (console.state != ConsoleState::Identified) return console.cutAt;
    if (!pMayReceive(console)) console.heardAt = now; // it may have said something that is not read
    if (now >= console.heardAt + mIdle.timeout) {
        pLetGo(console, now);
        return console.cutAt;
    }
    return console.heardAt + mIdle.timeout;
}

void HypervisorEngine::pLetGo(ConsoleEntry& console, TimePoint now)
{
    const auto seconds = std::chrono::duration_cast<std::chrono::seconds>(mIdle.timeout).count();
    const std::string silence = "nothing has come from this console for " + std::to_string(seconds) + " s";
    mPartitions.endSessionsOf(console, silence);
    console.link.post(std::make_unique<QelMessageKrogConnectionClosedAsync>());
    logLine(LogLevel::Info, "console ", console.peer.id, ": let go, ", silence);
    console.end = DisconnectReason::Idle;
    console.cutAt = now + mIdle.linger;
    pClose(console);
}

} // namespace qel::protocol
