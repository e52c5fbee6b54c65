#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

/// @file
/// Runs a small program of several threads in every order in which they can run, to find an order in which it fails.
/// The threads are fibers: one runs at a time, and the next step may go to another one only at the operations of
/// ModelledSync.hpp. Code that is compiled against those instead of the real mutexes and condition variables runs here
/// unchanged.
///
/// A run is a list of decisions, one for each step. After a run the last decision that has an untried alternative is
/// changed and the program runs again, until all are tried. A run is cut short when it reaches a state that was visited
/// before: the same threads at the same places with the same past, and the same shared data.
///
/// It relies on two rules. Threads touch shared data with a modelled mutex held, or right after step(). What a thread
/// does next depends only on its past since its last call of here() and on the shared data.

namespace qel::test {

class Interleavings {
public:
    /// What a thread is about to do at a place where another thread may run next.
    enum class Operation {
        Step,      ///< uses no modelled object
        Lock,      ///< take a mutex; possible while it is free
        Unlock,    ///< release it
        Sleep,     ///< wait at a condition variable; ends when woken, and, if the wait is timed, at any time
        NotifyOne, ///< wake one thread that sleeps at a condition variable, any of them
        NotifyAll  ///< wake all of them
    };

    /// What is deliberately broken, to show that failures are detected.
    enum class Fault { None, NotifyOneDoesNothing, NotifyAllDoesNothing };

    /// A program. Every run constructs a new one.
    class Program {
    public:
        virtual ~Program();

        /// What the threads do. All start with the run.
        std::vector<std::function<void()>> threads;

        /// Appends the data that the threads share, and what atRest() looks at.
        virtual void describe(std::string& state) const = 0;
        /// Appends the part of it on which the decisions of threads depend; all of it, unless overridden.
        virtual void describeWhatThreadsSee(std::string& state) const { describe(state); }
        /// Called when no thread can continue: each has ended or sleeps for ever. Calls fail() if that is wrong.
        virtual void atRest() = 0;
        /// Called after a run that was cut short, before its threads are run to their ends one by one. From now on no
        /// operation waits. Makes sure that no thread loops for ever.
        virtual void giveUp() = 0;
    };

    struct Options {
        Fault fault = Fault::None;
        unsigned int spuriousWakeups = 0; ///< the limit of spurious wake-ups in one run
        bool merge = true;                ///< false: continue from states visited before
        bool sleepersForget = false;   ///< true: after a sleep a thread does not depend on what it saw between here()
                                       ///< and the sleep, because it checks everything again
        std::size_t maxRuns = 5000000; ///< more are a failure: the program is too large
    };

    struct Result {
        std::string failure;            ///< the first one found; empty: there is none
        std::vector<std::string> story; ///< the steps to the failure, a line for each
        std::size_t runs = 0;
        std::size_t states = 0; ///< distinct
        std::size_t rests = 0;  ///< runs that ended with atRest()
    };

    /// Runs the program in every order. Stops at the first failure.
    template <typename P, typename... Arguments>
    static Result explore(const Options& options, const Arguments&... arguments)
    {
        return exploreAll(options, [&] { return std::make_unique<P>(arguments...); });
    }
    static Result exploreAll(const Options& options, const std::function<std::unique_ptr<Program>()>& make);

    // For programs, while they run.

    /// A place where another thread may run next.
    static void step();
    /// Of its past, only this number determines what the calling thread does next.
    static void here(std::uint64_t place);
    /// Reports a failure of the program.
    static void fail(const std::string& what);
    /// The number of the calling thread, from 0.
    static std::size_t thread();
    static bool hasEnded(std::size_t thread);
    /// Whether that thread sleeps at a condition variable and has not been woken.
    static bool sleeps(std::size_t thread);
    /// Whether the last sleep of the calling thread since its last here() has ended by its timeout.
    static bool timedOut();
    /// The objects whose notifyOne() the calling thread has called since its last here(), in order.
    static const std::vector<const void*>& notified();
    /// The same for notifyAll().
    static const std::vector<const void*>& notifiedAll();

    // For ModelledSync.hpp. Objects are identified by their address from create() to destroy(). Outside of the threads
    // of the program, as in its constructor, no operation waits.

    static void create(const void* object, const char* kind);
    static void destroy(const void* object);
    static void perform(Operation operation, const void* object);
    /// Releases the mutex and sleeps. @return false when the time of a timed wait has passed
    static bool sleep(const void* condition, const void* mutex, bool timed);
};

} // namespace qel::test
