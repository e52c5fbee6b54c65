#pragma once

#include <benchmark/benchmark.h>
#include <cstddef>
#include <functional>
#include <string>
#include <vector>

namespace qel::bench {

/// One piece of work that several contestants do: ours, the floor under it, and peers. All of them run in one process,
/// their rounds interleaved, and are compared by the medians of the rounds.
class Contest {
public:
    using Body = std::function<void(benchmark::State&)>;

    /// Somebody we are held against, and the most that our time may be of theirs (0: only reported).
    struct Rival {
        std::string name;
        double atMost;
    };

    explicit Contest(std::string work);

    /// Our own way of doing the work.
    Contest& ours(const Body& body);
    /// What it cannot be done without; it runs twice, so that the table shows what the machine can resolve.
    Contest& floor(const std::string& name, double atMost, const Body& body);
    /// Somebody else's way.
    Contest& peer(const std::string& name, double atMost, const Body& body);

    const std::string& work() const noexcept { return mWork; }
    const std::string& floorName() const noexcept { return mFloor; }
    const std::vector<Rival>& rivals() const noexcept { return mRivals; }

    /// The names under which contestants are registered.
    static std::string benchmarkName(const std::string& work, const std::string& contestant);
    static constexpr const char* kOurs = "ours";
    static constexpr const char* kAgain = " again";

private:
    void pRegister(const std::string& contestant, const Body& body);

    std::string mWork;
    std::string mFloor;
    std::vector<Rival> mRivals;
};

/// A new contest in the list of all; the reference stays valid until the process ends.
Contest& contest(const std::string& work);
const std::vector<Contest*>& contests();

/// The contests of each file.
void addFrameContests();
void addLoggingContests(const std::string& memoryFolder, const std::string& diskFolder);
void addTransportContests();
void addTlsContests();
void addBufferedContests();
void addConsoleContests();
void addQueueContests();

/// Keeps the calling thread, and those it starts from now on, on one core: work that is passed between threads is then
/// measured as the work it is, without the scheduler's choices.
void pinToOneCore();

} // namespace qel::bench
