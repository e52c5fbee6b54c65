#include "server/SerialLoop.hpp"

#include "base/Guard.hpp"
#include "base/Threads.hpp"

#include <chrono>
#include <vector>

namespace qel::protocol {

namespace {

/// The pause after a failure, before the next attempt.
constexpr std::chrono::milliseconds kPauseAfterFailure(100);

} // namespace

SerialLoop::SerialLoop(HypervisorEngine& hypervisor, PollInterrupt& wake)
    : mHypervisor(hypervisor), mWake(wake), mThread(startThread([this] { pRun(); }))
{}

SerialLoop::~SerialLoop()
{
    mStopping = true;
    mWake.interrupt();
    mThread.join();
}

void SerialLoop::pRun() noexcept
{
    while (!mStopping) {
        ++mTurns;
        try {
            pPollOnce();
        } catch (...) {
            logCurrent("serial lines");
            std::this_thread::sleep_for(kPauseAfterFailure);
        }
    }
}

void SerialLoop::pPollOnce()
{
    const std::chrono::milliseconds timeout = mHypervisor.serviceLines();
    const std::vector<SerialWatch> watches = mHypervisor.serialWatches();
    PollSet set(mWake.getPollFd());
    for (const SerialWatch& watch : watches)
        set += watch.fd;
    const PollResult result = set.wait(timeout);
    if (result.contains(mWake.getPollFd())) mWake.eoi();
    for (const SerialWatch& watch : watches) {
        if (result.contains(watch.fd)) mHypervisor.serviceSerial(watch.partition);
    }
}

} // namespace qel::protocol
