#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/io/Stream.hpp>
#include <qel/common/io/StreamIOException.hpp>

#include "Contest.hpp"
#include "Loopback.hpp"
#include "ZmqPair.hpp"

#include <boost/asio.hpp>
#include <cstddef>
#include <memory>
#include <stdexcept>
#include <string>
#include <sys/socket.h>
#include <unistd.h>
#include <vector>

namespace qel::bench {

namespace {

constexpr std::size_t kShortest = 40;

/// A stream over a descriptor and nothing more: what the message stream costs without the care of SocketStream.
class DescriptorStream : public Stream {
public:
    explicit DescriptorStream(int descriptor) : mDescriptor(descriptor) {}
    ~DescriptorStream() override { ::close(mDescriptor); }
    void close() override { ::shutdown(mDescriptor, SHUT_RDWR); }
    std::size_t read(char* buffer, std::size_t length) override
    {
        const ssize_t count = ::read(mDescriptor, buffer, length);
        if (count < 0) throw StreamIOException("read");
        return static_cast<std::size_t>(count);
    }
    void write(const char* buffer, std::size_t length) override { sendAll(mDescriptor, buffer, length); }
    int descriptor() const { return mDescriptor; }

private:
    int mDescriptor;
};

struct LocalPair {
    LocalPair()
    {
        int ends[2];
        if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) throw std::runtime_error("socketpair");
        near = std::make_unique<DescriptorStream>(ends[0]);
        far = std::make_unique<DescriptorStream>(ends[1]);
    }
    int nearFd() const { return near->descriptor(); }
    int farFd() const { return far->descriptor(); }

    std::unique_ptr<DescriptorStream> near;
    std::unique_ptr<DescriptorStream> far;
};

/// One frame over: one write and two reads.
template <typename Pair>
void oursOneWay(benchmark::State& state, std::size_t length)
{
    Pair pair;
    QelMessageRegistry registry;
    QelMessageStream sender(*pair.near, registry);
    QelMessageStream receiver(*pair.far, registry);
    const std::unique_ptr<QelMessage> message = messageOf(length);
    for (auto _ : state) {
        sender.write(*message);
        benchmark::DoNotOptimize(receiver.read());
    }
}

template <typename Pair>
void rawOneWay(benchmark::State& state, std::size_t length)
{
    Pair pair;
    const std::unique_ptr<QelMessage> message = messageOf(length);
    std::vector<char> buffer(QelMessage::MtuMax);
    for (auto _ : state) {
        sendAll(pair.nearFd(), message->serialize(), message->msgLength());
        readFrame(pair.farFd(), buffer.data());
        benchmark::DoNotOptimize(buffer.data());
    }
}

void asioOneWay(benchmark::State& state, std::size_t length)
{
    AsioPair pair;
    const std::unique_ptr<QelMessage> message = messageOf(length);
    for (auto _ : state) {
        boost::asio::write(pair.near, boost::asio::buffer(message->serialize(), message->msgLength()));
        benchmark::DoNotOptimize(asioRead(pair.far));
    }
}

void zmqOneWay(benchmark::State& state, std::size_t length)
{
    ZmqPair pair(ZMQ_PAIR, ZMQ_PAIR);
    const std::unique_ptr<QelMessage> message = messageOf(length);
    for (auto _ : state) {
        zmqSend(pair.near, *message);
        zmqReceive(pair.far);
    }
}

void oursThereAndBack(benchmark::State& state)
{
    TcpPair pair;
    QelMessageRegistry registry;
    QelMessageStream console(*pair.near, registry);
    QelMessageStream hypervisor(*pair.far, registry);
    const QelMessageVirtualSerialOpenReq request(1, 0, false);
    const QelMessageVirtualSerialOpenRsp response(request.getCallerId(), 1, 0);
    for (auto _ : state) {
        console.write(request);
        benchmark::DoNotOptimize(hypervisor.read());
        hypervisor.write(response);
        benchmark::DoNotOptimize(console.read());
    }
}

void rawThereAndBack(benchmark::State& state)
{
    TcpPair pair;
    const QelMessageVirtualSerialOpenReq message(1, 0, false);
    std::vector<char> buffer(QelMessage::MtuMax);
    const auto oneWay = [&](int from, int to) {
        sendAll(from, message.serialize(), message.msgLength());
        readFrame(to, buffer.data());
    };
    for (auto _ : state) {
        oneWay(pair.nearFd(), pair.farFd());
        oneWay(pair.farFd(), pair.nearFd());
    }
}

void zmqThereAndBack(benchmark::State& state)
{
    ZmqPair pair(ZMQ_REQ, ZMQ_REP);
    const QelMessageVirtualSerialOpenReq message(1, 0, false);
    for (auto _ : state) {
        zmqSend(pair.near, message);
        zmqReceive(pair.far);
        zmqSend(pair.far, message);
        zmqReceive(pair.near);
    }
}

Contest::Body of(std::size_t length, void (*body)(benchmark::State&, std::size_t))
{
    return [length, body](benchmark::State& state) { body(state, length); };
}

} // namespace

void addTransportContests()
{
    struct Size {
        const char* name;
        std::size_t bytes;
        double zmqAtMost;
    };
    for (const Size& size : {Size{"40 B", kShortest, 0}, Size{"1 KiB", 1024, 0}, Size{"16 KiB", 16384, 0.5}}) {
        contest(std::string("frame over loopback TCP, ") + size.name)
            .ours(of(size.bytes, oursOneWay<TcpPair>))
            .floor("raw send and two reads", 1.08, of(size.bytes, rawOneWay<TcpPair>))
            .peer("Boost.Asio, an owned message", 1.0, of(size.bytes, asioOneWay))
            .peer("ZeroMQ", size.zmqAtMost, of(size.bytes, zmqOneWay));
    }
    contest("request and response over loopback TCP, 40 B")
        .ours(oursThereAndBack)
        .floor("raw send and two reads each way", 1.04, rawThereAndBack)
        .peer("ZeroMQ", 0.38, zmqThereAndBack);
    contest("frame over a socket pair, 40 B")
        .ours(of(kShortest, oursOneWay<LocalPair>))
        .floor("raw send and two reads", 0, of(kShortest, rawOneWay<LocalPair>));
}

} // namespace qel::bench
