#include "transport/CertificateNotes.hpp"

#include <qel/common/Utilities.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/protocol/CertificateState.hpp>

#include <exception>

namespace qel::tool {

namespace {

constexpr std::chrono::hours kDay{24};
constexpr std::chrono::hours kClientNotice = 30 * kDay;

void addNote(std::vector<std::string>& notes, const char* what, const std::string& path,
             SSLValidityPeriod::Clock::time_point now, std::chrono::seconds within)
{
    try {
        const SSLValidityPeriod validity = SSLCertificate(Utilities::readFile(path)).getValidityPeriod();
        if (stateAt(validity, now, within) != CertificateState::Due) return;
        const auto days = std::chrono::duration_cast<std::chrono::hours>(validity.getNotAfter() - now) / kDay;
        notes.push_back(std::string(what) + " " + path + " expires at " + isoTime(validity.getNotAfter()) + ", in " +
                        std::to_string(days) + (days == 1 ? " day" : " days") + ": replace it");
    } catch (const std::exception&) { // loading the credentials reports it
    }
}

} // namespace

std::vector<std::string> expiryNotes(const CredentialPaths& paths, SSLValidityPeriod::Clock::time_point now,
                                     std::chrono::seconds within)
{
    std::vector<std::string> notes;
    addNote(notes, "own certificate", paths.certificate, now, within);
    addNote(notes, "root certificate", paths.root, now, within);
    return notes;
}

std::vector<std::string> clientNotes(const TransportOptions& options, SSLValidityPeriod::Clock::time_point now)
{
    if (options.plain) return {};
    std::vector<std::string> notes = expiryNotes(options.paths(), now, kClientNotice);
    if (options.pins.names.empty() && options.pins.fingerprints.empty()) {
        notes.emplace_back(
            "any certificate of the root may be the server: --peer-name or --peer-fingerprint says which");
    }
    return notes;
}

} // namespace qel::tool
