#pragma once

#include <qel/common/security/SSLValidityPeriod.hpp>

#include "base/Library.hpp"
#include "certificates/CredentialFiles.hpp"
#include "transport/TransportOptions.hpp"

#include <chrono>
#include <string>
#include <vector>

namespace qel::tool {

/// What is to be said about this end's own certificate and about its root before they expire: for each of them that
/// expires within a time, "own certificate FILE expires at TIME, in N days: replace it". What cannot be read is left
/// out: loading the credentials says why.
std::vector<std::string> expiryNotes(const CredentialPaths& paths, SSLValidityPeriod::Clock::time_point now,
                                     std::chrono::seconds within);

/// What a client is to be told about its transport: the notes about certificates that expire within 30 days, and
/// that no pin says which server is the right one.
std::vector<std::string> clientNotes(const TransportOptions& options, SSLValidityPeriod::Clock::time_point now);

} // namespace qel::tool
