#pragma once

#include <qel/common/QelExport.hpp>

#include <chrono>

namespace qel {

/// The clocks of the library. All its readings of the time go through system() and steady(), so that a test or a
/// simulation can put its own time in their place: derive from this class and call pRegister().
///
/// There is one current provider for the process: the standard clocks, unless another one has registered. Both
/// functions work from the first static initialiser to the last static destructor of the process.
///
/// Thread safety: system() and steady() may be called from any thread. Registering and unregistering take no lock and
/// belong where no other thread reads the time: to the set-up and tear-down of a test.
class QEL_EXPORT TimeProvider {
public:
    /// @return the wall-clock time of the current provider
    static std::chrono::system_clock::time_point system();

    /// @return the time of the current provider that never runs backwards; for durations and deadlines
    static std::chrono::steady_clock::time_point steady();

    /// Unregisters this provider, so that a substitute clock that goes out of scope is never left in force.
    virtual ~TimeProvider();

    TimeProvider(const TimeProvider&) = delete;
    TimeProvider& operator=(const TimeProvider&) = delete;

protected:
    constexpr TimeProvider() noexcept = default;

    /// Answers system() while this provider is the current one. Not const: a substitute may count or advance.
    virtual std::chrono::system_clock::time_point pSystem() = 0;

    /// Answers steady() while this provider is the current one. Not const: a substitute may count or advance.
    virtual std::chrono::steady_clock::time_point pSteady() = 0;

    /// Makes this provider the current one, in place of whichever was. Call it at the end of the constructor.
    void pRegister() noexcept;

    /// Puts the standard clocks back in force when this provider is the current one; otherwise does nothing. Providers
    /// do not stack: the one that was current before does not come back.
    void pUnregister() noexcept;
};

/// The standard system and steady clocks. The library holds one of these and never destroys it.
class QEL_EXPORT DefaultTimeProvider : public TimeProvider {
public:
    constexpr DefaultTimeProvider() noexcept = default;
    ~DefaultTimeProvider() override;

protected:
    std::chrono::system_clock::time_point pSystem() override;
    std::chrono::steady_clock::time_point pSteady() override;
};

} // namespace qel
