#include "bench/BenchPair.hpp"

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>

#include "base/Failures.hpp"
#include "client/ConnectOptions.hpp"

#include <cstdint>
#include <utility>

namespace qel::tool {

namespace {

/// The broadcast type for a single addressee.
constexpr std::uint8_t kUnicast = 1;

bool isFrom(const QelMessageDaxBroadcastOutboundAsync& notice, const Identity& sender)
{
    return notice.getSenderToolType() == sender.toolType && notice.getSenderToolId() == sender.toolId;
}

} // namespace

BenchPair::BenchPair(BenchConsole first, BenchConsole second, std::size_t bytes, std::chrono::milliseconds timeout)
    : mConsoles{std::move(first), std::move(second)}, mPayload(bytes, 'q'), mTimeout(timeout)
{
    const auto listen = [this](BenchConsole& addressee, BenchConsole& sender) {
        addressee.console.onNotice<QelMessageDaxBroadcastOutboundAsync>(
            [this, from = &sender](const auto& notice) { pTake(*from, notice); });
    };
    listen(mConsoles[0], mConsoles[1]);
    listen(mConsoles[1], mConsoles[0]);
}

void BenchPair::exchange()
{
    BenchConsole& sender = mConsoles[mSender];
    BenchConsole& addressee = mConsoles[1 - mSender];
    mSender = 1 - mSender;
    mHasArrived = false;
    static_cast<void>(sender.console.request(
        QelMessageDaxBroadcastReq(kUnicast, static_cast<std::uint16_t>(mPayload.size()), addressee.identity.toolType,
                                  addressee.identity.toolId, mPayload.data()),
        mTimeout));
    pAwait(addressee);
}

void BenchPair::leave() noexcept
{
    for (BenchConsole& entry : mConsoles)
        entry.console.leave();
}

void BenchPair::cut()
{
    for (BenchConsole& entry : mConsoles)
        entry.console.close();
}

void BenchPair::pAwait(BenchConsole& addressee)
{
    const auto end = TimeProvider::steady() + mTimeout;
    while (!mHasArrived) {
        const bool isSilent = !addressee.console.process(timeLeft(end));
        if (isSilent || (!mHasArrived && TimeProvider::steady() >= end)) {
            throw DeadlinePassed("the peer did not answer in time: a message has not arrived",
                                 addressee.console.getServer());
        }
    }
}

/// Receives a broadcast; those of other consoles are skipped.
void BenchPair::pTake(const BenchConsole& sender, const QelMessageDaxBroadcastOutboundAsync& notice)
{
    if (!isFrom(notice, sender.identity)) return;
    mHasArrived = std::string(notice.getDaxPacket(), notice.getBroadcastMsgLen()) == mPayload;
    if (mHasArrived) return;
    throw CommandFailure(ExitStatus::ProtocolBroken, "the server broke the protocol: a message arrived changed");
}

} // namespace qel::tool
