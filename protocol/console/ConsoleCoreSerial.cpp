// The serial sessions of a console.

#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>

#include "base/Guard.hpp"
#include "base/MessageKind.hpp"
#include "console/ConsoleCore.hpp"

#include <algorithm>
#include <stdexcept>

namespace qel::protocol {

std::shared_ptr<SerialState> ConsoleCore::openSerial(std::uint16_t partition, const SerialOptions& options,
                                                     TimePoint end)
{
    if (options.maxUnread == 0) throw std::invalid_argument("maxUnread: zero");
    openSession(end);
    auto state = std::make_shared<SerialState>(partition, options.connection, options.maxUnread);
    mSerials.push_back(state);
    try {
        // Notices before the response are about an earlier session.
        const auto onResponse = [this, state](const QelMessage& response) { pHandleOpened(state, response); };
        const QelMessageVirtualSerialOpenReq request(partition, options.connection, options.force);
        static_cast<void>(require(request, end, onResponse));
        static_cast<void>(require(QelMessageVirtualSerialSetupSessionReq(partition, options.connection), end));
    } catch (...) {
        dropSerial(state);
        throw;
    }
    return state;
}

void ConsoleCore::closeSerial(const std::shared_ptr<SerialState>& state, TimePoint end)
{
    if (state->end != SessionEnd::None) return;
    const auto onResponse = [this, state](const QelMessage& response) {
        if (response.getStatus() != QelMessageStatusNoError) return;
        state->finish(SessionEnd::Closed);
        pForget(*state);
    };
    state->isClosing = true;
    std::unique_ptr<QelMessage> response;
    try {
        const QelMessageVirtualSerialCloseReq request(state->partition, state->connection, false);
        response = exchange(request, end, onResponse);
    } catch (...) {
        state->isClosing = false;
        throw;
    }
    state->isClosing = false;
    // The session may have ended while the request was on its way; its notice then came before the response.
    if (state->end == SessionEnd::None) throw StatusError(*response, mServer);
}

void ConsoleCore::dropSerial(const std::shared_ptr<SerialState>& state) noexcept
{
    if (state->isOpen || state->isHeld) pSendClose(*state);
    state->finish(SessionEnd::Closed);
    pForget(*state);
}

/// The response to the request that opens a session.
void ConsoleCore::pHandleOpened(const std::shared_ptr<SerialState>& state, const QelMessage& response) noexcept
{
    if (response.getStatus() != QelMessageStatusNoError) return;
    if (state->end == SessionEnd::None) {
        state->isOpen = true;
        return;
    }
    // The opening was given up, and the hypervisor holds a session without an owner. Another opening may be on its way.
    for (const auto& serial : mSerials) {
        if (serial->partition != state->partition || serial->connection != state->connection) continue;
        serial->isHeld = true;
        return;
    }
    pSendClose(*state);
}

void ConsoleCore::pEndSerials(SessionEnd reason) noexcept
{
    for (const auto& serial : mSerials)
        serial->finish(reason);
    mSerials.clear();
}

/// Sends the request to close a session if the connection takes it at once. Its response is dropped.
void ConsoleCore::pSendClose(const SerialState& state) noexcept
{
    try {
        if (mLink == nullptr || !mLink->isUsable() || mExchanges.isFull()) return;
        if (!mLink->canTell() || !mLink->await(false, TimeProvider::steady()).send) return;
        const QelMessageVirtualSerialCloseReq request(state.partition, state.connection, false);
        mExchanges.add(request, nullptr);
        pSend(request, deadlineIn(mRequestTimeout));
    } catch (...) {
        logCurrentAt(LogLevel::Debug, "while dropping a session");
    }
}

/// @return whether the notice was for a session
bool ConsoleCore::pHandleSerial(const QelMessage& message)
{
    using DataNotice = QelMessageVirtualSerialDataToDaxAsync;
    using ClosedNotice = QelMessageVirtualSerialSessionClosedAsync;
    if (mSerials.empty() || (!isKind<DataNotice>(message) && !isKind<ClosedNotice>(message))) return false;
    const auto* const data = dynamic_cast<const DataNotice*>(&message);
    const auto* const closed = dynamic_cast<const ClosedNotice*>(&message);
    if (data == nullptr && closed == nullptr) pBreak("malformed notice " + toString(message.getLogID()));
    for (const auto& serial : mSerials) {
        if (data != nullptr && serial->isMeant(*data)) {
            serial->append(data->getSerialData(), data->getSerialDataLength());
            return true;
        }
        if (closed != nullptr && serial->isMeant(*closed)) {
            serial->finish(*closed);
            pForget(*serial);
            return true;
        }
    }
    return false;
}

void ConsoleCore::pForget(const SerialState& state) noexcept
{
    const auto found =
        std::find_if(mSerials.begin(), mSerials.end(), [&](const auto& serial) { return serial.get() == &state; });
    if (found != mSerials.end()) mSerials.erase(found);
}

/// A session that can take no more output; null: there is none.
const SerialState* ConsoleCore::pFullSerial() const noexcept
{
    for (const auto& serial : mSerials) {
        if (serial->isOpen && serial->isFull()) return serial.get();
    }
    return nullptr;
}

} // namespace qel::protocol
