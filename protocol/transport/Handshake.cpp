#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Handshake.hpp>

#include "base/MessageKind.hpp"
#include "base/StreamFailure.hpp"
#include "base/TimeLeft.hpp"
#include "transport/TlsAlert.hpp"

#include <cstring>
#include <memory>
#include <string>
#include <sys/socket.h>

namespace qel::protocol {

namespace {

[[noreturn]] void breakOff(const std::string& reason) { throw ProtocolBroken(reason); }

/// Performs a step before TLS and puts what fails in terms of that step.
/// @param step  what the peer does in it, for "the peer did not ..."
template <typename F>
auto doStep(const std::string& step, F work)
{
    try {
        return work();
    } catch (const QelMessageValidationException& error) {
        breakOff("the peer did not " + step + " but sent something else: " + error.what());
    } catch (const StreamIOException& error) {
        if (isDeadline(error)) std::throw_with_nested(DeadlinePassed("the peer did not " + step + " in time"));
        std::throw_with_nested(
            ClosedByPeer("the peer did not " + step + " but ended the connection: " + explain(error)));
    }
}

/// Reads one message and no byte after it.
std::unique_ptr<QelMessage> receive(Stream& stream)
{
    return QelMessageStream(stream, QelInternalMessageRegistry::getInstance()).read();
}

void send(Stream& stream, const QelMessage& message)
{
    QelMessageStream(stream, QelInternalMessageRegistry::getInstance()).write(message);
}

/// Called while the peer must wait for this end. Bytes that it has sent anyway came in the clear, from an unknown
/// sender, and TLS would read them first.
void expectSilence(int descriptor)
{
    if (descriptor < 0) return; // a stream of the caller's own: TLS refuses what is not TLS
    char byte = 0;
    if (::recv(descriptor, &byte, sizeof(byte), MSG_PEEK | MSG_DONTWAIT) > 0) {
        breakOff("the peer sent data too early in the handshake");
    }
}

/// Explains why a TLS handshake failed, as far as this end can know.
[[noreturn]] void explainTlsFailure(const SSLStream& stream, const StreamIOException& error)
{
    const std::string refusal = stream.getVerificationFailure();
    if (!refusal.empty()) {
        throw CertificateRejected(CertificateRejected::Reason::TheirsByUs,
                                  "the peer's certificate is refused: " + refusal);
    }
    const std::string alert = certificateAlert(stream);
    if (!alert.empty()) {
        throw CertificateRejected(CertificateRejected::Reason::OursByThem,
                                  "the peer refuses this end's certificate: " + alert);
    }
    if (isDeadline(error)) std::throw_with_nested(DeadlinePassed("the TLS handshake did not finish in time"));
    if (std::strncmp(error.what(), "SSL error", std::strlen("SSL error")) == 0) {
        breakOff(std::string("the TLS handshake failed: ") + error.what());
    }
    // A peer that uses an SSLStream sends no alert when it refuses a certificate. This end then sees what it would see
    // if the peer had crashed.
    std::throw_with_nested(ClosedByPeer(
        "the peer closed the connection in the TLS handshake, perhaps because it refuses this end's certificate: " +
        explain(error)));
}

} // namespace

void limitTo(Stream& stream, std::chrono::steady_clock::time_point end)
{
    const std::chrono::milliseconds left = timeToTry(end);
    stream.setReadDeadline(left);
    stream.setWriteDeadline(left);
}

void requestUpgrade(Stream& stream, int descriptor)
{
    const auto answer = doStep("answer the request for TLS", [&] {
        send(stream, QelMessageUpgradeConnectionAsync());
        return receive(stream);
    });
    if (isKind<QelMessageAbortHandshakeAsync>(*answer)) {
        throw TurnedAway(
            "the server refused this console: it admits no more consoles, is stopping, or does not use TLS");
    }
    if (!isKind<QelMessageUpgradeConnectionAsync>(*answer)) {
        breakOff("the peer did not answer the request for TLS but sent something else: " +
                 toString(answer->getLogID()));
    }
    expectSilence(descriptor);
}

void awaitUpgrade(Stream& stream, int descriptor)
{
    const auto request = doStep("ask for TLS", [&] { return receive(stream); });
    if (!isKind<QelMessageUpgradeConnectionAsync>(*request)) {
        abortHandshake(stream);
        breakOff("the peer did not ask for TLS but sent something else: " + toString(request->getLogID()));
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

} // namespace qel::protocol
