#include "check/Trial.hpp"

#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/net/SocketStream.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Handshake.hpp>
#include <qel/protocol/PeerIdentity.hpp>

#include "base/Failures.hpp"

#include <exception>
#include <random>
#include <utility>

namespace qel::tool::check {

namespace {

/// A need, how to see whether it is met, and what is missing if not.
struct NeedRow {
    Need need;
    bool (*isMet)(const Target&);
    const char* missing;
};

constexpr NeedRow kNeeds[] = {
    {kTls, [](const Target& target) { return target.isProtected(); }, "needs TLS"},
    {kPlain, [](const Target& target) { return !target.isProtected(); }, "needs --plain"},
    {kPartition, [](const Target& target) { return target.partition.has_value(); }, "needs --partition"},
    {kEchoPartition, [](const Target& target) { return target.echoPartition.has_value(); }, "needs --echo-partition"},
    {kEndingPartition, [](const Target& target) { return target.endingPartition.has_value(); },
     "needs --ending-partition"},
    {kDeadline, [](const Target& target) { return target.deadline.has_value(); }, "needs --peer-deadline"},
};

} // namespace

Target::Target(ServerAddress server) : address(std::move(server))
{
    std::random_device random;
    run = static_cast<std::uint64_t>(random()) << 32U | random();
}

std::string missingFor(const Case& aCase, const Target& target)
{
    for (const NeedRow& row : kNeeds) {
        if ((aCase.needs & row.need) != 0 && !row.isMet(target)) return row.missing;
    }
    return {};
}

Trial::Trial(const Target& target, unsigned int number)
    : mTarget(target), mPrefix(target.toolIdPrefix + "-" + std::to_string(number) + "-")
{}

Trial::~Trial() = default;

Wire& Trial::connectTcp()
{
    int descriptor = -1;
    auto stream = pOpen(descriptor);
    return pAdd(std::move(stream), descriptor);
}

Wire& Trial::connect()
{
    if (!mTarget.isProtected()) return connectTcp();
    int descriptor = -1;
    auto stream = upgraded(descriptor);
    return protect(std::move(stream), descriptor, *mTarget.context);
}

Wire& Trial::protect(std::unique_ptr<Stream> stream, int descriptor, SSLClientContext& context)
{
    auto tls = std::make_unique<SSLStream>(context, std::move(stream));
    limitTo(*tls, TimeProvider::steady() + mTarget.timeout);
    try {
        startTls(*tls);
        checkPeer(identityOf(*tls), mTarget.pins);
    } catch (const Error& error) {
        throw Failure("a TLS handshake", error.what());
    }
    return pAdd(std::move(tls), descriptor);
}

std::unique_ptr<Stream> Trial::upgraded(int& descriptor)
{
    auto stream = pOpen(descriptor);
    limitTo(*stream, TimeProvider::steady() + mTarget.timeout);
    try {
        requestUpgrade(*stream, descriptor);
    } catch (const Error& error) {
        throw Failure("the request for TLS to be granted", error.what());
    }
    return stream;
}

Wire& Trial::console()
{
    Wire& wire = connect();
    wire.expectStatus(versionRequest(toolType(), newToolId()), 0);
    return wire;
}

Wire& Trial::session()
{
    Wire& wire = console();
    wire.expectStatus(openSession(), 0);
    return wire;
}

Wire& Trial::serial(std::uint16_t partition, unsigned int number)
{
    Wire& wire = session();
    wire.expectStatus(openSerial(partition, number), 0);
    return wire;
}

std::string Trial::newToolId()
{
    mToolId = mPrefix + std::to_string(++mTools);
    return mToolId;
}

std::string Trial::newText()
{
    return "<" + mPrefix + std::to_string(mTarget.run) + "-" + std::to_string(++mTexts) + ">";
}

void Trial::atEnd(std::function<void()> work) { mAtEnd.push_back(std::move(work)); }

void Trial::require(bool condition, const std::string& expected, const std::string& seen)
{
    if (!condition) throw Failure(expected, seen);
}

void Trial::requireEqual(const std::string& what, std::uint32_t expected, std::uint32_t seen)
{
    require(expected == seen, what + " " + std::to_string(expected), std::to_string(seen));
}

std::string Trial::finish() noexcept
{
    std::string failure;
    for (auto work = mAtEnd.rbegin(); work != mAtEnd.rend(); ++work) {
        try {
            (*work)();
        } catch (const std::exception& error) {
            failure = error.what();
        }
    }
    mAtEnd.clear();
    for (Wire& wire : mWires)
        wire.beginLeaving();
    for (Wire& wire : mWires)
        wire.leave();
    return failure;
}

std::unique_ptr<Stream> Trial::pOpen(int& descriptor)
{
    try {
        Socket socket = connectTo(mTarget.address, mTarget.endpoints, TimeProvider::steady() + mTarget.timeout);
        auto stream = std::make_unique<SocketStream>(std::move(socket));
        descriptor = stream->getSocket().getFd();
        return stream;
    } catch (const CannotConnect& error) {
        throw Failure("a connection", error.what());
    }
}

Wire& Trial::pAdd(std::unique_ptr<Stream> stream, int descriptor)
{
    Wire::Options options;
    options.number = static_cast<unsigned int>(mWires.size() + 1);
    options.timeout = mTarget.timeout;
    options.toolIdPrefix = mPrefix;
    return mWires.emplace_back(std::move(stream), descriptor, std::move(options), mTranscript);
}

} // namespace qel::tool::check
