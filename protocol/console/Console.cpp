#include <qel/protocol/Console.hpp>

#include "console/ConsoleCore.hpp"

#include <stdexcept>
#include <utility>

namespace qel::protocol {

// Every call that receives holds the core for itself: a handler may destroy or move the console.

using std::chrono::milliseconds;

Console::Console(const ConsoleOptions& options, milliseconds timeout)
    : mCore(std::make_shared<ConsoleCore>(options, true))
{
    mCore->connect(deadlineIn(timeout));
}

Console::Console(std::unique_ptr<Stream> stream, const ConsoleOptions& options, milliseconds timeout, int descriptor)
    : mCore(std::make_shared<ConsoleCore>(options, false))
{
    if (stream == nullptr) throw std::invalid_argument("stream: null");
    mCore->adopt(std::move(stream), descriptor, deadlineIn(timeout));
}

Console::Console(Console&& other) noexcept = default;

Console& Console::operator=(Console&& other) noexcept
{
    if (this == &other) return *this;
    if (mCore != nullptr) mCore->dispose();
    mCore = std::move(other.mCore);
    return *this;
}

Console::~Console()
{
    if (mCore != nullptr) mCore->dispose();
}

const std::string& Console::getServer() const noexcept { return mCore->server(); }

const PeerIdentity& Console::peer() const noexcept { return mCore->peer(); }

bool Console::isProtected() const noexcept { return mCore->isProtected(); }

const QelMessageGetEnclTypeAndInterfaceVersionRsp& Console::version() const { return mCore->version(); }

std::unique_ptr<QelMessage> Console::exchange(const QelMessage& request)
{
    return exchange(request, mCore->requestTimeout());
}

std::unique_ptr<QelMessage> Console::exchange(const QelMessage& request, milliseconds timeout)
{
    const auto core = mCore;
    return core->exchange(request, deadlineIn(timeout));
}

void Console::send(const QelMessage& notice) { mCore->send(notice, deadlineIn(mCore->requestTimeout())); }

void Console::onOtherNotice(NoticeHandler handler) { mCore->onOtherNotice(std::move(handler)); }

void Console::openSession() { openSession(mCore->requestTimeout()); }

void Console::openSession(milliseconds timeout)
{
    const auto core = mCore;
    core->openSession(deadlineIn(timeout));
}

void Console::closeSession() { closeSession(mCore->requestTimeout()); }

void Console::closeSession(milliseconds timeout)
{
    const auto core = mCore;
    core->closeSession(deadlineIn(timeout));
}

SerialSession Console::openSerial(std::uint16_t partition, const SerialOptions& options)
{
    return openSerial(partition, options, mCore->requestTimeout());
}

SerialSession Console::openSerial(std::uint16_t partition, const SerialOptions& options, milliseconds timeout)
{
    const auto core = mCore;
    return SerialSession(core, core->openSerial(partition, options, deadlineIn(timeout)));
}

PollFd Console::getPollFd(PollEvents events) const { return mCore->getPollFd(events); }

bool Console::hasPending() const { return mCore->hasPending(); }

bool Console::process(milliseconds timeout)
{
    const auto core = mCore;
    return core->receiveOne(deadlineIn(timeout), TimePoint::max());
}

void Console::reconnect(milliseconds timeout)
{
    const auto core = mCore;
    core->reconnect(deadlineIn(timeout));
}

void Console::leave() noexcept { mCore->leave(); }

void Console::close() noexcept { mCore->close(); }

std::unique_ptr<QelMessage> Console::pRequest(const QelMessage& message)
{
    return pRequest(message, mCore->requestTimeout());
}

std::unique_ptr<QelMessage> Console::pRequest(const QelMessage& message, milliseconds timeout)
{
    const auto core = mCore;
    return core->require(message, deadlineIn(timeout));
}

detail::PendingExchange Console::pStart(const QelMessage& message)
{
    const auto core = mCore;
    auto exchange = std::make_shared<Exchange>(message);
    core->start(message, *exchange, deadlineIn(core->requestTimeout()), SendTime::WithOthers);
    return detail::PendingExchange(core, std::move(exchange));
}

void Console::pOnNotice(const QelMessageRegistry::Identifier& identity, std::function<bool(const QelMessage&)> handler)
{
    mCore->onNotice(identity, std::move(handler));
}

} // namespace qel::protocol
