#pragma once

#include <qel/common/QelMessage.hpp>

#include <benchmark/benchmark.h>
#include <cstddef>
#include <stdexcept>
#include <zmq.h>

/// @file
/// What the contests against ZeroMQ have in common.

namespace qel::bench {

inline void checkZmq(bool succeeded, const char* call)
{
    if (!succeeded) throw std::runtime_error(call);
}

/// Two connected ZeroMQ sockets of the given kinds over loopback, with one I/O thread between them.
class ZmqPair {
public:
    enum class Protection { None, Curve };

    ZmqPair(int nearKind, int farKind, Protection protection = Protection::None) : context(::zmq_ctx_new())
    {
        far = ::zmq_socket(context, farKind);
        near = ::zmq_socket(context, nearKind);
        if (protection == Protection::Curve) useCurve();
        char endpoint[64];
        std::size_t length = sizeof(endpoint);
        checkZmq(::zmq_bind(far, "tcp://127.0.0.1:*") == 0, "zmq_bind");
        checkZmq(::zmq_getsockopt(far, ZMQ_LAST_ENDPOINT, endpoint, &length) == 0, "zmq_getsockopt");
        checkZmq(::zmq_connect(near, endpoint) == 0, "zmq_connect");
    }
    ~ZmqPair()
    {
        ::zmq_close(near);
        ::zmq_close(far);
        ::zmq_ctx_term(context);
    }
    ZmqPair(const ZmqPair&) = delete;
    ZmqPair& operator=(const ZmqPair&) = delete;

    void* context;
    void* near;
    void* far;

private:
    /// The encryption of ZeroMQ itself; the client knows the server's key, the server takes any client.
    void useCurve()
    {
        constexpr std::size_t kKeyText = 41; // 40 characters and the end of the string
        char serverPublic[kKeyText];
        char serverSecret[kKeyText];
        char clientPublic[kKeyText];
        char clientSecret[kKeyText];
        checkZmq(::zmq_curve_keypair(serverPublic, serverSecret) == 0, "zmq_curve_keypair");
        checkZmq(::zmq_curve_keypair(clientPublic, clientSecret) == 0, "zmq_curve_keypair");
        const int server = 1;
        setOption(far, ZMQ_CURVE_SERVER, &server, sizeof(server));
        setOption(far, ZMQ_CURVE_SECRETKEY, serverSecret, kKeyText);
        setOption(near, ZMQ_CURVE_SERVERKEY, serverPublic, kKeyText);
        setOption(near, ZMQ_CURVE_PUBLICKEY, clientPublic, kKeyText);
        setOption(near, ZMQ_CURVE_SECRETKEY, clientSecret, kKeyText);
    }

    static void setOption(void* socket, int option, const void* value, std::size_t length)
    {
        checkZmq(::zmq_setsockopt(socket, option, value, length) == 0, "zmq_setsockopt");
    }
};

inline void zmqReceive(void* socket)
{
    zmq_msg_t received;
    ::zmq_msg_init(&received);
    checkZmq(::zmq_msg_recv(&received, socket, 0) >= 0, "zmq_msg_recv");
    benchmark::DoNotOptimize(::zmq_msg_data(&received));
    ::zmq_msg_close(&received);
}

inline void zmqSend(void* socket, const QelMessage& message)
{
    checkZmq(::zmq_send(socket, message.serialize(), message.msgLength(), 0) >= 0, "zmq_send");
}

} // namespace qel::bench
