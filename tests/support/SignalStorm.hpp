#pragma once

#include <csignal>
#include <functional>
#include <pthread.h>

namespace qel::test {

/// Runs a call that blocks while another thread keeps sending SIGUSR1 to this one, until the call has returned.
/// A single signal might arrive before the call has begun to block; a stream of them cannot miss it.
/// @param flags  of sigaction(2): SA_RESTART lets the system resume what can be resumed
/// @param call   must return because of the signals, or because of what `until` does
/// @param until  called by the sending thread before each signal; returning false ends the sending
/// @return the signals that were handled
int callUnderSignals(int flags, const std::function<void()>& call, const std::function<bool()>& until);

} // namespace qel::test
