#include "proxy/ReplayRun.hpp"

#include <qel/common/net/SocketStream.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Credentials.hpp>
#include <qel/protocol/Handshake.hpp>
#include <qel/protocol/PeerIdentity.hpp>
#include <qel/protocol/ServerAddress.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Answer.hpp"
#include "base/Failures.hpp"
#include "base/Library.hpp"
#include "proxy/FrameNames.hpp"
#include "proxy/Replay.hpp"

#include <algorithm>
#include <cerrno>
#include <fstream>
#include <iostream>
#include <memory>
#include <utility>

namespace qel::tool {

namespace {

/// Connects, and protects the connection as the options say.
std::unique_ptr<Stream> connectTo(const ReplayPlan& plan)
{
    const auto end = TimeProvider::steady() + plan.transport.handshakeTimeout();
    const ServerAddress server = ServerAddress::parse(plan.server);
    const std::vector<IPEndpoint> endpoints = resolve(server, end);
    const bool isLocal = std::all_of(endpoints.begin(), endpoints.end(),
                                     [](const IPEndpoint& one) { return isLoopback(one.getAddress()); });
    if (plan.transport.plain && !isLocal) throw CommandFailure(ExitStatus::Usage, plainRefusal(plan.server));
    auto socket = std::make_unique<SocketStream>(protocol::connectTo(server, endpoints, end));
    if (plan.transport.plain) return socket;
    const auto context = loadCredentials(plan.transport)->makeClientContext();
    limitTo(*socket, end);
    requestUpgrade(*socket, socket->getSocket().getFd());
    auto tls = std::make_unique<SSLStream>(*context, std::move(socket));
    startTls(*tls);
    checkPeer(identityOf(*tls), plan.transport.pins);
    return tls;
}

void printAnswer(const ReplayAnswer& answer, bool json)
{
    const FrameView frame(answer.recorded.data(), answer.recorded.size());
    const std::string& name = operationName(frame.function(), frame.operation());
    if (json) {
        nlohmann::ordered_json event{{"event", "answer"}, {"number", answer.number}};
        event["function"] = frame.function();
        event["operation"] = frame.operation();
        event["differences"] = answer.differences;
        event["recorded"] = hexDigits(answer.recorded);
        event["live"] = hexDigits(answer.live);
        std::cout << jsonLine(event) << '\n';
        return;
    }
    std::string text;
    for (const std::string& difference : answer.differences)
        text += (text.empty() ? "" : "; ") + difference;
    std::cout << "frame " << answer.number
              << " response op=" << (name.empty() ? std::to_string(frame.operation()) : name) << ": "
              << (text.empty() ? "as recorded" : text) << '\n';
}

void printResult(const ReplayResult& result, bool json)
{
    if (json) {
        const nlohmann::ordered_json event{{"event", "summary"},
                                           {"sent", result.sent},
                                           {"compared", result.compared},
                                           {"different", result.different},
                                           {"recordedNotices", result.recordedNotices},
                                           {"seenNotices", result.seenNotices}};
        std::cout << jsonLine(event) << '\n';
        return;
    }
    std::cout << "sent " << result.sent << ", answers compared " << result.compared << ", different "
              << result.different << "; notices recorded " << result.recordedNotices << ", seen " << result.seenNotices
              << '\n';
}

} // namespace

ExitStatus runReplay(const ReplayPlan& plan)
{
    std::ifstream file(plan.file, std::ios::binary);
    if (!file) {
        const PosixErrorCode error = errno;
        throw FileIOError(error, "cannot open " + plan.file);
    }
    const std::vector<RecordedConnection> connections = readRecording(file);
    ReplayResult total;
    for (const RecordedConnection& connection : connections) {
        const std::unique_ptr<Stream> stream = connectTo(plan);
        Replay replay(*stream, plan.timeout, [&plan](const ReplayAnswer& answer) { printAnswer(answer, plan.json); });
        const ReplayResult result = replay.play(connection);
        total.sent += result.sent;
        total.compared += result.compared;
        total.different += result.different;
        total.recordedNotices += result.recordedNotices;
        total.seenNotices += result.seenNotices;
    }
    printResult(total, plan.json);
    return total.different == 0 ? ExitStatus::Done : ExitStatus::Refused;
}

} // namespace qel::tool
