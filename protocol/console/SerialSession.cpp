#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/SerialSession.hpp>

#include "console/ConsoleCore.hpp"

#include <algorithm>
#include <stdexcept>
#include <utility>

namespace qel::protocol {

using std::chrono::milliseconds;

static_assert(SerialSession::kMaxData ==
                  QelMessage::MtuMax - QelMessage::MaxHeaderSize - sizeof(QelMessageVirtualSerialDataToOsAsync::Data),
              "what the longest frame has room for");

namespace {

/// Does a step that receives messages. The notice that the connection closes is not a failure for a session: it ends
/// it.
/// @return false: the session has ended by that
template <typename F>
bool doStep(const SerialState& state, F step)
{
    try {
        step();
        return true;
    } catch (const ClosedByPeer&) {
        if (state.end == SessionEnd::None) throw;
        return false;
    }
}

QelMessageVirtualSerialDataToOsAsync dataMessage(const SerialState& state, const char* data, std::size_t length)
{
    return QelMessageVirtualSerialDataToOsAsync(state.partition, state.connection, static_cast<std::uint16_t>(length),
                                                data);
}

} // namespace

SerialSession::SerialSession(std::shared_ptr<ConsoleCore> core, std::shared_ptr<SerialState> state) noexcept
    : mCore(std::move(core)), mState(std::move(state))
{}

SerialSession::SerialSession(SerialSession&& other) noexcept = default;

SerialSession& SerialSession::operator=(SerialSession&& other) noexcept
{
    if (this == &other) return *this;
    pRelease();
    mCore = std::move(other.mCore);
    mState = std::move(other.mState);
    return *this;
}

SerialSession::~SerialSession() { pRelease(); }

std::uint16_t SerialSession::getPartition() const noexcept { return mState->partition; }

std::uint16_t SerialSession::getConnection() const noexcept { return mState->connection; }

std::size_t SerialSession::read(char* buffer, std::size_t length) { return read(buffer, length, milliseconds(-1)); }

std::size_t SerialSession::read(char* buffer, std::size_t length, milliseconds timeout)
{
    if (length == 0) throw std::invalid_argument("length: zero");
    const auto core = mCore; // a handler may destroy or move this session
    const auto state = mState;
    const auto isWaiting = [&] { return state->unreadBytes() == 0 && state->end == SessionEnd::None; };
    const TimePoint end = deadlineIn(timeout);
    while (isWaiting()) {
        doStep(*state, [&] {
            if (core->receiveOne(end, TimePoint::max()) && !(isWaiting() && hasPassed(end))) return;
            throw DeadlinePassed("partition " + std::to_string(state->partition) + " sent nothing in time",
                                 core->server());
        });
    }
    return state->take(buffer, length);
}

std::size_t SerialSession::readAvailable(char* buffer, std::size_t length) noexcept
{
    return mState->take(buffer, length);
}

std::size_t SerialSession::getAvailable() const noexcept { return mState->unreadBytes(); }

std::size_t SerialSession::write(const char* data, std::size_t length)
{
    const auto core = mCore; // a handler may destroy or move this session
    const auto state = mState;
    const auto isWanted = [&] { return state->end == SessionEnd::None; };
    std::size_t sent = 0;
    while (sent < length && isWanted()) {
        const std::size_t count = std::min(length - sent, kMaxData);
        const auto message = dataMessage(*state, data + sent, count);
        auto sending = Sending::NotWanted;
        doStep(*state, [&] { sending = core->sendAmongOthers(message, deadlineIn(core->requestTimeout()), isWanted); });
        if (sending == Sending::Late && sent == 0) core->throwNotTaken();
        if (sending == Sending::Late) break;
        if (sending == Sending::Done) {
            sent += count;
            state->sent += count;
        }
    }
    return sent;
}

void SerialSession::writeSome(std::string& data)
{
    if (mState->end != SessionEnd::None) return data.clear();
    const std::size_t count = std::min(data.size(), kMaxData);
    mCore->send(dataMessage(*mState, data.data(), count), deadlineIn(mCore->requestTimeout()));
    mState->sent += count;
    data.erase(0, count);
}

std::uint64_t SerialSession::getSent() const noexcept { return mState->sent; }

SessionEnd SerialSession::getEnd() const noexcept { return mState->end; }

CommandEnd SerialSession::getCommandEnd() const noexcept { return mState->commandEnd; }

std::string SerialSession::describeEnd() const
{
    if (mState->end != SessionEnd::CommandEnded) return describe(mState->end);
    return "session closed: " + describe(mState->commandEnd);
}

void SerialSession::close() { close(mCore->requestTimeout()); }

void SerialSession::close(milliseconds timeout)
{
    const auto core = mCore; // a handler may destroy or move this session
    const auto state = mState;
    core->closeSerial(state, deadlineIn(timeout));
}

void SerialSession::pRelease() noexcept
{
    if (mState != nullptr && mState->end == SessionEnd::None) mCore->dropSerial(mState);
}

} // namespace qel::protocol
