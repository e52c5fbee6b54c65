// TLS streams whose credentials are refused, over a connection in memory and over TCP: the failure, the state and the
// log at each end.

#include <qel/common/security/SSLStream.hpp>

#include "security/StreamExpectations.hpp"
#include "support/TlsKit.hpp"

#include <gtest/gtest.h>
#include <openssl/x509_vfy.h>
#include <ostream>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

namespace qel {
namespace {

using test::clientContext;
using test::connectStreams;
using test::endedAfterHandshake;
using test::Identity;
using test::kEOF;
using test::kEOFInHandshake;
using test::kRefusal;
using test::kSSLError1;
using test::Lines;
using test::nameOf;
using test::Outcomes;
using test::refusedCertificate;
using test::serverContext;
using test::StreamPair;
using test::TlsTest;
using test::Transport;

// Certificates

/// Two of our streams and how they fail. A null identity means a context without credentials.
struct CredentialsRow {
    std::string name;
    const Identity* client;
    const Identity* server;
    std::string clientFailure;
    Lines clientLog;
    std::string serverFailure;
    Lines serverLog;
};

void PrintTo(const CredentialsRow& row, std::ostream* os) { *os << row.name; }

const Identity kClient = Identity::Client;
const Identity kServer = Identity::Server;
const Identity kExpired = Identity::Expired;
const Identity kNotYetValid = Identity::NotYetValid;
const Identity kOtherRoot = Identity::OtherRoot;
const Identity kWithSubjectOfRoot = Identity::WithSubjectOfRoot;
const Identity kWithKeyOfAnother = Identity::WithKeyOfAnother;
const Identity kStranger = Identity::Stranger;

/// The server refuses the client, whose TLS handshake is complete by then.
CredentialsRow refusedClient(const std::string& name, const Identity* client, long reason)
{
    return {name, client, &kServer, kEOF, endedAfterHandshake(), kSSLError1, refusedCertificate(reason)};
}

CredentialsRow refusedServer(const std::string& name, const Identity* client, const Identity* server, long reason)
{
    return {name, client, server, kSSLError1, refusedCertificate(reason), kEOF, {kEOFInHandshake}};
}

std::vector<CredentialsRow> credentialsRows()
{
    return {
        refusedClient("ClientExpired", &kExpired, X509_V_ERR_CERT_HAS_EXPIRED),
        refusedClient("ClientNotYetValid", &kNotYetValid, X509_V_ERR_CERT_NOT_YET_VALID),
        refusedClient("ClientOfAnotherRoot", &kOtherRoot, X509_V_ERR_UNABLE_TO_GET_ISSUER_CERT_LOCALLY),
        refusedClient("ClientWithSubjectOfRoot", &kWithSubjectOfRoot, X509_V_ERR_DEPTH_ZERO_SELF_SIGNED_CERT),
        refusedServer("ServerExpired", &kClient, &kExpired, X509_V_ERR_CERT_HAS_EXPIRED),
        refusedServer("ServerNotYetValid", &kClient, &kNotYetValid, X509_V_ERR_CERT_NOT_YET_VALID),
        refusedServer("ServerOfAnotherRoot", &kClient, &kOtherRoot, X509_V_ERR_UNABLE_TO_GET_ISSUER_CERT_LOCALLY),
        refusedServer("ServerWithSubjectOfRoot", &kClient, &kWithSubjectOfRoot, X509_V_ERR_DEPTH_ZERO_SELF_SIGNED_CERT),
        refusedServer("BothExpired", &kExpired, &kExpired, X509_V_ERR_CERT_HAS_EXPIRED),
        // The server also sends its root, and the client trusts no certificate.
        refusedServer("ClientWithoutCredentials", nullptr, &kServer, X509_V_ERR_SELF_SIGNED_CERT_IN_CHAIN),
        refusedServer("ClientOfAnotherAuthority", &kStranger, &kServer, X509_V_ERR_SELF_SIGNED_CERT_IN_CHAIN),
        // One context refused its own credentials. No certificate is refused, so no line reports one.
        {"ClientWithoutCertificate", &kWithKeyOfAnother, &kServer, kEOF, endedAfterHandshake(), kSSLError1, kRefusal},
        {"ServerWithoutCertificate", &kClient, &kWithKeyOfAnother, kEOF, {kEOFInHandshake}, kSSLError1, kRefusal},
        {"ServerWithoutCredentials", &kClient, nullptr, kEOF, {kEOFInHandshake}, kSSLError1, kRefusal},
        {"NeitherHasCredentials", nullptr, nullptr, kEOF, {kEOFInHandshake}, kSSLError1, kRefusal},
    };
}

SSLContext& contextFor(const Identity* client)
{
    static SSLClientContext bare;
    if (client == nullptr) return bare;
    return clientContext(*client);
}

SSLContext& serverContextFor(const Identity* server)
{
    static SSLServerContext bare;
    if (server == nullptr) return bare;
    return serverContext(*server);
}

class SSLStreamCredentials : public TlsTest,
                             public ::testing::WithParamInterface<std::tuple<CredentialsRow, Transport>> {};

INSTANTIATE_TEST_SUITE_P(Matrix, SSLStreamCredentials,
                         ::testing::Combine(::testing::ValuesIn(credentialsRows()),
                                            ::testing::Values(Transport::Memory, Transport::Tcp)),
                         [](const auto& row) { return std::get<0>(row.param).name + nameOf(std::get<1>(row.param)); });

TEST_P(SSLStreamCredentials, AreRefused)
{
    const auto& [row, transport] = GetParam();
    StreamPair streams = connectStreams(transport);
    SSLStream client(contextFor(row.client), std::move(streams.client));
    SSLStream server(serverContextFor(row.server), std::move(streams.server));
    const Outcomes outcomes = shakeHands(client, server);

    EXPECT_EQ(outcomes.server.failure, row.serverFailure);
    EXPECT_EQ(outcomes.server.log, row.serverLog);
    EXPECT_EQ(server.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(server.getPeerCertificate(), nullptr);

    EXPECT_EQ(client.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(client.getPeerCertificate(), nullptr);
    // A refused client may still write when the server has closed.
    if (transport == Transport::Tcp && outcomes.client.failure == "StreamIOException: socket stream send failure")
        return;
    EXPECT_EQ(outcomes.client.failure, row.clientFailure);
    EXPECT_EQ(outcomes.client.log, row.clientLog);
}

} // namespace
} // namespace qel
