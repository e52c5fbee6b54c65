#include "hypervisor/ChildReaper.hpp"
#include "protocol/hypervisor/PtyFixture.hpp"
#include "support/TemporaryDirectory.hpp"

#include <cerrno>
#include <csignal>
#include <fstream>
#include <thread>

namespace qel::test {

namespace {

using protocol::ChildReaper;
using protocol::PtyPort;

using ChildReaperTest = PtyFixture;

bool exists(pid_t pid) { return ::kill(pid, 0) == 0 || errno != ESRCH; }

TEST_F(ChildReaperTest, HasNothingToDoWithoutChildren)
{
    EXPECT_FALSE(reaper.reap());
    reaper.finish();
}

TEST_F(ChildReaperTest, SendsSighupAndDoesNotKillWithinTheGracePeriod)
{
    const TemporaryDirectory directory;
    const std::string file = directory.file("asked");
    ChildReaper patient(std::chrono::hours(1));
    PtyPort port("trap 'echo > " + file + "; exit' HUP; echo ready; while :; do sleep 0.01; done", patient);
    port.start();
    readUntil(port, "ready");
    port.stop();
    patient.finish();
    EXPECT_TRUE(std::ifstream(file).good());
}

TEST_F(ChildReaperTest, ACommandThatIgnoresSighupIsKilled)
{
    PtyPort port("trap '' HUP; echo pid=$$; sleep 1000; sleep 1000", reaper);
    port.start();
    const pid_t pid = pidIn(readUntil(port, "\n"));
    port.stop();
    EXPECT_TRUE(exists(pid));
    EXPECT_TRUE(reaper.reap());
    reaper.finish();
    EXPECT_FALSE(exists(pid));
    EXPECT_FALSE(reaper.reap());
}

TEST_F(ChildReaperTest, TheWholeGroupIsKilled)
{
    PtyPort port("trap '' HUP; sh -c 'echo pid=$$; exec sleep 1000'; true", reaper);
    port.start();
    const pid_t inner = pidIn(readUntil(port, "\n"));
    port.stop();
    reaper.finish();
    for (int i = 0; i < 2000 && exists(inner); ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    EXPECT_FALSE(exists(inner));
}

TEST_F(ChildReaperTest, AStoppedCommandIsEnded)
{
    PtyPort port("echo pid=$$; kill -STOP $$", reaper);
    port.start();
    const pid_t pid = pidIn(readUntil(port, "\n"));
    port.stop();
    reaper.finish();
    EXPECT_FALSE(exists(pid));
}

TEST_F(ChildReaperTest, DestroyingTheLineEndsItsCommand)
{
    pid_t pid = -1;
    {
        PtyPort port("echo pid=$$; cat", reaper);
        port.start();
        pid = pidIn(readUntil(port, "\n"));
    }
    reaper.finish();
    EXPECT_FALSE(exists(pid));
}

} // namespace

} // namespace qel::test
