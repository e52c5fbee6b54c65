// What the server does when the system has nothing left.

#include <qel/common/QelDebug.hpp>
#include <qel/common/net/Listen.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/common/util/UniqueFd.hpp>
#include <qel/protocol/Error.hpp>

#include "protocol/server/ServerFixture.hpp"
#include "server/Listener.hpp"
#include "support/Allocations.hpp"
#include "support/ComesTrue.hpp"
#include "support/Loopback.hpp"

#include <fcntl.h>
#include <fstream>
#include <gmock/gmock.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/resource.h>
#include <thread>

namespace qel::test {

namespace {

using protocol::ServerOptions;
using ::testing::AllOf;
using ::testing::Contains;
using ::testing::HasSubstr;
using ::testing::StartsWith;

#ifdef QEL_SANITIZES_UNDEFINED
constexpr bool kNeedsDescriptors = true; // the sanitizer opens a pipe when it looks at an object for the first time
#else
constexpr bool kNeedsDescriptors = false;
#endif

/// Sets the limit on descriptors, which is that of poll(2) too, until it is destroyed.
class DescriptorLimit {
public:
    explicit DescriptorLimit(rlim_t limit)
    {
        ::getrlimit(RLIMIT_NOFILE, &mBefore);
        const rlimit lower{limit, mBefore.rlim_max};
        ::setrlimit(RLIMIT_NOFILE, &lower);
    }
    ~DescriptorLimit() { restore(); }
    DescriptorLimit(const DescriptorLimit&) = delete;
    DescriptorLimit& operator=(const DescriptorLimit&) = delete;

    void restore() { ::setrlimit(RLIMIT_NOFILE, &mBefore); }

private:
    rlimit mBefore{};
};

class ServerFailures : public ServerFixture {};

TEST_F(ServerFailures, AFailureOfTheMainLoopIsLoggedAndTheServerGoesOn)
{
    if (kNeedsDescriptors) GTEST_SKIP() << "the sanitizer needs descriptors of its own";
    make(plainOptions());
    DescriptorLimit limit(1); // poll() fails for more than one descriptor
    QelLogger::get().addBackend(std::make_shared<OnLine>("the server: ", [&] { limit.restore(); }));
    run();
    EXPECT_TRUE(comesTrue([&] { return !log.lines().empty(); }));
    EXPECT_THAT(log.lines(), Contains(StartsWith("E: [qel] the server: ")));
    const auto console = connect();
    EXPECT_EQ(introduce(*console, "x"), 0U);
}

/// Gives the memory back to the thread that reads the time for the fifth time. The main loop reads it in each round.
class MemoryComesBack : public TimeProvider {
public:
    explicit MemoryComesBack(Allocations& allocations) : mAllocations(allocations), mThread(std::this_thread::get_id())
    {
        pRegister();
    }

    int rounds() const { return mReads; }

private:
    std::chrono::system_clock::time_point pSystem() override { return std::chrono::system_clock::now(); }
    std::chrono::steady_clock::time_point pSteady() override
    {
        if (std::this_thread::get_id() == mThread && ++mReads == 5) mAllocations.succeedAgain();
        return std::chrono::steady_clock::now();
    }

    Allocations& mAllocations;
    const std::thread::id mThread;
    int mReads = 0;
};

TEST_F(ServerFailures, AWantOfMemoryInTheMainLoopIsSurvived)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    make(plainOptions());
    stop();
    QelDebug::globals().resetLoggers(); // the back-end of the test allocates
    Allocations allocations;
    const MemoryComesBack clock(allocations);
    allocations.failAll();
    server->run(stopFd()); // without memory it does not see that it is to stop
    EXPECT_GE(clock.rounds(), 5);
}

TEST_F(ServerFailures, AConnectionThatCannotBeAcceptedIsAcceptedLater)
{
    if (kNeedsDescriptors) GTEST_SKIP() << "the sanitizer needs descriptors of its own";
    make(plainOptions());
    const auto waiting = connect(); // by the system, before the limit
    std::unique_ptr<DescriptorLimit> limit;
    {
        const int lowest = ::dup(0);
        ::close(lowest);
        limit = std::make_unique<DescriptorLimit>(static_cast<rlim_t>(lowest));
    }
    QelLogger::get().addBackend(std::make_shared<OnLine>("cannot accept a connection: ", [&] { limit->restore(); }));
    run();
    EXPECT_EQ(introduce(*waiting, "x"), 0U); // a second later
    EXPECT_THAT(log.lines(), Contains(AllOf(StartsWith("E: [qel] cannot accept a connection: "), HasSubstr("24"))));
}

TEST(Listener, ItsBacklogIsAsLargeAsTheSystemAllows)
{
    const protocol::Listener listener({IPEndpoint("127.0.0.1:0")});
    PollSet set;
    listener.addTo(set);
    const PollResult result = set.poll();
    ASSERT_EQ(result.getResults().size(), 1U);
    tcp_info info{};
    socklen_t length = sizeof(info);
    ASSERT_EQ(::getsockopt(result.getResults()[0].mFd.fd, IPPROTO_TCP, TCP_INFO, &info, &length), 0);
    unsigned int most = 0;
    std::ifstream("/proc/sys/net/core/somaxconn") >> most;
    EXPECT_GT(most, 64U);
    EXPECT_EQ(info.tcpi_sacked, most); // of a listening socket: the backlog
}

TEST(Listener, ListensOnSocketsOfOthersAsWell)
{
    const Socket other = makeListener();
    protocol::Listener listener({IPEndpoint("127.0.0.1:0")}, {other.getFd()});
    ASSERT_EQ(listener.endpoints().size(), 2U);
    EXPECT_EQ(listener.endpoints()[1], other.getSocketName());
    EXPECT_NE(other.getFlags() & O_NONBLOCK, 0);
    Socket client(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0);
    client.connect(other.getSocketName(), Loopback::kDeadline);
    PollSet set;
    listener.addTo(set);
    const std::optional<Socket> accepted = listener.accept(set.wait(Loopback::kDeadline));
    ASSERT_TRUE(accepted);
    EXPECT_EQ(accepted->getPeerName(), client.getSocketName());
}

TEST(Listener, RefusesWhatIsNotAListeningSocketOfTcp)
{
    const auto refusalOf = [](int descriptor) {
        try {
            const protocol::Listener listener({}, {descriptor});
            return std::string("none");
        } catch (const protocol::CannotListen& error) {
            return std::string(error.what());
        }
    };
    const Socket silent(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0);
    const Socket datagrams(IPFamily::IPv4, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    const Socket local(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const UniqueFd null(::open("/dev/null", O_RDWR | O_CLOEXEC));
    const auto prefix = [](int descriptor) {
        return "cannot listen on descriptor " + std::to_string(descriptor) + ": ";
    };
    EXPECT_EQ(refusalOf(silent.getFd()), prefix(silent.getFd()) + "it does not listen");
    EXPECT_EQ(refusalOf(datagrams.getFd()), prefix(datagrams.getFd()) + "it is not a TCP socket");
    EXPECT_EQ(refusalOf(local.getFd()), prefix(local.getFd()) + "it is not a TCP socket");
    EXPECT_THAT(refusalOf(null.get()), StartsWith(prefix(null.get()) + "getsockopt"));
    EXPECT_THAT(refusalOf(-1), StartsWith(prefix(-1) + "getsockopt"));
}

TEST(Listener, APlainServerRefusesASocketThatIsNotOfALoopbackAddress)
{
    const Socket everywhere = listenOn(IPEndpoint("0.0.0.0:0"), 1);
    protocol::Hypervisor machine;
    protocol::ServerOptions options;
    options.plain = true;
    options.listen.clear();
    options.sockets = {everywhere.getFd()};
    EXPECT_THAT([&] { protocol::Server(machine, options); },
                ::testing::ThrowsMessage<std::invalid_argument>("plain: for loopback addresses only"));
}

} // namespace

} // namespace qel::test
