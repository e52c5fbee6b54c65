#include "transport/Handshake.hpp"

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "base/Failures.hpp"

#include <algorithm>
#include <cstring>
#include <memory>
#include <string>
#include <sys/socket.h>

namespace qel::tool {

namespace {

constexpr std::chrono::milliseconds kShortestWait(1);

template <typename T>
bool is(const QelMessage& message)
{
    return dynamic_cast<const T*>(&message) != nullptr;
}

[[noreturn]] void breakOff(const std::string& reason) { throw CommandFailure(ExitStatus::ProtocolBroken, reason); }

/// Does a step in the clear; what goes wrong is told in its terms.
/// @param step  what the other end does in it, for "the other end did not ..."
template <typename F>
auto doStep(const std::string& step, F work)
{
    try {
        return work();
    } catch (const QelMessageValidationException& error) {
        breakOff("the other end did not " + step + " but sent something else: " + error.what());
    } catch (const StreamIOException& error) {
        const ExitStatus status = exitStatusOf(error);
        if (status == ExitStatus::DeadlinePassed)
            throw CommandFailure(status, "the other end did not " + step + " in time");
        throw CommandFailure(status, "the other end did not " + step + " but ended the connection: " + explain(error));
    }
}

/// Reads one message, and not a byte beyond it.
std::unique_ptr<QelMessage> receive(Stream& stream)
{
    return QelMessageStream(stream, QelInternalMessageRegistry::getInstance()).read();
}

void send(Stream& stream, const QelMessage& message)
{
    QelMessageStream(stream, QelInternalMessageRegistry::getInstance()).write(message);
}

/// It is this end's turn. Whatever the other end has sent all the same was sent in the clear by nobody knows whom, and
/// would be the beginning of what TLS reads.
void expectSilence(int descriptor)
{
    char byte = 0;
    if (::recv(descriptor, &byte, sizeof(byte), MSG_PEEK | MSG_DONTWAIT) > 0) {
        breakOff("the other end did not wait for its turn in the handshake");
    }
}

/// Why a TLS handshake failed, as far as it can be known.
[[noreturn]] void explainTlsFailure(const SSLStream& stream, const StreamIOException& error)
{
    const std::string refusal = stream.getVerificationFailure();
    if (!refusal.empty()) {
        throw CommandFailure(ExitStatus::Refused, "the other end has no valid certificate of our root: " + refusal);
    }
    const ExitStatus status = exitStatusOf(error);
    if (status == ExitStatus::DeadlinePassed) {
        throw CommandFailure(status, "the TLS handshake was not done in time");
    }
    if (std::strncmp(error.what(), "SSL error", std::strlen("SSL error")) == 0) {
        breakOff(std::string("the TLS handshake failed: ") + error.what());
    }
    throw CommandFailure(status, "the other end ended the connection in the TLS handshake, perhaps because it does not "
                                 "accept this end's certificate: " +
                                     explain(error));
}

} // namespace

void limitTo(Stream& stream, std::chrono::steady_clock::time_point end)
{
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(end - TimeProvider::steady());
    stream.setReadDeadline(std::max(left, kShortestWait));
    stream.setWriteDeadline(std::max(left, kShortestWait));
}

void requestUpgrade(Stream& stream, int descriptor)
{
    const auto answer = doStep("answer the request for TLS", [&] {
        send(stream, QelMessageUpgradeConnectionAsync());
        return receive(stream);
    });
    if (is<QelMessageAbortHandshakeAsync>(*answer)) {
        throw CommandFailure(ExitStatus::Refused, "the hypervisor end turned this console away: it takes no more "
                                                  "consoles, is about to stop, or does without TLS");
    }
    if (!is<QelMessageUpgradeConnectionAsync>(*answer)) {
        breakOff("the other end did not answer the request for TLS but sent something else: " +
                 toString(answer->getLogID()));
    }
    expectSilence(descriptor);
}

void awaitUpgrade(Stream& stream, int descriptor)
{
    const auto request = doStep("ask for TLS", [&] { return receive(stream); });
    if (!is<QelMessageUpgradeConnectionAsync>(*request)) {
        abortHandshake(stream);
        breakOff("the other end did not ask for TLS but sent something else: " + toString(request->getLogID()));
    }
    expectSilence(descriptor);
}

void grantUpgrade(Stream& stream)
{
    doStep("take the answer to its request for TLS", [&] { send(stream, QelMessageUpgradeConnectionAsync()); });
}

void abortHandshake(Stream& stream)
{
    doStep("take the answer to its request for TLS", [&] { send(stream, QelMessageAbortHandshakeAsync()); });
}

void startTls(SSLStream& stream)
{
    try {
        stream.handshake();
    } catch (const StreamIOException& error) {
        explainTlsFailure(stream, error);
    }
}

} // namespace qel::tool
