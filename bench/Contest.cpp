#include "Contest.hpp"

#include <memory>
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
    benchmark::RegisterBenchmark(benchmarkName(mWork, contestant).c_str(), body)->UseRealTime();
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
