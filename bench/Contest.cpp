#include "Contest.hpp"

#include <memory>
#include <random>
#include <sched.h>
#include <utility>

namespace qel::bench {

namespace {

std::vector<std::unique_ptr<Contest>>& owned()
{
    static std::vector<std::unique_ptr<Contest>> all;
    return all;
}

std::vector<Contest*>& listed()
{
    static std::vector<Contest*> all;
    return all;
}

/// Blocks that shift what is allocated while they live, each time by another amount. Where a block of a hundred bytes
/// lies across the border of two pages, each copy into it takes half as long again; which contestant gets such a block
/// is the luck of the heap, so it has to be another one in each round.
class ShiftedHeap {
public:
    ShiftedHeap()
    {
        static std::minstd_rand sRandom;
        constexpr std::size_t kCached = 8; // more blocks than the C library keeps ready
        constexpr std::size_t kMost = 64;
        constexpr std::size_t kBytes = 100;
        const std::size_t count = kCached + sRandom() % (kMost - kCached);
        for (std::size_t i = 0; i < count; ++i)
            mBlocks.push_back(std::make_unique<char[]>(kBytes));
    }

private:
    std::vector<std::unique_ptr<char[]>> mBlocks;
};

} // namespace

Contest::Contest(std::string work) : mWork(std::move(work)) {}

std::string Contest::benchmarkName(const std::string& work, const std::string& contestant)
{
    return work + " | " + contestant;
}

Contest& Contest::ours(const Body& body)
{
    pRegister(kOurs, body);
    return *this;
}

Contest& Contest::floor(const std::string& name, double atMost, const Body& body)
{
    mFloor = name;
    mRivals.push_back({name, atMost});
    pRegister(name, body);
    pRegister(name + kAgain, body);
    return *this;
}

Contest& Contest::peer(const std::string& name, double atMost, const Body& body)
{
    mRivals.push_back({name, atMost});
    pRegister(name, body);
    return *this;
}

void Contest::pRegister(const std::string& contestant, const Body& body)
{
    const auto shifted = [body](benchmark::State& state) {
        const ShiftedHeap heap;
        body(state);
    };
    benchmark::RegisterBenchmark(benchmarkName(mWork, contestant).c_str(), shifted)->UseRealTime();
}

Contest& contest(const std::string& work)
{
    owned().push_back(std::make_unique<Contest>(work));
    listed().push_back(owned().back().get());
    return *owned().back();
}

const std::vector<Contest*>& contests() { return listed(); }

void pinToOneCore()
{
    cpu_set_t allowed;
    CPU_ZERO(&allowed);
    if (::sched_getaffinity(0, sizeof(allowed), &allowed) != 0) return;
    // The last one: the first serves most of the machine's interrupts.
    for (int core = CPU_SETSIZE - 1; core >= 0; --core) {
        if (!CPU_ISSET(core, &allowed)) continue;
        cpu_set_t one;
        CPU_ZERO(&one);
        CPU_SET(core, &one);
        ::sched_setaffinity(0, sizeof(one), &one);
        return;
    }
}

} // namespace qel::bench
