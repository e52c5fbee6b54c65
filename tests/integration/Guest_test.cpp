// A Linux guest in a virtual machine, whose serial port is the line of a partition: the whole way from a person's
// keyboard through TLS to a login of the guest. script/test guest runs this.

#include "integration/FarSides.hpp"
#include "integration/TlsTest.hpp"
#include "support/PtyProcess.hpp"

#include <csignal>
#include <cstdlib>
#include <fstream>
#include <gmock/gmock.h>
#include <iterator>
#include <memory>
#include <string>
#include <vector>

namespace qel::test {

namespace {

using ::testing::HasSubstr;

/// The folder with vmlinuz and initrd.gz.
std::string guestFolder()
{
    const char* const folder = std::getenv("QEL_GUEST");
    return folder == nullptr ? "" : folder;
}

/// A guest that boots when its serial port is connected, so that nothing of it is missed.
std::unique_ptr<Process> boot(const std::string& socket)
{
    const std::string folder = guestFolder();
    return std::make_unique<Process>(
        std::vector<std::string>{pathOfProgram("qemu-system-x86_64"), "-m", "256", "-kernel", folder + "/vmlinuz",
                                 "-initrd", folder + "/initrd.gz", "-append", "console=ttyS0 quiet", "-display", "none",
                                 "-no-reboot", "-monitor", "none", "-serial", "unix:" + socket + ",server=on,wait=on"});
}

class Guest : public Tls {
protected:
    void SetUp() override
    {
        if (guestFolder().empty()) GTEST_SKIP() << "QEL_GUEST does not name a guest: script/test guest runs this";
        ASSERT_NE(pathOfProgram("qemu-system-x86_64"), "");
    }

    std::vector<std::string> consoleCommand(const ServeProcess& server, const Arguments& more) const
    {
        return qelCommand(Arguments{"console", "--connect", server.endpoint()} + directory.options("client") + more);
    }

    /// Logs in at the prompt that is on the screen.
    static void logIn(PtyProcess& person)
    {
        person.await("guest login: ");
        person.type("root\r");
        person.await("/root # ");
    }

    TemporaryDirectory mRuntime;
    const std::string mSocket = mRuntime.file("guest.sock");
};

TEST_F(Guest, APersonLogsInWatchesAndFindsTheGuestAgainAfterItWasKilled)
{
    auto guest = boot(mSocket);
    guest->awaitErrors("waiting for connection");
    const auto server = serve({"--partition", "1=unix:" + mSocket, "--line-log", mRuntime.path()});
    PtyProcess person(consoleCommand(*server, {"1"}));
    person.await("guest: Linux ");
    logIn(person);
    person.type("echo $((6 * 7)) from $(hostname)\r");
    person.await("42 from guest");

    PtyProcess watcher(consoleCommand(*server, {"1", "--watch"}));
    watcher.await("guest: Linux "); // the messages of the boot are kept
    watcher.await("42 from guest");
    person.type("echo seen by $((1 + 1))\r");
    watcher.await("seen by 2");

    guest->signal(SIGKILL);
    person.await("[qel: line lost: the peer has closed the connection; connecting again]");
    guest.reset();
    guest = boot(mSocket);
    person.await("[qel: line is back]");
    watcher.await("[qel: line is back]");
    person.await("guest: Linux ");
    logIn(person);
    person.type("\r~.");
    EXPECT_EQ(person.wait().exitStatus, 0);

    const auto command = run(consoleCommand(*server, {"1", "--exec", "echo $((6 * 7)); exit 3"}));
    EXPECT_EQ(command.output, "42\n");
    EXPECT_EQ(command.exitStatus, 3);
    const auto last = run(
        consoleCommand(*server, {"1", "--send", "poweroff\\r", "--expect", "reboot: Power down", "--timeout", "60"}));
    EXPECT_EQ(last.exitStatus, 0) << last.errors;
    watcher.await("reboot: Power down");
    watcher.await("[qel: line lost: the peer has closed the connection; connecting again]");
    EXPECT_EQ(guest->wait().exitStatus, 0);

    watcher.type("~.");
    EXPECT_EQ(watcher.wait().exitStatus, 0);
    EXPECT_THAT(server->stop().errors, HasSubstr("partition 1: line is back"));

    std::ifstream log(mRuntime.file("partition-1.log"));
    const std::string logged{std::istreambuf_iterator<char>(log), std::istreambuf_iterator<char>()};
    const std::string boot = "Z guest: Linux ";
    EXPECT_THAT(logged, HasSubstr(boot)) << "the messages of the first boot";
    EXPECT_NE(logged.find(boot), logged.rfind(boot)) << "and of the second";
    EXPECT_THAT(logged, HasSubstr("Z 42 from guest"));
}

} // namespace

} // namespace qel::test
