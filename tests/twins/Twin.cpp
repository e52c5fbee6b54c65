#include "twins/Twin.hpp"

#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/net/Listen.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Handshake.hpp>

#include "check/Messages.hpp"

#include <array>
#include <exception>
#include <sys/socket.h>

namespace qel::test {

namespace {

using tool::check::Draft;
using tool::check::kAbort;
using tool::check::kHandshake;
using tool::check::kUpgrade;

constexpr std::size_t kPrefix = 8;
constexpr std::size_t kMaxFrame = 16384;
constexpr std::chrono::milliseconds kIdle{200};
constexpr std::chrono::seconds kTime{10}; // more than any case waits

/// The length of the first frame; 0: its beginning has not come yet, or it is malformed.
std::size_t frameLength(const std::string& bytes)
{
    if (bytes.size() < kPrefix) return 0;
    const std::size_t length = TwinFrame(bytes.substr(0, kPrefix)).number(4, 4);
    return length > kPrefix && length <= kMaxFrame ? length : 0;
}

/// Takes what has come. @return false: the stream has ended
bool readSome(Stream& stream, std::string& bytes)
{
    std::array<char, 65536> buffer; // NOLINT(cppcoreguidelines-pro-type-member-init): only read bytes are used
    try {
        const std::size_t count = stream.read(buffer.data(), buffer.size());
        bytes.append(buffer.data(), count);
        return count > 0;
    } catch (const StreamIOException&) {
        return false;
    }
}

void writeAll(Stream& stream, const std::string& bytes)
{
    try {
        stream.write(bytes.data(), bytes.size());
    } catch (const StreamIOException&) { // NOLINT(bugprone-empty-catch): the reading side sees the end
    }
}

} // namespace

unsigned int TwinFrame::number(std::size_t offset, std::size_t width) const
{
    unsigned int value = 0;
    for (std::size_t i = offset; i < offset + width; ++i)
        value = value << 8U | (i < mBytes.size() ? static_cast<unsigned char>(mBytes[i]) : 0U);
    return value;
}

void TwinFrame::put(std::size_t offset, std::size_t width, std::uint32_t value)
{
    for (std::size_t i = 0; i < width && offset + i < mBytes.size(); ++i)
        mBytes[offset + i] = static_cast<char>(static_cast<unsigned char>(value >> (8 * (width - 1 - i))));
}

void TwinFrame::setPayload(const std::string& payload)
{
    mBytes.resize(header());
    mBytes += payload;
    put(4, 4, static_cast<std::uint32_t>(mBytes.size()));
    put(15, 1, 0);
    put(16, 4, static_cast<std::uint32_t>(payload.size()));
}

TwinFrame TwinFrame::response(unsigned int status) const
{
    TwinFrame frame(Draft::response(function(), operation()).callerId(number(8, 4)).bytes());
    frame.put(22, 2, status);
    return frame;
}

void TwinLink::pWrite(Stream& stream, const std::string& bytes)
{
    mIsNew = false;
    writeAll(stream, bytes);
}

Twin::Twin(IPEndpoint server, const Fault& fault, SSLServerContext* context)
    : mServer(std::move(server)), mFault(fault), mContext(context), mListener(listenOn(IPEndpoint("127.0.0.1:0"), 64)),
      mEndpoint(mListener.getSocketName()), mAccepter([this] { pAccept(); })
{}

Twin::~Twin()
{
    mStop.interrupt();
    mAccepter.join();
}

void Twin::pAccept()
{
    const PollFd listener = mListener.getPollFd(PollEvents::Read);
    while (!PollSet{listener, mStop.getPollFd()}.wait(PollSet::TIMEOUT_INFINITE).contains(mStop.getPollFd())) {
        auto console = std::make_unique<SocketStream>(mListener.accept());
        if (mThreads.size() >= mFault.mostConnections) continue;
        if (mFault.tls == Fault::Tls::OneAtATime) {
            pServe(std::move(console));
            continue;
        }
        mThreads.emplace_back([this](std::unique_ptr<SocketStream> stream) { pServe(std::move(stream)); },
                              std::move(console));
    }
    for (std::thread& thread : mThreads)
        thread.join();
}

void Twin::pServe(std::unique_ptr<SocketStream> console) noexcept
{
    const int descriptor = console->getSocket().getFd();
    try {
        if (mContext == nullptr) return pPump(*console, descriptor);
        const auto tls = pAdmit(std::move(console));
        if (tls != nullptr) pPump(*tls, descriptor);
    } catch (const std::exception&) { // NOLINT(bugprone-empty-catch): the connection ends
    }
}

/// The steps to TLS. @return null: the connection is over
std::unique_ptr<Stream> Twin::pAdmit(std::unique_ptr<SocketStream> console)
{
    using Tls = Fault::Tls;
    const Tls fault = mFault.tls;
    console->setReadDeadline(kTime);
    std::string bytes(kPrefix, '\0');
    try {
        console->fill(bytes.data(), kPrefix);
        const std::size_t length = frameLength(bytes);
        if (length == 0 || bytes.compare(0, 3, "\xDE\xCA\xFF") != 0) {
            if (fault == Tls::AnswersGarbage) writeAll(*console, Draft::notice(kHandshake, kUpgrade).bytes());
            return nullptr;
        }
        bytes.resize(length);
        console->fill(bytes.data() + kPrefix, length - kPrefix);
    } catch (const StreamIOException&) {
        if (fault == Tls::StaysAtTheEnd) PollSet{mStop.getPollFd()}.wait(kTime);
        return nullptr;
    }
    const TwinFrame first(bytes);
    if (fault == Tls::RefusesOldHeader && first.header() == 24) return nullptr;
    const bool isRequest = first.isNotice() && first.is(kHandshake, kUpgrade);
    if (!isRequest && fault != Tls::GrantsAnything) {
        TwinFrame abort(Draft::notice(kHandshake, kAbort).bytes());
        if (fault == Tls::AbortsWithPayload) abort.setPayload("why");
        writeAll(*console, abort.bytes());
        if (fault == Tls::StaysAfterAbort) readSome(*console, bytes);
        return nullptr;
    }
    char byte = 0;
    const int descriptor = console->getSocket().getFd();
    if (fault != Tls::IgnoresEarlyData && ::recv(descriptor, &byte, 1, MSG_PEEK | MSG_DONTWAIT) > 0) return nullptr;
    TwinFrame answer(Draft::notice(kHandshake, kUpgrade).bytes());
    if (fault == Tls::AnswersWithPayload) answer.setPayload("yes");
    if (fault == Tls::AnswersAsRequest) answer.put(14, 1, 0x80);
    writeAll(*console, answer.bytes());
    if (fault == Tls::AnswersTwice) writeAll(*console, answer.bytes());
    if (fault == Tls::StaysInTheClear) {
        std::string peek(kPrefix, '\0');
        const ssize_t count = ::recv(descriptor, peek.data(), kPrefix, MSG_PEEK | MSG_WAITALL);
        if (count == static_cast<ssize_t>(kPrefix) && peek.compare(0, 3, "\xDE\xCA\xFF") == 0) return console;
    }
    if (fault == Tls::WaitsAfterGarbage) {
        const ssize_t count = ::recv(descriptor, &byte, 1, MSG_PEEK);
        if (count == 1 && byte != '\x16') {
            while (readSome(*console, bytes))
                continue;
            return nullptr;
        }
    }
    auto tls = std::make_unique<SSLStream>(*mContext, std::move(console));
    protocol::startTls(*tls);
    return tls;
}

/// Hands frames on, both ways, until both streams have ended. One thread for both directions, so faults need no lock.
void Twin::pPump(Stream& console, int consoleFd)
{
    Socket socket(mServer.getFamily(), SOCK_STREAM | SOCK_CLOEXEC, 0);
    socket.connect(mServer, kTime);
    SocketStream server(std::move(socket));
    const int serverFd = server.getSocket().getFd();
    console.clearReadDeadline();
    TwinLink link(console, server);
    const auto* tls = dynamic_cast<const SSLStream*>(&console);
    std::string upBytes;
    std::string downBytes;
    bool upOpen = true;
    bool downOpen = true;
    while (downOpen && !link.isCut()) {
        // The console's end is polled with no event once its stream has ended, or it would be ready all the time.
        const PollFd up(upOpen ? consoleFd : mStop.getPollFd().mFd.fd, PollEvents::Read);
        const PollFd down(serverFd, PollEvents::Read);
        const bool hasPending = upOpen && tls != nullptr && tls->hasPending();
        const std::chrono::milliseconds time = mFault.endsIdle ? kIdle : PollSet::TIMEOUT_INFINITE;
        const auto ready = PollSet{up, down, mStop.getPollFd()}.wait(hasPending ? std::chrono::milliseconds(0) : time);
        if (!hasPending && !ready.anyReady()) return; // idle for too long
        if (ready.contains(mStop.getPollFd())) return;
        if (upOpen && (hasPending || ready.contains(up))) {
            upOpen = readSome(console, upBytes);
            pUp(link, upBytes);
            if (!upOpen) {
                if (mFault.dropsHalfClose) return;
                if (mFault.outlivesItsConsole || (mFault.staysAtTheEnd && (link.isNew() || !upBytes.empty()))) {
                    if (mFault.outlivesItsConsole) ::shutdown(consoleFd, SHUT_WR);
                    PollSet{mStop.getPollFd()}.wait(PollSet::TIMEOUT_INFINITE);
                    return;
                }
                writeAll(server, upBytes); // what was no whole frame
                ::shutdown(serverFd, SHUT_WR);
            }
        }
        if (!link.isCut() && ready.contains(down)) {
            downOpen = readSome(server, downBytes);
            pDown(link, downBytes);
            if (!downOpen && mFault.staysOpen) PollSet{mStop.getPollFd()}.wait(PollSet::TIMEOUT_INFINITE);
        }
    }
    ::shutdown(consoleFd, SHUT_WR);
    if (link.isCut()) return;
    while (upOpen && !PollSet{mStop.getPollFd()}.wait(std::chrono::milliseconds(0)).anyReady()) {
        const PollFd up(consoleFd, PollEvents::Read);
        if (PollSet{up, mStop.getPollFd()}.wait(PollSet::TIMEOUT_INFINITE).contains(mStop.getPollFd())) return;
        upOpen = readSome(console, upBytes);
    }
}

void Twin::pUp(TwinLink& link, std::string& bytes)
{
    if (mFault.raw && !mFault.raw(link, bytes)) return;
    while (!link.isCut()) {
        const std::size_t length = frameLength(bytes);
        if (length == 0 && bytes.size() >= kPrefix) { // where the next frame begins is not known any more
            link.toServer(TwinFrame(bytes));
            bytes.clear();
        }
        if (length == 0 || bytes.size() < length) return;
        TwinFrame frame(bytes.substr(0, length));
        bytes.erase(0, length);
        if (mFault.tls == Fault::Tls::UpgradesInside && frame.is(kHandshake, kUpgrade)) {
            link.toConsole(frame);
        } else if (mFault.up) {
            mFault.up(link, std::move(frame));
        } else {
            link.toServer(frame);
        }
    }
}

void Twin::pDown(TwinLink& link, std::string& bytes)
{
    while (!link.isCut()) {
        const std::size_t length = frameLength(bytes);
        if (length == 0 || bytes.size() < length) return;
        TwinFrame frame(bytes.substr(0, length));
        bytes.erase(0, length);
        if (mFault.down) {
            mFault.down(link, std::move(frame));
        } else {
            link.toConsole(frame);
        }
    }
}

} // namespace qel::test
