#include "support/TlsKit.hpp"

#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/net/SocketStream.hpp>
#include <qel/common/security/SSLCertificateRequest.hpp>
#include <qel/common/security/SSLException.hpp>

#include "support/Authority.hpp"
#include "support/Loopback.hpp"
#include "support/MemoryStreamPair.hpp"

#include <array>
#include <chrono>
#include <exception>
#include <gtest/gtest.h>
#include <map>
#include <mutex>
#include <openssl/err.h>
#include <sys/syscall.h>
#include <thread>
#include <unistd.h>
#include <utility>

namespace qel::test {

namespace {

constexpr std::chrono::seconds kPatience{60};

SSLCredentials issue(const SSLCertificateRequest& request, std::chrono::hours from, std::chrono::hours to)
{
    const auto now = SSLValidityPeriod::Clock::now();
    const Authority& authority = Authority::trusted();
    return authority.credentialsOf(authority.issue(request, SSLValidityPeriod(now + from, now + to)));
}

SSLCredentials makeCredentials(Identity identity)
{
    using std::chrono::hours;
    const Authority& authority = Authority::trusted();
    switch (identity) {
    case Identity::Client:
        return authority.clientCredentials();
    case Identity::Server:
        return authority.serverCredentials();
    case Identity::Expired:
        return issue(authority.serverRequest(), hours(-72), hours(-24));
    case Identity::NotYetValid:
        return issue(authority.serverRequest(), hours(24), hours(72));
    case Identity::OtherRoot:
        // Whom it trusts is not what is wrong with it.
        return SSLCredentials{Authority::stranger().client().getPEM(),
                              Authority::stranger().client().getPrivateKey()->getPEM(), authority.root().getPEM()};
    case Identity::WithSubjectOfRoot:
        return issue(SSLCertificateRequest(authority.root().getSubject()), hours(-24), hours(24));
    case Identity::WithKeyOfAnother:
        return SSLCredentials{authority.client().getPEM(), authority.server().getPrivateKey()->getPEM(),
                              authority.root().getPEM()};
    case Identity::Stranger:
        return Authority::stranger().clientCredentials();
    }
    throw std::logic_error("no such identity");
}

template <typename Context>
Context& contextOf(Identity identity)
{
    static std::mutex mutex;
    static std::map<Identity, Context> contexts; // guarded by mutex; grows only, and its elements stay where they are
    const std::lock_guard<std::mutex> lock(mutex);
    const auto found = contexts.find(identity);
    if (found != contexts.end()) return found->second;
    Context& context = contexts[identity];
    if (identity == Identity::WithKeyOfAnother) {
        EXPECT_THROW(context.setCredentials(credentialsOf(identity)), SSLException);
    } else {
        context.setCredentials(credentialsOf(identity));
    }
    return context;
}

bool startsWith(const std::string& text, const std::string& start) { return text.compare(0, start.size(), start) == 0; }

/// "[2026-03-01 17:04:09] (4711:4719) (E): text" becomes "E: text" for thread 4719, and nothing for another.
std::string lineOfThread(const std::string& line, pid_t thread)
{
    const std::string id = ":" + std::to_string(thread) + ") (";
    const std::size_t at = line.find(id);
    const std::size_t endOfTime = line.find(']');
    if (at == std::string::npos || endOfTime == std::string::npos || line.find(")", endOfTime) != at + id.size() - 3) {
        return {};
    }
    const std::size_t level = at + id.size();
    return line.substr(level, 1) + ": " + line.substr(level + 4);
}

pid_t currentThread() { return static_cast<pid_t>(::syscall(SYS_gettid)); }

} // namespace

const SSLCredentials& credentialsOf(Identity identity)
{
    static std::mutex mutex;
    static std::map<Identity, SSLCredentials> made; // guarded by mutex; grows only
    const std::lock_guard<std::mutex> lock(mutex);
    const auto found = made.find(identity);
    if (found != made.end()) return found->second;
    return made.emplace(identity, makeCredentials(identity)).first->second;
}

SSLClientContext& clientContext(Identity identity) { return contextOf<SSLClientContext>(identity); }

SSLServerContext& serverContext(Identity identity) { return contextOf<SSLServerContext>(identity); }

StreamPair connectStreams(Transport transport)
{
    StreamPair pair;
    if (transport == Transport::Memory) {
        MemoryStreamPair memory;
        pair = {memory.takeClient(), memory.takeServer()};
    } else {
        TcpPair tcp = makeTcpPair();
        pair = {std::make_unique<SocketStream>(std::move(tcp.client)),
                std::make_unique<SocketStream>(std::move(tcp.server))};
    }
    for (Stream* stream : {pair.client.get(), pair.server.get()}) {
        stream->setReadDeadline(kPatience);
        stream->setWriteDeadline(kPatience);
    }
    return pair;
}

std::string failureOf(const std::function<void()>& work)
{
    std::string failure;
    try {
        work();
    } catch (const StreamIOException& exception) {
        failure = std::string("StreamIOException: ") + exception.what();
    } catch (const SSLException& exception) {
        failure = std::string("SSLException: ") + exception.what();
    } catch (const std::exception& exception) {
        failure = std::string("std::exception: ") + exception.what();
    } catch (...) {
        failure = "something else";
    }
    expectEmptyErrorQueue();
    return failure;
}

Outcomes runEnds(const CapturedLog& log, const std::function<void()>& client, const std::function<void()>& server)
{
    Outcomes outcomes;
    pid_t serverThread = 0;
    pid_t clientThread = 0;
    std::thread serverEnd([&] {
        serverThread = currentThread();
        outcomes.server.failure = failureOf(server);
    });
    std::thread clientEnd([&] {
        clientThread = currentThread();
        outcomes.client.failure = failureOf(client);
    });
    serverEnd.join();
    clientEnd.join();
    outcomes.client.log = linesOfThread(log, clientThread);
    outcomes.server.log = linesOfThread(log, serverThread);
    return outcomes;
}

Outcome runHere(const CapturedLog& log, const std::function<void()>& work)
{
    const std::size_t before = linesOfThread(log, currentThread()).size();
    Outcome outcome;
    outcome.failure = failureOf(work);
    outcome.log = linesOfThread(log, currentThread());
    outcome.log.erase(outcome.log.begin(), outcome.log.begin() + static_cast<std::ptrdiff_t>(before));
    return outcome;
}

std::vector<std::string> linesOfThread(const CapturedLog& log, pid_t thread)
{
    const std::string opaque = "E: [libssl]";
    std::vector<std::string> lines;
    for (const std::string& raw : log.rawLines()) {
        std::string line = lineOfThread(raw, thread);
        if (line.empty() || startsWith(line.substr(3), "socket stream ")) continue;
        if (startsWith(line, opaque)) {
            if (!lines.empty() && lines.back() == opaque) continue;
            line = opaque;
        }
        lines.push_back(std::move(line));
    }
    return lines;
}

void expectEmptyErrorQueue()
{
    std::array<char, 256> text{};
    while (const unsigned long code = ERR_get_error()) {
        ERR_error_string_n(code, text.data(), text.size());
        ADD_FAILURE() << "left in the error queue: " << text.data();
    }
}

Outcomes TlsTest::shakeHands(SSLStream& client, SSLStream& server)
{
    return runEnds(
        mLog, [&client] { client.handshake(); }, [&server] { server.handshake(); });
}

void TlsTest::encrypt(SSLStream& client, SSLStream& server)
{
    const Outcomes outcomes = shakeHands(client, server);
    ASSERT_EQ(outcomes.client.failure, "");
    ASSERT_EQ(outcomes.server.failure, "");
    ASSERT_EQ(client.getStatus(), SSLStream::STATUS_ENCRYPTED);
    ASSERT_EQ(server.getStatus(), SSLStream::STATUS_ENCRYPTED);
    mLog.clear();
}

std::vector<std::string> handshakeLines()
{
    return {"D: SSLStream: protocol init SSL handshake portion complete", "D: SSL stream encrypted 1 byte(s) of data",
            "D: SSLStream: protocol init write complete", "D: SSL stream decrypted 1 byte(s) of data",
            "I: SSLStream protocol init complete: TLSv1.3 TLS_AES_256_GCM_SHA384"};
}

std::string encryptedLine(std::size_t length)
{
    return "D: SSL stream encrypted " + std::to_string(length) + " byte(s) of data";
}

std::string decryptedLine(std::size_t length)
{
    return "D: SSL stream decrypted " + std::to_string(length) + " byte(s) of data";
}

std::string pattern(std::size_t length)
{
    std::string data(length, '\0');
    for (std::size_t i = 0; i < length; ++i)
        data[i] = static_cast<char>((i * 7 + i / 251) & 0xFF);
    return data;
}

void writeText(Stream& stream, const std::string& data) { stream.write(data.data(), data.size()); }

std::string readSome(Stream& stream, std::size_t length)
{
    std::string data(length, '?');
    data.resize(stream.read(&data[0], length));
    return data;
}

std::string readExactly(Stream& stream, std::size_t length)
{
    std::string data(length, '?');
    stream.fill(&data[0], length);
    return data;
}

} // namespace qel::test
