#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

/// @file
/// Runs a small program of several threads in every order in which they can run, to find the one in which it goes
/// wrong. The threads are not those of the system: they take turns, and the turn changes only where threads can see
/// each other, which is at the operations of ModelledSync.hpp. Code that is compiled against those instead of the real
/// mutexes and condition variables runs here unchanged.
///
/// How it is done: a run is a list of decisions, one for each turn. After a run the last decision that has another
/// alternative left is changed and the program runs anew, until there is none left. A run is cut short where it comes
/// to a state that was met before: same threads at the same places with the same past, same shared data. What follows
/// from there is known.
///
/// What it relies on: data that threads share is touched with a modelled mutex held, or right after step(); what a
/// thread does next depends on nothing but its past since its last call of here() and on what it then sees.

namespace qel::test {

class Interleavings {
public:
    /// What a thread is about to do at a place where the turn may change.
    enum class Operation {
        Step,      ///< something that touches no modelled object
        Lock,      ///< take a mutex; can go on while nobody holds it
        Unlock,    ///< give it back
        Sleep,     ///< wait at a condition variable; can go on when woken, or, if the wait is timed, at any time
        NotifyOne, ///< wake one thread that sleeps at a condition variable, any of them
        NotifyAll, ///< wake all of them
        Enter,     ///< count up
        Leave,     ///< count down
        WaitZero   ///< can go on when the count is zero
    };

    /// What is deliberately broken, to show that a program's mistakes are found.
    enum class Fault {
        None,
        NotifyOneDoesNothing,
        NotifyAllDoesNothing,
        WaitZeroDoesNotWait ///< CallsInFlight::wait() returns at once
    };

    /// A program. A new one is made for every run.
    class Program {
    public:
        virtual ~Program();

        /// What the threads do. All begin when the run begins.
        std::vector<std::function<void()>> threads;

        /// Appends the data that the threads share, and what atRest() looks at.
        virtual void describe(std::string& state) const = 0;
        /// Appends the part of it by which threads decide what they do; all of it, unless overridden.
        virtual void describeWhatThreadsSee(std::string& state) const { describe(state); }
        /// Called when no thread can go on: all have ended, or some sleep for ever. Calls fail() if that is wrong.
        virtual void atRest() = 0;
        /// Called after a run that was cut short, before its threads are run to their ends one by one: from now on no
        /// operation waits for anything. Makes sure that no thread goes round for ever.
        virtual void giveUp() = 0;
    };

    struct Options {
        Fault fault = Fault::None;
        unsigned int spuriousWakeups = 0; ///< how many sleeps may end without cause in one run
        bool merge = true;                ///< false: go on although a state was met before
        bool sleepersForget = false;      ///< true: a thread that has slept knows nothing of what it saw before that,
                                          ///< since here(); so do those that look at everything again
        std::size_t mostRuns = 5000000;   ///< more than this is a failure: the program is too large
    };

    struct Result {
        std::string failure;            ///< the first one found; empty: there is none
        std::vector<std::string> story; ///< what led there, one line for each turn
        std::size_t runs = 0;
        std::size_t states = 0; ///< different ones
        std::size_t rests = 0;  ///< runs that came to rest
    };

    /// Runs the program in every order. Stops at the first failure.
    template <typename P, typename... Arguments>
    static Result explore(const Options& options, const Arguments&... arguments)
    {
        return exploreAll(options, [&] { return std::make_unique<P>(arguments...); });
    }
    static Result exploreAll(const Options& options, const std::function<std::unique_ptr<Program>()>& make);

    // For programs, while they run.

    /// A place where other threads may have their turn.
    static void step();
    /// Tells that what the calling thread does next depends on nothing of its past but this number.
    static void here(std::uint64_t place);
    /// The program is wrong.
    static void fail(const std::string& what);
    /// The number of the calling thread, from 0.
    static std::size_t thread();
    static bool hasEnded(std::size_t thread);
    /// Whether that thread sleeps at a condition variable and was not woken.
    static bool sleeps(std::size_t thread);
    /// Whether the calling thread's latest sleep since its last here() has ended because its time has passed.
    static bool timedOut();
    /// On which objects the calling thread has called notifyOne() since its last here(), in order.
    static const std::vector<const void*>& notified();
    /// The same for notifyAll().
    static const std::vector<const void*>& notifiedAll();

    // For ModelledSync.hpp. Objects are known by their address from create() to destroy(). Where no thread of the
    // program runs, as in its constructor, nothing waits for anything.

    static void create(const void* object, const char* kind);
    static void destroy(const void* object);
    static void perform(Operation operation, const void* object);
    /// Gives the mutex back and sleeps. @return false when the time of a timed wait has passed
    static bool sleep(const void* condition, const void* mutex, bool timed);
};

} // namespace qel::test
