#include <qel/common/net/IPConnectionInfo.hpp>

#include <gtest/gtest.h>
#include <sstream>

namespace qel {
namespace {

TEST(IPConnectionInfo, HoldsBothEndpoints)
{
    const IPEndpoint client("10.0.0.2:40000");
    const IPEndpoint server("[::1]:443");
    const IPConnectionInfo connection(client, server);
    EXPECT_EQ(connection.getClient(), client);
    EXPECT_EQ(connection.getServer(), server);
}

TEST(IPConnectionInfo, PrintsClientThenServer)
{
    std::ostringstream os;
    os << IPConnectionInfo(IPEndpoint("10.0.0.2:40000"), IPEndpoint("10.0.0.1:80"));
    EXPECT_EQ(os.str(), "[10.0.0.2:40000 -> 10.0.0.1:80]");
}

TEST(IPConnectionInfo, PrintsIPv6EndpointsInBrackets)
{
    std::ostringstream os;
    os << IPConnectionInfo(IPEndpoint("[fe80::2]:40000"), IPEndpoint("[::1]:80"));
    EXPECT_EQ(os.str(), "[[fe80::2]:40000 -> [::1]:80]");
}

} // namespace
} // namespace qel
