#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/ConsoleOptions.hpp>
#include <qel/protocol/Credentials.hpp>
#include <qel/protocol/Handshake.hpp>
#include <qel/protocol/MessageRegistry.hpp>

#include "Contest.hpp"
#include "Loopback.hpp"
#include "TlsEnds.hpp"

#include <exception>
#include <memory>
#include <stdexcept>
#include <thread>
#include <utility>

/// @file
/// What a console adds to the two messages of a request: the class of the response, the match by caller id, the
/// deadlines. Both contestants talk to the same hypervisor end on a thread of its own, on the same core.

namespace qel::bench {

namespace {

using Request = QelMessageGetGlobalModeAttributeReq;
using Response = QelMessageGetGlobalModeAttributeRsp;

/// Answers the version request and the requests of this contest until the console has gone.
class AnsweringEnd {
public:
    explicit AnsweringEnd(std::unique_ptr<SocketStream> stream)
        : mThread([stream = std::move(stream)]() mutable {
              try {
                  serve(std::move(stream));
              } catch (const std::exception&) { // the console has gone
              }
          })
    {}
    ~AnsweringEnd() { mThread.join(); }
    AnsweringEnd(const AnsweringEnd&) = delete;
    AnsweringEnd& operator=(const AnsweringEnd&) = delete;

private:
    static void serve(std::unique_ptr<SocketStream> stream)
    {
        const int descriptor = stream->getSocket().getFd();
        protocol::awaitUpgrade(*stream, descriptor);
        protocol::grantUpgrade(*stream);
        const auto context = protocol::Credentials::fromTexts(serverCredentials()).makeServerContext();
        SSLStream tls(*context, std::move(stream));
        tls.handshake();
        QelMessageStream messages(tls, protocol::messageRegistry());
        for (;;) {
            const auto request = messages.read();
            const unsigned int id = request->getCallerId();
            if (dynamic_cast<const Request*>(request.get()) != nullptr) {
                messages.write(Response(id, 1, "type*serial"));
            } else {
                messages.write(QelMessageGetEnclTypeAndInterfaceVersionRsp(id, 'Q', 1, 0, "type", "serial"));
            }
        }
    }

    std::thread mThread;
};

void typed(benchmark::State& state)
{
    TcpPair pair;
    const AnsweringEnd end(std::move(pair.far));
    protocol::ConsoleOptions options("loopback:1");
    options.credentials = protocol::Credentials::fromTexts(clientCredentials());
    protocol::Console console(std::move(pair.near), options);
    for (auto _ : state) {
        const auto response = console.request(Request());
        benchmark::DoNotOptimize(response->getMode());
    }
}

void byHand(benchmark::State& state)
{
    TcpPair pair;
    const AnsweringEnd end(std::move(pair.far));
    protocol::requestUpgrade(*pair.near, pair.nearFd());
    const auto context = protocol::Credentials::fromTexts(clientCredentials()).makeClientContext();
    SSLStream tls(*context, std::move(pair.near));
    tls.handshake();
    QelMessageStream messages(tls, protocol::messageRegistry());
    for (auto _ : state) {
        messages.write(Request());
        std::unique_ptr<QelMessage> message = messages.read();
        message->checkStatus();
        const auto response = qelMessageCast<Response>(message);
        benchmark::DoNotOptimize(response->getMode());
    }
    tls.close();
}

} // namespace

void addConsoleContests()
{
    contest("console: typed request and response over TLS")
        .ours(typed)
        .floor("the same two messages by hand", 1.05, byHand);
}

} // namespace qel::bench
