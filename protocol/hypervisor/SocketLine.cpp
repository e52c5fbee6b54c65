#include "hypervisor/SocketLine.hpp"

#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include <cerrno>
#include <cstring>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <stdexcept>
#include <sys/un.h>
#include <system_error>
#include <utility>

namespace qel::protocol {

namespace {

constexpr const char* kClosed = "the peer has closed the connection";
constexpr const char* kTimedOut = "timed out";

std::string describe(int error) { return std::system_category().message(error); }

bool isTransient(int error) { return error == EAGAIN || error == EINTR; }

SocketAddress addressOf(const IPEndpoint& endpoint)
{
    const sockaddr_storage storage = endpoint.getSockaddr();
    return {storage, storage.ss_family == AF_INET ? socklen_t(sizeof(sockaddr_in)) : socklen_t(sizeof(sockaddr_in6))};
}

std::optional<IPEndpoint> numericEndpoint(const ServerAddress& server)
{
    try {
        return IPEndpoint(server.str());
    } catch (const std::exception&) {
        return std::nullopt;
    }
}

void set(int fd, int level, int name, int value)
{
    // A socket that has broken meanwhile may refuse; reading it says so in a moment.
    static_cast<void>(::setsockopt(fd, level, name, &value, sizeof(value)));
}

/// Sends key strokes at once, and finds out in about a minute that a peer is gone: by probes while nothing is under
/// way, and by a limit for what the peer does not acknowledge, during which the system sends no probes.
void tune(int fd)
{
    constexpr int kUnacknowledgedMilliseconds = 60000;
    constexpr int kIdleSeconds = 30;
    constexpr int kProbeSeconds = 5;
    constexpr int kProbes = 6;
    set(fd, IPPROTO_TCP, TCP_NODELAY, 1);
    set(fd, SOL_SOCKET, SO_KEEPALIVE, 1);
    set(fd, IPPROTO_TCP, TCP_KEEPIDLE, kIdleSeconds);
    set(fd, IPPROTO_TCP, TCP_KEEPINTVL, kProbeSeconds);
    set(fd, IPPROTO_TCP, TCP_KEEPCNT, kProbes);
    set(fd, IPPROTO_TCP, TCP_USER_TIMEOUT, kUnacknowledgedMilliseconds);
}

} // namespace

SocketAddress unixAddress(const std::string& path)
{
    sockaddr_un address{};
    if (path.empty()) throw std::invalid_argument("path: it is empty");
    if (path.find('\0') != std::string::npos) throw std::invalid_argument("path: it contains a null character");
    const std::size_t longest = sizeof(address.sun_path) - 1;
    if (path.size() > longest) {
        throw std::invalid_argument("path: it is longer than " + std::to_string(longest) + " bytes");
    }
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, path.data(), path.size());
    SocketAddress result{};
    std::memcpy(&result.storage, &address, sizeof(address));
    result.length = sizeof(address);
    return result;
}

bool isSelfConnected(int fd)
{
    sockaddr_storage own{};
    sockaddr_storage peer{};
    socklen_t ownLength = sizeof(own);
    socklen_t peerLength = sizeof(peer);
    if (::getsockname(fd, reinterpret_cast<sockaddr*>(&own), &ownLength) != 0) return false;
    if (::getpeername(fd, reinterpret_cast<sockaddr*>(&peer), &peerLength) != 0) return false;
    if (own.ss_family != AF_INET && own.ss_family != AF_INET6) return false;
    return IPEndpoint(own) == IPEndpoint(peer);
}

SocketLine::SocketLine(std::string name, std::vector<SocketAddress> addresses, Limits limits)
    : mName(std::move(name)), mLimits(limits), mAddresses(std::move(addresses))
{}

SocketLine::SocketLine(ServerAddress server, BackgroundLookup::Resolver resolver, Limits limits)
    : mName(server.str()), mServer(std::move(server)), mResolver(std::move(resolver)), mLimits(limits)
{}

SocketLine::~SocketLine() = default;

void SocketLine::start(std::uint16_t /*partition*/)
{
    if (mState != State::Down && mState != State::Ended) return;
    stop();
    mNext = 0;
    if (!mServer) {
        mState = State::Connecting;
        return;
    }
    if (!mLookup) mLookup.emplace(mServer->getHost(), mServer->getPort(), mResolver);
    mDeadline = TimeProvider::steady() + mLimits.lookup;
    mState = State::LookingUp;
}

void SocketLine::stop()
{
    mSocket.reset();
    mDeadline = PollDeadline();
    mReason.clear();
    mState = State::Down;
}

bool SocketLine::advance()
{
    if (mState == State::LookingUp) pCheckLookup();
    if (mState == State::Connecting) pCheckConnecting();
    return mState == State::Up || mState == State::Ended;
}

bool SocketLine::wantsToWrite() const { return mState == State::Connecting; }

PollDeadline SocketLine::advanceAt() const { return mDeadline; }

SerialLine::ReadResult SocketLine::read(char* buffer, std::size_t length)
{
    const ssize_t count = ::recv(mSocket.get(), buffer, length, 0);
    const int error = errno;
    if (count > 0) return {LineState::Data, static_cast<std::size_t>(count)};
    if (count < 0 && isTransient(error)) return {LineState::Idle, 0};
    if (mReason.empty()) mReason = count == 0 ? kClosed : describe(error);
    mState = State::Ended;
    return {LineState::Ended, 0};
}

std::size_t SocketLine::write(const char* data, std::size_t length)
{
    const ssize_t count = ::send(mSocket.get(), data, length, MSG_NOSIGNAL);
    const int error = errno;
    if (count >= 0) return static_cast<std::size_t>(count);
    if (isTransient(error)) return 0;
    // Not an exception: what the peer has sent before must be read first, and reading ends the line. The socket may go
    // on being writable without a hang-up, so it would never take the bytes and never say so: they are dropped, and it
    // is shut down, which makes reading reach the end.
    if (mReason.empty()) mReason = error == EPIPE ? kClosed : describe(error);
    static_cast<void>(::shutdown(mSocket.get(), SHUT_RDWR)); // refused when the peer has reset the connection
    return length;
}

int SocketLine::descriptor() const
{
    if (mState != State::LookingUp) return mSocket.get();
    return mLookup ? mLookup->descriptor() : -1;
}

std::string SocketLine::endReason() const { return mReason; }

void SocketLine::pCheckLookup()
{
    const std::string attempt = "cannot resolve the name " + mServer->getHost();
    const std::optional<LookupResult> result = mLookup->result();
    if (!result) {
        if (mDeadline.isExpired(TimeProvider::steady())) pFail(attempt, kTimedOut);
        return;
    }
    std::vector<SocketAddress> addresses;
    addresses.reserve(result->endpoints.size());
    for (const IPEndpoint& endpoint : result->endpoints)
        addresses.push_back(addressOf(endpoint));
    mAddresses.swap(addresses);
    mLookup.reset(); // last: without memory for the addresses its answer is asked for again
    if (mAddresses.empty()) pFail(attempt, result->error.empty() ? "it has no address" : result->error);
    mState = State::Connecting;
}

void SocketLine::pCheckConnecting()
{
    if (mSocket.get() < 0) return pConnectNext();
    if (!PollSet(PollFd(mSocket.get(), PollEvents::Write)).poll().anyReady()) {
        if (!mDeadline.isExpired(TimeProvider::steady())) return;
        mReason = kTimedOut;
        return pConnectNext();
    }
    int error = 0;
    socklen_t length = sizeof(error);
    if (::getsockopt(mSocket.get(), SOL_SOCKET, SO_ERROR, &error, &length) != 0) error = errno;
    if (error == 0 && isSelfConnected(mSocket.get())) error = ECONNREFUSED;
    if (error == 0) return pUp();
    mReason = describe(error);
    pConnectNext();
}

/// Begins to connect to the next address that does not fail at once.
void SocketLine::pConnectNext()
{
    while (mNext < mAddresses.size()) {
        if (pBeginConnect(mAddresses[mNext++])) return;
    }
    pFail("cannot connect to " + mName, mReason);
}

/// @return false: it failed at once, and the reason is noted
bool SocketLine::pBeginConnect(const SocketAddress& address)
{
    mSocket = UniqueFd(::socket(address.storage.ss_family, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    int error = errno;
    if (mSocket.get() >= 0) {
        if (::connect(mSocket.get(), reinterpret_cast<const sockaddr*>(&address.storage), address.length) == 0) {
            pUp();
            return true;
        }
        error = errno;
        if (error == EINPROGRESS) {
            mDeadline = TimeProvider::steady() + mLimits.connect / static_cast<int>(mAddresses.size());
            return true;
        }
    }
    mReason = error == EAGAIN ? "too many connections wait for the peer" : describe(error); // EAGAIN: see unix(7)
    return false;
}

void SocketLine::pUp()
{
    sockaddr_storage own{};
    socklen_t length = sizeof(own);
    const int result = ::getsockname(mSocket.get(), reinterpret_cast<sockaddr*>(&own), &length);
    if (result == 0 && own.ss_family != AF_UNIX) tune(mSocket.get());
    mReason.clear();
    mDeadline = PollDeadline();
    mState = State::Up;
}

void SocketLine::pFail(const std::string& attempt, const std::string& reason)
{
    mReason = attempt + ": " + reason;
    mDeadline = PollDeadline();
    mState = State::Ended;
    throw std::runtime_error(mReason);
}

std::unique_ptr<SerialLine> unixLine(const std::string& path)
{
    return std::make_unique<SocketLine>(path, std::vector<SocketAddress>{unixAddress(path)}, SocketLine::Limits());
}

std::unique_ptr<SerialLine> tcpLine(const std::string& address)
{
    const ServerAddress server = ServerAddress::parse(address);
    const std::optional<IPEndpoint> endpoint = numericEndpoint(server);
    if (!endpoint) return std::make_unique<SocketLine>(server, askResolver, SocketLine::Limits());
    return std::make_unique<SocketLine>(server.str(), std::vector<SocketAddress>{addressOf(*endpoint)},
                                        SocketLine::Limits());
}

} // namespace qel::protocol
