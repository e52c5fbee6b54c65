#pragma once

#include <qel/common/QelMessage.hpp>

#include "Loopback.hpp"
#include "TlsEnds.hpp"

#include <boost/asio.hpp>
#include <boost/asio/ssl.hpp>
#include <unistd.h>

namespace qel::bench {

/// Boost.Asio over descriptors of its own, with contexts that are set up as the others.
struct AsioConnection {
    using Socket = boost::asio::ip::tcp::socket;
    using Stream = boost::asio::ssl::stream<Socket>;

    AsioConnection()
        : clientContext(rawContext(clientCredentials()).release()),
          serverContext(rawContext(serverCredentials()).release()),
          near(Socket(context, boost::asio::ip::tcp::v4(), ::dup(pair.nearFd())), clientContext),
          far(Socket(context, boost::asio::ip::tcp::v4(), ::dup(pair.farFd())), serverContext)
    {
        bothEnds([this] { near.handshake(Stream::client); }, [this] { far.handshake(Stream::server); });
    }

    static void write(Stream& stream, const QelMessage& message)
    {
        boost::asio::write(stream, boost::asio::buffer(message.serialize(), message.msgLength()));
    }

    TcpPair pair;
    boost::asio::io_context context{1};
    boost::asio::ssl::context clientContext;
    boost::asio::ssl::context serverContext;
    Stream near;
    Stream far;
};

} // namespace qel::bench
