#include <qel/common/security/SSLContext.hpp>

#include "security/ContextKit.hpp"
#include "support/OpenSSLCalls.hpp"
#include "support/SSLFailures.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <openssl/err.h>
#include <openssl/ssl.h>
#include <thread>
#include <type_traits>
#include <utility>
#include <vector>

namespace qel {
namespace {

using test::anchorsOf;
using test::clientContext;
using test::connect;
using test::expectEveryFailureIsReported;
using test::handleOf;
using test::namesIn;
using test::OpenSSLCalls;
using test::Probe;
using test::serverContext;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

static_assert(std::is_abstract<SSLContext>::value, "");
static_assert(std::has_virtual_destructor<SSLContext>::value, "programs hold contexts by their base");
static_assert(!std::is_copy_constructible<SSLContext>::value && !std::is_copy_assignable<SSLContext>::value, "");
static_assert(!std::is_move_constructible<SSLClientContext>::value, "");
static_assert(std::is_default_constructible<SSLClientContext>::value, "");
static_assert(std::is_default_constructible<SSLServerContext>::value, "");
static_assert(sizeof(SSLContext) == 2 * sizeof(void*), "one member beside the table of virtual functions");
static_assert(std::is_aggregate<SSLCredentials>::value, "");

// --- a new context

TEST(SSLContextNew, HasItsOperationsInOrder)
{
    EXPECT_EQ(Probe::placeOfAllocateConnection(), 0U);
    EXPECT_EQ(Probe::placeOfSetRootCA(), 1U);
}

template <typename Context>
class SSLContextNewOfEachSide : public testing::Test {};

using Sides = testing::Types<SSLClientContext, SSLServerContext>;
TYPED_TEST_SUITE(SSLContextNewOfEachSide, Sides, );

TYPED_TEST(SSLContextNewOfEachSide, DemandsAndVerifiesThePeersCertificate)
{
    TypeParam context;
    SSL_CTX* const handle = handleOf(context);
    EXPECT_EQ(SSL_CTX_get_verify_mode(handle), 3);
    EXPECT_EQ(SSL_CTX_get_verify_callback(handle), nullptr);
}

TYPED_TEST(SSLContextNewOfEachSide, LeavesNothingToNegotiate)
{
    TypeParam context;
    SSL_CTX* const handle = handleOf(context);
    EXPECT_EQ(SSL_CTX_get_options(handle) & 0x40024000U, 0x40024000U);
    EXPECT_EQ(SSL_CTX_get_min_proto_version(handle), 0x0304);
    EXPECT_EQ(SSL_CTX_get_max_proto_version(handle), 0);
}

TYPED_TEST(SSLContextNewOfEachSide, KeepsNoSessions)
{
    TypeParam context;
    SSL_CTX* const handle = handleOf(context);
    EXPECT_EQ(SSL_CTX_get_session_cache_mode(handle), 0);
    EXPECT_EQ(SSL_CTX_get_num_tickets(handle), 0U);
}

TYPED_TEST(SSLContextNewOfEachSide, WritesRecordByRecord)
{
    TypeParam context;
    EXPECT_EQ(SSL_CTX_get_mode(handleOf(context)) & SSL_MODE_ENABLE_PARTIAL_WRITE, SSL_MODE_ENABLE_PARTIAL_WRITE);
    EXPECT_EQ(SSL_CTX_get_mode(handleOf(context)) & SSL_MODE_ACCEPT_MOVING_WRITE_BUFFER, 0);
}

TYPED_TEST(SSLContextNewOfEachSide, LeavesTheSecurityLevelToOpenSSL)
{
    const SSL_CTX_PTR untouched(SSL_CTX_new(TLS_method()));
    TypeParam context;
    EXPECT_EQ(SSL_CTX_get_security_level(handleOf(context)), SSL_CTX_get_security_level(untouched.get()));
    EXPECT_EQ(SSL_get_security_level(context.allocateConnection().get()), SSL_CTX_get_security_level(untouched.get()));
}

TYPED_TEST(SSLContextNewOfEachSide, TrustsAndPresentsNothing)
{
    TypeParam context;
    SSL_CTX* const handle = handleOf(context);
    EXPECT_EQ(anchorsOf(handle), 0U);
    EXPECT_EQ(SSL_CTX_get0_certificate(handle), nullptr);
    EXPECT_EQ(SSL_CTX_get0_privatekey(handle), nullptr);
    EXPECT_THAT(namesIn(SSL_CTX_get_client_CA_list(handle)), IsEmpty());
}

TYPED_TEST(SSLContextNewOfEachSide, TakesItsStepsInOrder)
{
    const OpenSSLCalls watch;
    TypeParam context;
    EXPECT_THAT(watch.calls(), ElementsAre("SSL_CTX_new()", "SSL_CTX_set_verify(3)", "SSL_CTX_set_options(1073889280)",
                                           "SSL_CTX_ctrl(44, 0)", // session cache mode
                                           "SSL_CTX_set_num_tickets(0)",
                                           "SSL_CTX_ctrl(123, 772)", // minimum protocol version
                                           "SSL_CTX_ctrl(33, 1)"));  // mode
}

TYPED_TEST(SSLContextNewOfEachSide, ReportsEveryFailure)
{
    EXPECT_EQ(expectEveryFailureIsReported([] { TypeParam context; }, {"SSL_CTX_set_verify", "SSL_CTX_set_options",
                                                                       "SSL_CTX_ctrl(44, 0)", "SSL_CTX_ctrl(33, 1)"}),
              3U);
}

TYPED_TEST(SSLContextNewOfEachSide, IgnoresTheResultOfSettingTheMode)
{
    OpenSSLCalls watch;
    watch.failCall(6);
    TypeParam context;
    EXPECT_EQ(watch.calls().back(), "SSL_CTX_ctrl(33, 1)");
    EXPECT_TRUE(watch.hasFailed());
    ERR_clear_error(); // the one that the failure left
}

// --- connections

TEST(SSLContextConnections, OfAClientAreInConnectState)
{
    SSLClientContext context;
    const SSL_PTR connection = context.allocateConnection();
    ASSERT_NE(connection, nullptr);
    EXPECT_EQ(SSL_is_server(connection.get()), 0);
    EXPECT_EQ(SSL_in_before(connection.get()), 1);
    EXPECT_EQ(SSL_get_verify_mode(connection.get()), 3);
}

TEST(SSLContextConnections, OfAServerAreInAcceptState)
{
    SSLServerContext context;
    const SSL_PTR connection = context.allocateConnection();
    ASSERT_NE(connection, nullptr);
    EXPECT_EQ(SSL_is_server(connection.get()), 1);
    EXPECT_EQ(SSL_in_before(connection.get()), 1);
}

TEST(SSLContextConnections, TakeTheirStepsInOrder)
{
    SSLClientContext client;
    SSLServerContext server;
    const OpenSSLCalls watch;
    client.allocateConnection();
    server.allocateConnection();
    EXPECT_THAT(watch.calls(),
                ElementsAre("SSL_new()", "SSL_set_connect_state()", "SSL_new()", "SSL_set_accept_state()"));
}

TEST(SSLContextConnections, AreNewEachTime)
{
    SSLClientContext context;
    const SSL_PTR first = context.allocateConnection();
    const SSL_PTR second = context.allocateConnection();
    EXPECT_NE(first, second);
    EXPECT_EQ(SSL_get_SSL_CTX(first.get()), SSL_get_SSL_CTX(second.get()));
}

TEST(SSLContextConnections, OutliveTheirContext)
{
    std::unique_ptr<SSLClientContext> client = clientContext();
    std::unique_ptr<SSLServerContext> server = serverContext();
    SSL_PTR clientConnection = client->allocateConnection();
    SSL_PTR serverConnection = server->allocateConnection();
    client.reset();
    server.reset();
    EXPECT_TRUE(connect(std::move(clientConnection), std::move(serverConnection)).bothDone());
}

TEST(SSLContextConnections, HaveNoRoleWithoutAnOverride)
{
    Probe probe;
    const OpenSSLCalls watch;
    EXPECT_NE(probe.allocateConnection(), nullptr);
    EXPECT_THAT(watch.calls(), ElementsAre("SSL_new()"));
}

TEST(SSLContextConnections, ReportEveryFailure)
{
    SSLClientContext client;
    SSLServerContext server;
    EXPECT_EQ(expectEveryFailureIsReported([&] { client.allocateConnection(); }, {"SSL_set_connect_state"}), 1U);
    EXPECT_EQ(expectEveryFailureIsReported([&] { server.allocateConnection(); }, {"SSL_set_accept_state"}), 1U);
}

TEST(SSLContextConnections, AreAllocatedByManyThreads)
{
    constexpr int kThreads = 4;
    constexpr int kConnections = 50;
    const std::unique_ptr<SSLServerContext> context = serverContext();
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i)
        threads.emplace_back([&] {
            for (int n = 0; n < kConnections; ++n)
                EXPECT_EQ(SSL_is_server(context->allocateConnection().get()), 1);
        });
    for (std::thread& thread : threads)
        thread.join();
}

} // namespace
} // namespace qel
