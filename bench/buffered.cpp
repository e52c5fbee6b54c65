#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/io/BufferedStream.hpp>
#include <qel/common/io/QelMessageStream.hpp>

#include "AsioTlsConnection.hpp"
#include "Contest.hpp"
#include "Loopback.hpp"
#include "TlsEnds.hpp"
#include "ZmqPair.hpp"

#include <algorithm>
#include <cstddef>
#include <memory>
#include <string>
#include <utility>

/// @file
/// Many messages in one direction, and bursts of requests: what gathering them is worth. All contestants send a burst,
/// then receive it, on one thread (ZeroMQ has a thread of its own between); the times are of one message, or of one
/// request and its response.

namespace qel::bench {

namespace {

constexpr std::size_t kBurstBytes = 16384; // what is under way at once; the buffers of the sockets hold it
constexpr std::size_t kRequests = 8;       // requests of a burst
// Without a buffer each frame is a segment, and the kernel counts a segment of 64 bytes as many times its size: more
// than this would wait for the window.
constexpr std::size_t kMostSegments = 64;

/// Sends and receives bursts.
template <typename Send, typename Flush, typename Receive>
void passBursts(benchmark::State& state, std::size_t count, const Send& send, const Flush& flush,
                const Receive& receive)
{
    while (state.KeepRunningBatch(static_cast<benchmark::IterationCount>(count))) {
        for (std::size_t i = 0; i < count; ++i)
            send();
        flush();
        for (std::size_t i = 0; i < count; ++i)
            receive();
    }
}

/// What connects both ends of ours: streams over loopback, plain or TLS.
struct PlainEnds {
    Stream& near() { return *pair.near; }
    Stream& far() { return *pair.far; }

    TcpPair pair;
};

struct TlsEnds {
    TlsEnds() : tls(contexts(), TcpPair()) { tls.handshake(); }
    static OurContexts& contexts()
    {
        static OurContexts sContexts;
        return sContexts;
    }
    Stream& near() { return *tls.near; }
    Stream& far() { return *tls.far; }

    OurTlsPair tls;
};

template <typename Ends>
void unbuffered(benchmark::State& state, std::size_t length)
{
    Ends ends;
    QelMessageRegistry registry;
    QelMessageStream sender(ends.near(), registry);
    QelMessageStream receiver(ends.far(), registry);
    const std::unique_ptr<QelMessage> message = messageOf(length);
    passBursts(
        state, std::min(kMostSegments, kBurstBytes / length), [&] { sender.write(*message); }, [] {},
        [&] { benchmark::DoNotOptimize(receiver.read()); });
}

template <typename Ends>
void buffered(benchmark::State& state, std::size_t length)
{
    Ends ends;
    QelMessageRegistry registry;
    BufferedStream near(ends.near());
    BufferedStream far(ends.far());
    QelMessageStream sender(near, registry);
    QelMessageStream receiver(far, registry);
    const std::unique_ptr<QelMessage> message = messageOf(length);
    passBursts(
        state, kBurstBytes / length, [&] { sender.write(*message); }, [&] { near.flush(); },
        [&] { benchmark::DoNotOptimize(receiver.read()); });
}

void zmq(benchmark::State& state, std::size_t length, ZmqPair::Protection protection)
{
    ZmqPair pair(ZMQ_PAIR, ZMQ_PAIR, protection);
    const std::unique_ptr<QelMessage> message = messageOf(length);
    passBursts(
        state, kBurstBytes / length, [&] { zmqSend(pair.near, *message); }, [] {}, [&] { zmqReceive(pair.far); });
}

void zmqInTheClear(benchmark::State& state, std::size_t length) { zmq(state, length, ZmqPair::Protection::None); }

void zmqEncrypted(benchmark::State& state, std::size_t length) { zmq(state, length, ZmqPair::Protection::Curve); }

void asioTls(benchmark::State& state, std::size_t length)
{
    AsioConnection connection;
    const std::unique_ptr<QelMessage> message = messageOf(length);
    passBursts(
        state, std::min(kMostSegments, kBurstBytes / length), [&] { AsioConnection::write(connection.near, *message); },
        [] {}, [&] { benchmark::DoNotOptimize(asioRead(connection.far)); });
}

/// Requests that a console sends together, and the responses of the hypervisor.
template <typename ConsoleStream, typename HypervisorStream>
void passRequests(benchmark::State& state, std::size_t count, ConsoleStream& near, HypervisorStream& far)
{
    QelMessageRegistry registry;
    QelMessageStream console(near, registry);
    QelMessageStream hypervisor(far, registry);
    const QelMessageVirtualSerialOpenReq request(1, 0, false);
    const QelMessageVirtualSerialOpenRsp response(request.getCallerId(), 1, 0);
    const auto flush = [](Stream& stream) {
        if (auto* const known = dynamic_cast<BufferedStream*>(&stream)) known->flush();
    };
    while (state.KeepRunningBatch(static_cast<benchmark::IterationCount>(count))) {
        for (std::size_t i = 0; i < count; ++i)
            console.write(request);
        flush(near);
        for (std::size_t i = 0; i < count; ++i) {
            benchmark::DoNotOptimize(hypervisor.read());
            hypervisor.write(response);
        }
        flush(far);
        for (std::size_t i = 0; i < count; ++i)
            benchmark::DoNotOptimize(console.read());
    }
}

template <typename Ends>
void unbufferedRequests(benchmark::State& state, std::size_t count)
{
    Ends ends;
    passRequests(state, count, ends.near(), ends.far());
}

template <typename Ends>
void bufferedRequests(benchmark::State& state, std::size_t count)
{
    Ends ends;
    BufferedStreamOptions options;
    options.flushBeforeRead = true;
    BufferedStream near(ends.near(), options);
    BufferedStream far(ends.far(), options);
    passRequests(state, count, near, far);
}

Contest::Body of(std::size_t number, void (*body)(benchmark::State&, std::size_t))
{
    return [number, body](benchmark::State& state) { body(state, number); };
}

template <typename Ends>
void addRequestContest(const std::string& name, std::size_t count, double atMost)
{
    contest(name)
        .ours(of(count, bufferedRequests<Ends>))
        .floor("unbuffered", atMost, of(count, unbufferedRequests<Ends>));
}

} // namespace

void addBufferedContests()
{
    contest("buffered: one way, 64 B")
        .ours(of(64, buffered<PlainEnds>))
        .floor("unbuffered", 0.10, of(64, unbuffered<PlainEnds>))
        .peer("ZeroMQ", 0.42, of(64, zmqInTheClear));
    contest("buffered: one way, 1 KiB")
        .ours(of(1024, buffered<PlainEnds>))
        .floor("unbuffered", 0, of(1024, unbuffered<PlainEnds>))
        .peer("ZeroMQ", 0.38, of(1024, zmqInTheClear));
    contest("buffered: one way over TLS, 64 B")
        .ours(of(64, buffered<TlsEnds>))
        .floor("unbuffered", 0, of(64, unbuffered<TlsEnds>))
        .peer("ZeroMQ in the clear", 0.65, of(64, zmqInTheClear))
        .peer("ZeroMQ with CURVE", 0.12, of(64, zmqEncrypted))
        .peer("Boost.Asio over TLS", 0.08, of(64, asioTls));
    contest("buffered: one way over TLS, 1 KiB")
        .ours(of(1024, buffered<TlsEnds>))
        .floor("unbuffered", 0, of(1024, unbuffered<TlsEnds>))
        .peer("ZeroMQ in the clear", 1.0, of(1024, zmqInTheClear))
        .peer("ZeroMQ with CURVE", 0.30, of(1024, zmqEncrypted))
        .peer("Boost.Asio over TLS", 0, of(1024, asioTls));
    addRequestContest<PlainEnds>("buffered: 8 requests and responses", kRequests, 0.20);
    addRequestContest<TlsEnds>("buffered: 8 requests and responses over TLS", kRequests, 0.20);
    addRequestContest<PlainEnds>("buffered: a lone request and response", 1, 0.95);
    addRequestContest<TlsEnds>("buffered: a lone request and response over TLS", 1, 1.02);
}

} // namespace qel::bench
