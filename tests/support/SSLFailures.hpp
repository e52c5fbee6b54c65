#pragma once

#include <functional>
#include <set>
#include <string>

namespace qel::test {

/// Runs an action twice and records its OpenSSL calls the second time; then runs it once for each of them with that
/// call failing. Expects each time that the action throws SSLException "An SSL error occurred at FILE:LINE", that this
/// line of the source has the call, that OpenSSL's own reason is in the log, and that the error queue is empty.
/// @param action      makes the same calls each time
/// @param exceptions  calls that cannot fail or whose failure shows otherwise: names, or whole calls as
///                    OpenSSLCalls::calls() has them
/// @return how many calls were made to fail
unsigned expectEveryFailureIsReported(const std::function<void()>& action,
                                      const std::set<std::string>& exceptions = {});

/// Expects SSLException "An SSL error occurred at .../FILE:LINE" from common/security, and the error queue to be empty
/// after it.
/// @param file  the name of the source file
void expectSSLErrorAt(const std::string& file, const std::function<void()>& action);

} // namespace qel::test
