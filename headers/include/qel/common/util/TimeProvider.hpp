#pragma once

#include <qel/common/QelExport.hpp>

#include <chrono>

namespace qel {

/// The clocks of the library. A test or a simulation can substitute its own time: derive from this class and call
/// pRegister(). Log lines, statistics and deadlines read the time through system() and steady(). Two readings do not:
/// QelMessageQueue::waitForMsg() sleeps in real time and computes the end of its sleep from the standard steady clock,
/// and the validity periods of certificates come from time(2), as do OpenSSL's own checks.
///
/// A process has one current provider: the standard clocks, unless another one has registered. Both functions work from
/// the first static initialiser to the last static destructor of the process.
///
/// Lifetime: the current provider is borrowed; its destructor unregisters it.
/// Thread safety: any thread may call system() and steady(). Registering and unregistering take no lock: do both, in
/// the set-up and tear-down of a test for example, while no other thread reads the time.
class QEL_EXPORT TimeProvider {
public:
    /// @return the wall-clock time of the current provider
    /// @throws what the pSystem() of a substitute throws; the standard clock does not throw
    static std::chrono::system_clock::time_point system();

    /// @return the time of the current provider that never runs backwards; for durations and deadlines
    /// @throws what the pSteady() of a substitute throws; the standard clock does not throw
    static std::chrono::steady_clock::time_point steady();

    /// Unregisters this provider, so that a substitute that goes out of scope does not stay current.
    virtual ~TimeProvider();

    TimeProvider(const TimeProvider&) = delete;
    TimeProvider& operator=(const TimeProvider&) = delete;

protected:
    constexpr TimeProvider() noexcept = default;

    /// What system() returns while this provider is current. Not const: a substitute may count or advance.
    virtual std::chrono::system_clock::time_point pSystem() = 0;

    /// What steady() returns while this provider is current. Not const: a substitute may count or advance.
    virtual std::chrono::steady_clock::time_point pSteady() = 0;

    /// Makes this provider the current one. Call it at the end of the constructor.
    void pRegister() noexcept;

    /// Makes the standard clocks current again if this provider is current; does nothing otherwise. Providers do not
    /// stack: the one that was current before this one does not become current again.
    void pUnregister() noexcept;
};

/// The standard system and steady clocks. The library holds one of these and never destroys it.
/// Thread safety: any thread.
class QEL_EXPORT DefaultTimeProvider : public TimeProvider {
public:
    constexpr DefaultTimeProvider() noexcept = default;
    ~DefaultTimeProvider() override;

protected:
    std::chrono::system_clock::time_point pSystem() override;
    std::chrono::steady_clock::time_point pSteady() override;
};

} // namespace qel
