#pragma once

#include <csignal>
#include <functional>
#include <pthread.h>

namespace qel::test {

/// Runs a call that blocks while another thread keeps sending SIGUSR1 to this one, until the call has returned.
/// A single signal might arrive before the call blocks; with a sequence of them one arrives later.
/// @param flags  of sigaction(2): SA_RESTART lets the kernel restart the call where it can
/// @param call   returns because of the signals, or of what `until` does
/// @param until  called on the sending thread before each signal; false ends the sending
/// @return the number of signals handled
int callUnderSignals(int flags, const std::function<void()>& call, const std::function<bool()>& until);

} // namespace qel::test
