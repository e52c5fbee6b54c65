#include <qel/protocol/Error.hpp>
#include <qel/protocol/Hypervisor.hpp>
#include <qel/protocol/Server.hpp>

#include "server/CheckedOptions.hpp"
#include "support/Authority.hpp"

#include <functional>
#include <gmock/gmock.h>
#include <stdexcept>
#include <vector>

namespace qel::test {

namespace {

using protocol::checkOptions;
using protocol::ServerOptions;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::SizeIs;
using ::testing::StartsWith;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

constexpr std::chrono::milliseconds kDay = std::chrono::hours(24);

ServerOptions plainOptions()
{
    ServerOptions options;
    options.plain = true;
    return options;
}

ServerOptions tlsOptions()
{
    ServerOptions options;
    options.credentials = protocol::Credentials::fromTexts(Authority::trusted().serverCredentials());
    return options;
}

struct Case {
    const char* name;
    std::function<void(ServerOptions&)> change;
    const char* refusal; ///< null: accepted
};

TEST(ServerOptions, EachLimitIsCheckedAtBothSides)
{
    using std::chrono::milliseconds;
    using std::chrono::seconds;
    const std::vector<Case> cases{
        {"defaults", [](ServerOptions&) {}, nullptr},
        {"no console", [](ServerOptions& o) { o.maxConsoles = 0; }, "maxConsoles: at least 1"},
        {"one console", [](ServerOptions& o) { o.maxConsoles = 1; }, nullptr},
        {"no handshake", [](ServerOptions& o) { o.maxHandshakes = 0; }, "maxHandshakes: at least 1"},
        {"one handshake", [](ServerOptions& o) { o.maxHandshakes = 1; }, nullptr},
        {"none of an address", [](ServerOptions& o) { o.maxHandshakesPerAddress = 0; },
         "maxHandshakesPerAddress: at least 1"},
        {"one of an address", [](ServerOptions& o) { o.maxHandshakesPerAddress = 1; }, nullptr},
        {"no queue", [](ServerOptions& o) { o.queueBytes = 0; }, "queueBytes: at least 1"},
        {"a queue of a byte", [](ServerOptions& o) { o.queueBytes = 1; }, nullptr},
        {"no handshake time", [](ServerOptions& o) { o.handshakeTimeout = milliseconds(0); },
         "handshakeTimeout: more than 0"},
        {"short handshake time", [](ServerOptions& o) { o.handshakeTimeout = milliseconds(1); }, nullptr},
        {"long handshake time", [](ServerOptions& o) { o.handshakeTimeout = kDay; }, nullptr},
        {"too long handshake time", [](ServerOptions& o) { o.handshakeTimeout = kDay + milliseconds(1); },
         "handshakeTimeout: at most 24 hours"},
        {"no frame time", [](ServerOptions& o) { o.frameTimeout = milliseconds(0); }, "frameTimeout: more than 0"},
        {"short frame time", [](ServerOptions& o) { o.frameTimeout = milliseconds(1); }, nullptr},
        {"long frame time", [](ServerOptions& o) { o.frameTimeout = kDay; }, nullptr},
        {"too long frame time", [](ServerOptions& o) { o.frameTimeout = kDay + milliseconds(1); },
         "frameTimeout: at most 24 hours"},
        {"no keep-alive", [](ServerOptions& o) { o.keepAlive = seconds(0); }, "keepAlive: 1 to 32767 seconds"},
        {"short keep-alive", [](ServerOptions& o) { o.keepAlive = seconds(1); }, nullptr},
        {"long keep-alive", [](ServerOptions& o) { o.keepAlive = seconds(32767); }, nullptr},
        {"too long", [](ServerOptions& o) { o.keepAlive = seconds(32768); }, "keepAlive: 1 to 32767 seconds"},
        {"negative idle time", [](ServerOptions& o) { o.idleTimeout = seconds(-1); }, "idleTimeout: 0 to 24 hours"},
        {"long idle time", [](ServerOptions& o) { o.idleTimeout = std::chrono::hours(24); }, nullptr},
        {"too long idle time", [](ServerOptions& o) { o.idleTimeout = seconds(24 * 60 * 60 + 1); },
         "idleTimeout: 0 to 24 hours"},
        {"negative linger", [](ServerOptions& o) { o.linger = milliseconds(-1); }, "linger: 0 or more"},
        {"no linger", [](ServerOptions& o) { o.linger = milliseconds(0); }, nullptr},
        {"long linger", [](ServerOptions& o) { o.linger = kDay; }, nullptr},
        {"too long linger", [](ServerOptions& o) { o.linger = kDay + milliseconds(1); }, "linger: at most 24 hours"},
        {"not an endpoint", [](ServerOptions& o) { o.listen = {"127.0.0.1"}; },
         "listen: \"127.0.0.1\" is not an IP address and port"},
        {"a name", [](ServerOptions& o) { o.listen = {"localhost:1"}; },
         "listen: \"localhost:1\" is not an IP address and port"},
        {"not loopback",
         [](ServerOptions& o) {
             o.listen = {"127.0.0.1:0", "0.0.0.0:0"};
         },
         "plain: for loopback addresses only"},
        {"with pins", [](ServerOptions& o) { o.pins.names = {"x"}; },
         "pins: plain connections have no certificate to compare with"},
        {"with fingerprints", [](ServerOptions& o) { o.pins.fingerprints = {"x"}; },
         "pins: plain connections have no certificate to compare with"},
        {"not plain", [](ServerOptions& o) { o.plain = false; },
         "credentials: give credentials, or ask for plain connections"},
    };
    for (const Case& entry : cases) {
        SCOPED_TRACE(entry.name);
        ServerOptions options = plainOptions();
        entry.change(options);
        if (entry.refusal == nullptr) {
            EXPECT_THAT(checkOptions(options), SizeIs(1));
        } else {
            EXPECT_THAT([&] { checkOptions(options); }, ThrowsMessage<std::invalid_argument>(StrEq(entry.refusal)));
        }
    }
}

TEST(ServerOptions, WithCredentialsAnyAddressMayBeListenedOn)
{
    ServerOptions options = tlsOptions();
    options.listen = {"0.0.0.0:1", "[::]:2"};
    options.pins.names = {"x"};
    EXPECT_THAT(checkOptions(options), ElementsAre(IPEndpoint("0.0.0.0:1"), IPEndpoint("[::]:2")));
    options.plain = true;
    EXPECT_THAT([&] { checkOptions(options); },
                ThrowsMessage<std::invalid_argument>(StrEq("plain: connections with credentials are not plain")));
}

TEST(ServerOptions, NowhereToListenIsAllowed)
{
    ServerOptions options = plainOptions();
    options.listen = {};
    EXPECT_THAT(checkOptions(options), IsEmpty());
}

TEST(ServerOptions, AServerChecksItsOptions)
{
    protocol::Hypervisor machine;
    ServerOptions options = plainOptions();
    options.maxHandshakes = 0;
    EXPECT_THAT([&] { protocol::Server(machine, options); },
                ThrowsMessage<std::invalid_argument>(HasSubstr("maxHandshakes")));
    options.maxHandshakes = 1;
    EXPECT_NO_THROW(protocol::Server(machine, options)); // the machine is free
}

TEST(ServerOptions, AnEndpointThatIsTakenCannotBeListenedOn)
{
    protocol::Hypervisor machine;
    protocol::Server first(machine, plainOptions());
    const std::string taken = first.endpoints().front().str();
    protocol::Hypervisor other;
    ServerOptions options = plainOptions();
    options.listen = {"127.0.0.1:0", taken};
    EXPECT_THAT([&] { protocol::Server(other, options); },
                ThrowsMessage<protocol::CannotListen>(StartsWith("cannot listen on " + taken + ": ")));
}

} // namespace

} // namespace qel::test
