#include <qel/common/QelMessageQueue.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/io/BufferedStream.hpp>
#include <qel/common/io/QelMessageStream.hpp>

#include "AsioTlsConnection.hpp"
#include "Contest.hpp"
#include "Loopback.hpp"
#include "TlsEnds.hpp"
#include "ZmqPair.hpp"

#include <algorithm>
#include <boost/asio.hpp>
#include <chrono>
#include <cstddef>
#include <memory>
#include <string>
#include <thread>
#include <utility>
#include <vector>

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

/// Sends what other threads give it, as a server does: all that its queue holds, up to a burst, then it flushes.
class QueuedSender {
public:
    explicit QueuedSender(Stream& stream) : mStream(stream), mMessages(mStream, mRegistry), mThread([this] { pRun(); })
    {}
    ~QueuedSender()
    {
        mQueue.shutdown();
        mThread.join();
    }
    QueuedSender(const QueuedSender&) = delete;
    QueuedSender& operator=(const QueuedSender&) = delete;

    void send(std::unique_ptr<QelMessage> message) { mQueue.enqueue(std::move(message)); }

private:
    void pRun()
    {
        while (std::unique_ptr<QelMessage> message = mQueue.waitForMsg(std::chrono::milliseconds::max())) {
            std::size_t taken = 0;
            do {
                taken += message->msgLength();
                mMessages.write(*message);
                message = taken < kBurstBytes ? mQueue.waitForMsg(std::chrono::milliseconds::zero()) : nullptr;
            } while (message != nullptr);
            mStream.flush();
        }
    }

    QelMessageRegistry mRegistry;
    QelMessageQueue mQueue{0};
    BufferedStream mStream;
    QelMessageStream mMessages;
    std::thread mThread;
};

/// The queue owns its messages, so each is a copy of its own; zmq_send copies, too.
void queued(benchmark::State& state, std::size_t length)
{
    PlainEnds ends;
    QelMessageRegistry registry;
    QueuedSender sender(ends.near());
    BufferedStream far(ends.far());
    QelMessageStream receiver(far, registry);
    const std::unique_ptr<QelMessage> message = messageOf(length);
    passBursts(
        state, kBurstBytes / length, [&] { sender.send(message->clone()); }, [] {},
        [&] { benchmark::DoNotOptimize(receiver.read()); });
}

void rawSocket(benchmark::State& state, std::size_t length)
{
    TcpPair pair;
    const std::unique_ptr<QelMessage> message = messageOf(length);
    std::vector<char> buffer(QelMessage::MtuMax);
    passBursts(
        state, std::min(kMostSegments, kBurstBytes / length),
        [&] { sendAll(pair.nearFd(), message->serialize(), message->msgLength()); }, [] {},
        [&] {
            readFrame(pair.farFd(), buffer.data());
            benchmark::DoNotOptimize(buffer.data());
        });
}

void asio(benchmark::State& state, std::size_t length)
{
    AsioPair pair;
    const std::unique_ptr<QelMessage> message = messageOf(length);
    passBursts(
        state, std::min(kMostSegments, kBurstBytes / length),
        [&] { boost::asio::write(pair.near, boost::asio::buffer(message->serialize(), message->msgLength())); }, [] {},
        [&] { benchmark::DoNotOptimize(asioRead(pair.far)); });
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
    struct Size {
        const char* name;
        std::size_t bytes;
        double unbuffered; // the most of the time of each, 0: only reported
        double zmq;
        double queuedZmq;
    };
    for (const Size& size :
         {Size{"64 B", 64, 0.10, 0.42, 1.1}, Size{"256 B", 256, 0, 0, 0}, Size{"1 KiB", 1024, 0, 0.38, 0},
          Size{"4 KiB", 4096, 0, 0, 0}, Size{"16 KiB", 16384, 0, 0, 0}}) {
        contest(std::string("buffered: one way, ") + size.name)
            .ours(of(size.bytes, buffered<PlainEnds>))
            .floor("unbuffered", size.unbuffered, of(size.bytes, unbuffered<PlainEnds>))
            .peer("ZeroMQ", size.zmq, of(size.bytes, zmqInTheClear))
            .peer("Boost.Asio", 0, of(size.bytes, asio))
            .peer("a raw socket", 0, of(size.bytes, rawSocket));
        contest(std::string("queue and writer thread: one way, ") + size.name)
            .ours(of(size.bytes, queued))
            .peer("ZeroMQ", size.queuedZmq, of(size.bytes, zmqInTheClear));
    }
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
