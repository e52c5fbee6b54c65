#include "support/Interleavings.hpp"

#include "support/Fiber.hpp"

#include <algorithm>
#include <map>
#include <stdexcept>
#include <unordered_set>

namespace qel::test {

namespace {

using Operation = Interleavings::Operation;
using Fault = Interleavings::Fault;

constexpr std::size_t kNone = static_cast<std::size_t>(-1);

const char* const kOperations[] = {"goes on", "locks", "unlocks", "sleeps", "notifies one", "notifies all"};

struct Object {
    std::size_t number = 0; // in the order of construction
    const char* kind = "";
    std::size_t owner = kNone; // of a mutex
};

struct Thread {
    Operation next = Operation::Step;
    const void* object = nullptr; // of the next operation
    const void* mutex = nullptr;  // that a sleeping thread takes again
    bool ended = false;
    bool timed = false;
    bool woken = false;
    bool timedOut = false;
    std::uint64_t past = 0x9E3779B97F4A7C15U; // hash of what determines its steps, since here()
    std::uint64_t place = 0;                  // of the last here()
    std::vector<const void*> notified;
    std::vector<const void*> notifiedAll;
};

/// A possible next step: a thread, and an alternative of its operation.
struct Step {
    std::size_t thread;
    std::size_t alternative;
};

// The alternatives of a sleeping thread.
constexpr std::size_t kWake = 0;
constexpr std::size_t kTimeOut = 1;
constexpr std::size_t kSpurious = 2;

/// A step that was taken.
struct PastStep {
    std::size_t thread;
    Operation operation;
    std::size_t object; // its number
    const char* kind;
    std::size_t alternative;
};

std::uint64_t mix(std::uint64_t hash, std::uint64_t value)
{
    // The finishing steps of the 64-bit MurmurHash3.
    hash ^= value + 0x9E3779B97F4A7C15U + (hash << 6) + (hash >> 2);
    hash ^= hash >> 33;
    hash *= 0xFF51AFD7ED558CCDU;
    hash ^= hash >> 33;
    hash *= 0xC4CEB9FE1A85EC53U;
    return hash ^ hash >> 33;
}

/// The current run of a program, and what all runs share.
class Explorer {
public:
    explicit Explorer(const Interleavings::Options& options) : mOptions(options) {}

    Interleavings::Result explore(const std::function<std::unique_ptr<Interleavings::Program>()>& make)
    {
        do {
            if (++mResult.runs > mOptions.maxRuns) {
                mResult.failure = "more runs than were allowed";
                break;
            }
            pRun(make);
        } while (mResult.failure.empty() && pNextDecisions());
        mResult.states = mVisited.size();
        return mResult;
    }

    // Called by running threads.

    void perform(Operation operation, const void* object)
    {
        if (!mRunning) return;
        Thread& self = pSelf();
        self.next = operation;
        self.object = object;
        mFibers[mCurrent]->suspend(); // another thread may run next
    }

    bool sleep(const void* condition, const void* mutex, bool timed)
    {
        if (!mRunning) return true;
        if (Object* const object = pObject(mutex)) pRelease(*object, mCurrent);
        Thread& self = pSelf();
        self.mutex = mutex;
        self.timed = timed;
        self.woken = false;
        self.timedOut = false;
        if (mOptions.sleepersForget) self.past = mix(self.place, pNumber(condition));
        perform(Operation::Sleep, condition);
        return !self.timedOut;
    }

    void create(const void* object, const char* kind)
    {
        Object& created = mObjects[object];
        created = Object();
        created.number = mCreated++;
        created.kind = kind;
    }

    void destroy(const void* object)
    {
        const auto found = mObjects.find(object);
        if (found == mObjects.end()) return;
        const std::string what = pName(object);
        if (mRunning) {
            if (found->second.owner != kNone) fail(what + " is destroyed while it is held");
            for (const Thread& thread : mThreads) {
                if (thread.ended || &thread == &mThreads[mCurrent]) continue;
                if (thread.object == object || thread.mutex == object) {
                    fail(what + " is destroyed while another thread is about to use it");
                }
            }
        }
        mObjects.erase(found);
    }

    void here(std::uint64_t place)
    {
        pSelf().past = place;
        pSelf().place = place;
        pSelf().timedOut = false;
        pSelf().notified.clear();
        pSelf().notifiedAll.clear();
    }

    void fail(const std::string& what)
    {
        if (mGivingUp || !mResult.failure.empty()) return;
        mResult.failure = what;
        for (const PastStep& past : mSteps) {
            mResult.story.push_back(
                "thread " + std::to_string(past.thread) + " " + kOperations[static_cast<std::size_t>(past.operation)] +
                (past.object == kNone ? "" : std::string(" ") + past.kind + " " + std::to_string(past.object)) + " (" +
                std::to_string(past.alternative) + ")");
        }
    }

    std::size_t current() const { return mCurrent; }
    const Thread& thread(std::size_t number) const { return mThreads.at(number); }

private:
    Thread& pSelf() { return mThreads[mCurrent]; }

    Object* pObject(const void* object)
    {
        const auto found = mObjects.find(object);
        if (found != mObjects.end()) return &found->second;
        fail("an object is used after its destruction");
        return nullptr;
    }

    std::string pName(const void* object) const
    {
        const auto found = mObjects.find(object);
        if (found == mObjects.end()) return "";
        return std::string(found->second.kind) + " " + std::to_string(found->second.number);
    }

    void pResume(std::size_t thread)
    {
        mCurrent = thread;
        mFibers[thread]->resume();
        if (!mFibers[thread]->hasJob()) {
            mThreads[thread].ended = true;
            mThreads[thread].object = nullptr;
            mThreads[thread].mutex = nullptr;
            mThreads[thread].next = Operation::Step;
        }
        mCurrent = kNone;
    }

    void pRun(const std::function<std::unique_ptr<Interleavings::Program>()>& make)
    {
        mObjects.clear();
        mSteps.clear();
        mCreated = 0;
        mSpuriousLeft = mOptions.spuriousWakeups;
        mGivingUp = false;
        mDepth = 0;
        const std::unique_ptr<Interleavings::Program> program = make();

        mThreads.assign(program->threads.size(), Thread());
        while (mFibers.size() < mThreads.size())
            mFibers.push_back(std::make_unique<Fiber>());
        for (std::size_t i = 0; i < mThreads.size(); ++i)
            mFibers[i]->assign(program->threads[i]);

        mRunning = true;
        while (mResult.failure.empty() && pStep(*program)) {
        }
        mRunning = false;
        pGiveUp(*program);
    }

    /// Runs every thread that has not ended to its end, one by one.
    void pGiveUp(Interleavings::Program& program)
    {
        mGivingUp = true;
        program.giveUp();
        for (std::size_t i = 0; i < mThreads.size(); ++i) {
            if (mThreads[i].ended) continue;
            mThreads[i].timedOut = false;
            pResume(i);
            if (!mThreads[i].ended) throw std::logic_error("a thread suspends although no operation waits");
        }
    }

    /// One thread continues to its next operation. @return false when the run is over
    bool pStep(Interleavings::Program& program)
    {
        const std::vector<Step> steps = pPossibleSteps();
        if (steps.empty()) {
            ++mResult.rests;
            pCheckRest();
            program.atRest();
            return false;
        }
        if (mDepth == mDecisions.size()) {
            std::string state;
            program.describe(state);
            if (!mVisited.insert(pStateHash(state)).second && mOptions.merge) return false;
            mDecisions.push_back({0, steps.size()});
        }
        const Decision& decision = mDecisions[mDepth++];
        if (decision.alternatives != steps.size()) throw std::logic_error("the program is not deterministic");
        pTake(program, steps[decision.chosen]);
        return true;
    }

    std::vector<Step> pPossibleSteps() const
    {
        std::vector<Step> steps;
        for (std::size_t i = 0; i < mThreads.size(); ++i) {
            const Thread& thread = mThreads[i];
            if (thread.ended) continue;
            const auto found = mObjects.find(thread.object);
            const bool exists = found != mObjects.end(); // if not, pCarryOut() reports it
            switch (thread.next) {
            case Operation::Lock:
                if (!exists || found->second.owner == kNone) steps.push_back({i, 0});
                break;
            case Operation::Sleep:
                pAddStepsOfSleeper(i, steps);
                break;
            case Operation::NotifyOne:
                pAddStepsOfNotifier(i, steps);
                break;
            case Operation::Step:
            case Operation::Unlock:
            case Operation::NotifyAll:
                steps.push_back({i, 0});
                break;
            }
        }
        return steps;
    }

    void pAddStepsOfSleeper(std::size_t number, std::vector<Step>& steps) const
    {
        const Thread& thread = mThreads[number];
        if (!thread.woken && !thread.timedOut) {
            if (thread.timed) steps.push_back({number, kTimeOut});
            if (mSpuriousLeft != 0) steps.push_back({number, kSpurious});
            return;
        }
        const auto mutex = mObjects.find(thread.mutex);
        if (mutex == mObjects.end() || mutex->second.owner == kNone) steps.push_back({number, kWake});
    }

    void pAddStepsOfNotifier(std::size_t number, std::vector<Step>& steps) const
    {
        const std::size_t sleepers = pSleepers(mThreads[number].object).size();
        for (std::size_t i = 0; i < std::max<std::size_t>(sleepers, 1); ++i)
            steps.push_back({number, i});
    }

    /// The threads that a notification can wake.
    std::vector<std::size_t> pSleepers(const void* condition) const
    {
        std::vector<std::size_t> sleepers;
        for (std::size_t i = 0; i < mThreads.size(); ++i) {
            const Thread& thread = mThreads[i];
            if (thread.next != Operation::Sleep || thread.object != condition) continue;
            if (thread.woken || thread.timedOut) continue;
            sleepers.push_back(i);
        }
        return sleepers;
    }

    void pTake(Interleavings::Program& program, const Step& step)
    {
        Thread& thread = mThreads[step.thread];
        const auto object = mObjects.find(thread.object);
        const bool exists = object != mObjects.end();
        mSteps.push_back({step.thread, thread.next, exists ? object->second.number : kNone,
                          exists ? object->second.kind : "", step.alternative});

        if (thread.next == Operation::Sleep && step.alternative != kWake) {
            // It is awake, but does not hold the mutex yet.
            (step.alternative == kTimeOut ? thread.timedOut : thread.woken) = true;
            if (step.alternative == kSpurious) --mSpuriousLeft;
            return;
        }
        if (thread.object != nullptr && !pCarryOut(step)) return;
        pRemember(program, thread, step);
        thread.next = Operation::Step;
        thread.object = nullptr;
        thread.mutex = nullptr;
        pResume(step.thread);
    }

    void pRelease(Object& mutex, std::size_t thread)
    {
        if (mutex.owner != thread) return fail("a mutex is released by a thread that does not hold it");
        mutex.owner = kNone;
    }

    /// @return false when an object does not exist any more
    bool pCarryOut(const Step& step)
    {
        Thread& thread = mThreads[step.thread];
        Object* const object = pObject(thread.next == Operation::Sleep ? thread.mutex : thread.object);
        if (object == nullptr || pObject(thread.object) == nullptr) return false;
        switch (thread.next) {
        case Operation::Lock:
        case Operation::Sleep:
            object->owner = step.thread;
            break;
        case Operation::Unlock:
            pRelease(*object, step.thread);
            break;
        case Operation::NotifyOne: {
            thread.notified.push_back(thread.object);
            const std::vector<std::size_t> sleepers = pSleepers(thread.object);
            if (mOptions.fault == Fault::NotifyOneDoesNothing || sleepers.empty()) break;
            mThreads[sleepers[step.alternative]].woken = true;
            break;
        }
        case Operation::NotifyAll:
            thread.notifiedAll.push_back(thread.object);
            if (mOptions.fault == Fault::NotifyAllDoesNothing) break;
            for (const std::size_t sleeper : pSleepers(thread.object))
                mThreads[sleeper].woken = true;
            break;
        case Operation::Step:
            break;
        }
        return true;
    }

    /// Adds what the thread does, and the shared data that it sees, to its past.
    void pRemember(Interleavings::Program& program, Thread& thread, const Step& step)
    {
        thread.past = mix(thread.past, static_cast<std::uint64_t>(thread.next));
        thread.past = mix(thread.past, step.alternative);
        thread.past = mix(thread.past, thread.timedOut ? 1 : 0);
        const bool seesSharedData =
            thread.next == Operation::Lock || thread.next == Operation::Sleep || thread.next == Operation::Step;
        if (!seesSharedData) return;
        std::string state;
        program.describeWhatThreadsSee(state);
        thread.past = mix(thread.past, std::hash<std::string>()(state));
    }

    void pCheckRest()
    {
        for (const Thread& thread : mThreads) {
            if (thread.ended) continue;
            if (thread.next == Operation::Lock || (thread.next == Operation::Sleep && thread.woken)) {
                fail("a thread waits for a mutex for ever");
            }
        }
    }

    std::uint64_t pStateHash(const std::string& described) const
    {
        std::uint64_t hash = std::hash<std::string>()(described);
        hash = mix(hash, mSpuriousLeft);
        for (const Thread& thread : mThreads) {
            hash = mix(hash, static_cast<std::uint64_t>(thread.next));
            hash = mix(hash, pNumber(thread.object));
            hash = mix(hash, pNumber(thread.mutex));
            hash = mix(hash, (thread.ended ? 8U : 0U) + (thread.timed ? 4U : 0U) + (thread.woken ? 2U : 0U) +
                                 (thread.timedOut ? 1U : 0U));
            hash = mix(hash, thread.past);
        }
        std::vector<std::uint64_t> owners(mCreated, kNone - 1);
        for (const auto& [address, object] : mObjects)
            owners[object.number] = object.owner;
        for (const std::uint64_t owner : owners)
            hash = mix(hash, owner);
        return hash;
    }

    std::uint64_t pNumber(const void* object) const
    {
        const auto found = mObjects.find(object);
        return found == mObjects.end() ? kNone : found->second.number;
    }

    /// Prepares the next run. @return false when there is none
    bool pNextDecisions()
    {
        while (!mDecisions.empty() && mDecisions.back().chosen + 1 == mDecisions.back().alternatives) {
            mDecisions.pop_back();
        }
        if (mDecisions.empty()) return false;
        ++mDecisions.back().chosen;
        return true;
    }

    struct Decision {
        std::size_t chosen;
        std::size_t alternatives;
    };

    const Interleavings::Options mOptions;
    Interleavings::Result mResult;
    std::vector<Decision> mDecisions;
    std::unordered_set<std::uint64_t> mVisited;
    std::vector<std::unique_ptr<Fiber>> mFibers;

    // The current run.
    std::map<const void*, Object> mObjects;
    std::vector<Thread> mThreads;
    std::vector<PastStep> mSteps;
    std::size_t mCreated = 0;
    std::size_t mDepth = 0;
    std::size_t mCurrent = kNone;
    unsigned int mSpuriousLeft = 0;
    bool mRunning = false;
    bool mGivingUp = false;
};

Explorer* sExplorer = nullptr;

} // namespace

Interleavings::Program::~Program() = default;

Interleavings::Result Interleavings::exploreAll(const Options& options,
                                                const std::function<std::unique_ptr<Program>()>& make)
{
    Explorer explorer(options);
    sExplorer = &explorer;
    Result result = explorer.explore(make);
    sExplorer = nullptr;
    return result;
}

void Interleavings::step() { sExplorer->perform(Operation::Step, nullptr); }
void Interleavings::here(std::uint64_t place) { sExplorer->here(place); }
void Interleavings::fail(const std::string& what) { sExplorer->fail(what); }
std::size_t Interleavings::thread() { return sExplorer->current(); }
bool Interleavings::hasEnded(std::size_t thread) { return sExplorer->thread(thread).ended; }

bool Interleavings::sleeps(std::size_t thread)
{
    const Thread& asked = sExplorer->thread(thread);
    return !asked.ended && asked.next == Operation::Sleep && !asked.woken && !asked.timedOut;
}

bool Interleavings::timedOut() { return sExplorer->thread(thread()).timedOut; }

const std::vector<const void*>& Interleavings::notified() { return sExplorer->thread(thread()).notified; }
const std::vector<const void*>& Interleavings::notifiedAll() { return sExplorer->thread(thread()).notifiedAll; }

void Interleavings::create(const void* object, const char* kind) { sExplorer->create(object, kind); }
void Interleavings::destroy(const void* object) { sExplorer->destroy(object); }
void Interleavings::perform(Operation operation, const void* object) { sExplorer->perform(operation, object); }
bool Interleavings::sleep(const void* condition, const void* mutex, bool timed)
{
    return sExplorer->sleep(condition, mutex, timed);
}

} // namespace qel::test
