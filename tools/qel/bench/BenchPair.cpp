#include "bench/BenchPair.hpp"

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>

#include "base/Failures.hpp"

#include <cstdint>
#include <utility>

namespace qel::tool {

namespace {

/// The broadcast type for a single addressee.
constexpr std::uint8_t kUnicast = 1;

bool isFrom(const QelMessageDaxBroadcastOutboundAsync& notice, const IdentityOptions& sender)
{
    return notice.getSenderToolType() == sender.toolType && notice.getSenderToolId() == sender.toolId;
}

} // namespace

BenchPair::BenchPair(BenchConsole first, BenchConsole second, std::size_t bytes, std::chrono::milliseconds timeout)
    : mConsoles{std::move(first), std::move(second)}, mPayload(bytes, 'q'), mTimeout(timeout)
{}

void BenchPair::exchange()
{
    BenchConsole& sender = mConsoles[mSender];
    BenchConsole& addressee = mConsoles[1 - mSender];
    mSender = 1 - mSender;
    sender.connection->setDeadline(mTimeout);
    addressee.connection->setDeadline(mTimeout);
    static_cast<void>(sender.connection->require(
        "broadcast",
        QelMessageDaxBroadcastReq(kUnicast, static_cast<std::uint16_t>(mPayload.size()), addressee.identity.toolType,
                                  addressee.identity.toolId, mPayload.data())));
    pAwait(sender, addressee);
}

void BenchPair::leave() noexcept
{
    for (BenchConsole& console : mConsoles)
        console.connection->leave();
}

void BenchPair::cut()
{
    for (BenchConsole& console : mConsoles)
        console.connection->close();
}

/// Receives at the addressee until the message arrives; broadcasts of other consoles are skipped.
void BenchPair::pAwait(const BenchConsole& sender, BenchConsole& addressee) const
{
    for (;;) {
        const std::unique_ptr<QelMessage> message = addressee.connection->receive();
        if (dynamic_cast<const QelMessageKrogConnectionClosedAsync*>(message.get()) != nullptr) {
            throw CommandFailure(ExitStatus::ClosedByPeer, "the server closed the connection");
        }
        const auto* notice = dynamic_cast<const QelMessageDaxBroadcastOutboundAsync*>(message.get());
        if (notice == nullptr || !isFrom(*notice, sender.identity)) continue;
        if (std::string(notice->getDaxPacket(), notice->getBroadcastMsgLen()) == mPayload) return;
        throw CommandFailure(ExitStatus::ProtocolBroken, "the server broke the protocol: a message arrived changed");
    }
}

} // namespace qel::tool
