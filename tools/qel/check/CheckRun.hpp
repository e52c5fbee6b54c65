#pragma once

#include "check/Case.hpp"
#include "check/Transcript.hpp"
#include "check/Trial.hpp"

#include <chrono>
#include <cstddef>
#include <functional>
#include <string>
#include <vector>

namespace qel::tool::check {

enum class Result { Holds, Fails, Skipped };

/// What came of one case.
struct Outcome {
    const Case* test = nullptr;
    Result result = Result::Holds;
    std::string expected;  ///< of a case that fails: what the peer had to do
    std::string seen;      ///< what it did; of a case that is skipped: why
    Transcript transcript; ///< of a case that fails
    std::chrono::nanoseconds time{0};
};

/// Runs one case and puts back what it changes.
/// @param number  of the case within the run
Outcome runCase(const Case& aCase, const Target& target, unsigned int number);

/// Runs cases, several at a time. Cases that share state of the peer run one after the other; cases that need the peer
/// for themselves run after all others.
/// Thread safety: one thread owns it.
class CheckRun {
public:
    using RunCase = std::function<Outcome(const Case&, unsigned int number)>;
    /// Called after each case, by one thread at a time. @return false: no further case is started
    using OnOutcome = std::function<bool(const Outcome&, std::size_t done)>;

    /// @param cases  borrowed; they must outlive the outcomes
    /// @param parallel  how many cases at a time; more than 0
    CheckRun(const Cases& cases, unsigned int parallel, RunCase runCase);

    /// @return the outcomes in the order of the cases; those that were not started are skipped as "interrupted"
    /// @throws what the functions throw that are not a Failure or a Skip; all threads have ended by then
    std::vector<Outcome> run(const OnOutcome& onOutcome);

private:
    const Cases& mCases;
    const unsigned int mParallel;
    const RunCase mRunCase;
};

} // namespace qel::tool::check
