#include "hypervisor/ChildReaper.hpp"
#include "protocol/hypervisor/PtyFixture.hpp"
#include "support/ComesTrue.hpp"
#include "support/SettableClock.hpp"
#include "support/TemporaryDirectory.hpp"

#include <cerrno>
#include <csignal>
#include <fstream>
#include <thread>

namespace qel::test {

namespace {

using protocol::ChildReaper;
using protocol::PtyPort;

class ChildReaperTest : public PtyFixture {
protected:
    /// Hands a reaper a command that takes no notice of SIGHUP. @return the number of its process
    static pid_t ignoreSighup(ChildReaper& reaper)
    {
        PtyPort port("trap '' HUP; echo pid=$$; sleep 1000; sleep 1000",
                     std::shared_ptr<ChildReaper>(std::shared_ptr<ChildReaper>(), &reaper));
        port.start(kPartition);
        const pid_t pid = pidIn(readUntil(port, "\n"));
        port.stop();
        return pid;
    }
};

constexpr std::chrono::hours kGrace(1);

bool exists(pid_t pid) { return ::kill(pid, 0) == 0 || errno != ESRCH; }

TEST_F(ChildReaperTest, HasNothingToDoWithoutChildren)
{
    EXPECT_FALSE(reaper->reap());
    reaper->finish();
}

TEST_F(ChildReaperTest, SendsSighupAndDoesNotKillWithinTheGracePeriod)
{
    const TemporaryDirectory directory;
    const std::string file = directory.file("asked");
    const auto patient = std::make_shared<ChildReaper>(std::chrono::hours(1));
    PtyPort port("trap 'echo > " + file + "; exit' HUP; echo ready; while :; do sleep 0.01; done", patient);
    port.start(kPartition);
    readUntil(port, "ready");
    port.stop();
    patient->finish();
    EXPECT_TRUE(std::ifstream(file).good());
}

TEST_F(ChildReaperTest, ACommandThatIgnoresSighupIsKilledAfterTheGracePeriod)
{
    SettableClock clock; // before the reaper, whose thread reads it
    ChildReaper patient(kGrace);
    const pid_t pid = ignoreSighup(patient);
    clock.advance(kGrace - std::chrono::nanoseconds(1));
    EXPECT_TRUE(patient.reap());
    EXPECT_TRUE(exists(pid));
    clock.advance(std::chrono::nanoseconds(1));
    patient.finish();
    EXPECT_FALSE(exists(pid));
    EXPECT_FALSE(patient.reap());
}

TEST_F(ChildReaperTest, ReapsWithoutFurtherCalls)
{
    for (int i = 0; i < 2; ++i) { // the second one comes after the thread for the first one has ended
        SCOPED_TRACE(i);
        const pid_t pid = ignoreSighup(*reaper);
        EXPECT_TRUE(comesTrue([pid] { return !exists(pid); }));
    }
}

TEST_F(ChildReaperTest, IsDestroyedWhenItsCommandsHaveEnded)
{
    pid_t pid = -1;
    {
        ChildReaper brief(std::chrono::milliseconds(1));
        pid = ignoreSighup(brief);
    }
    EXPECT_FALSE(exists(pid));
}

TEST_F(ChildReaperTest, TheWholeGroupIsKilled)
{
    PtyPort port("trap '' HUP; sh -c 'echo pid=$$; exec sleep 1000'; true", reaper);
    port.start(kPartition);
    const pid_t inner = pidIn(readUntil(port, "\n"));
    port.stop();
    reaper->finish();
    for (int i = 0; i < 2000 && exists(inner); ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    EXPECT_FALSE(exists(inner));
}

TEST_F(ChildReaperTest, AStoppedCommandIsEnded)
{
    PtyPort port("echo pid=$$; kill -STOP $$", reaper);
    port.start(kPartition);
    const pid_t pid = pidIn(readUntil(port, "\n"));
    port.stop();
    reaper->finish();
    EXPECT_FALSE(exists(pid));
}

TEST_F(ChildReaperTest, DestroyingTheLineEndsItsCommand)
{
    pid_t pid = -1;
    {
        PtyPort port("echo pid=$$; cat", reaper);
        port.start(kPartition);
        pid = pidIn(readUntil(port, "\n"));
    }
    reaper->finish();
    EXPECT_FALSE(exists(pid));
}

} // namespace

} // namespace qel::test
