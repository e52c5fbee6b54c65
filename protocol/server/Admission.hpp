#pragma once

#include <qel/common/io/Stream.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/common/util/Mutex.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/PeerIdentity.hpp>
#include <qel/protocol/PeerPins.hpp>

#include "hypervisor/HypervisorEngine.hpp"

#include <string>

namespace qel::protocol {

/// The server takes no more consoles, or stops.
class NoMoreConsoles : public Error {
public:
    using Error::Error;
};

/// The steps of one connection of the hypervisor end from the first byte to TLS: those of Handshake.hpp, and the check
/// of the console's certificate.
///
/// Lifetime: borrows all that it is made of. Thread safety: one thread calls run(); stop() may come from any.
class Admission {
public:
    /// @param clear  the connection without TLS; below `tls`
    /// @param descriptor  of its socket; -1: it has none
    /// @param wake  readable when another thread has called stop(), which interrupts it
    /// @param pins  which consoles are admitted
    Admission(const HypervisorEngine& hypervisor, Stream& clear, int descriptor, SSLStream& tls, PollInterrupt& wake,
              const PeerPins& pins);
    ~Admission() = default;
    Admission(const Admission&) = delete;
    Admission& operator=(const Admission&) = delete;

    /// Takes the steps. The deadlines of the stream are those of the handshake when it returns.
    /// @param end  the deadline of all steps
    /// @return who the console is
    /// @throws Error  it is not admitted; the caller closes the connection
    /// @throws NoMoreConsoles  one of these errors
    /// @throws PosixError, SSLException, std::bad_alloc  something has run out
    PeerIdentity run(PollDeadline::time_point end);

    /// For the end of the server: a console that has not asked for TLS gets the abort message, one in the midst of the
    /// steps is cut. Has no effect after run().
    void stop();

private:
    bool pAwaitFirstByte(const PollDeadline& end);
    bool pEnterStream();
    void pTurnAway(PollDeadline::time_point end);
    void pLeaveStream();

    const HypervisorEngine& mHypervisor;
    Stream& mClear;
    const int mDescriptor;
    SSLStream& mTls;
    PollInterrupt& mWake;
    const PeerPins& mPins;

    // Guards what stop() and run() agree by on who ends the connection.
    Mutex mMutex;
    bool mStopping QEL_GUARDED_BY(mMutex) = false;
    bool mIsInStream QEL_GUARDED_BY(mMutex) = false; // run() may wait in the stream, no longer for mWake
};

} // namespace qel::protocol
