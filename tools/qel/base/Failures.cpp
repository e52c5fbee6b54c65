#include "base/Failures.hpp"

#include <qel/common/QelMessageExceptions.hpp>

#include "base/RefusalReason.hpp"

#include <cstring>

namespace qel::tool {

namespace {

template <typename T>
bool is(const std::exception& error)
{
    return dynamic_cast<const T*>(&error) != nullptr;
}

/// The exit status of each error of the library.
struct Row {
    bool (*applies)(const std::exception&);
    ExitStatus status;
};
constexpr Row kStatuses[] = {
    {is<NameNotResolved>, ExitStatus::CannotConnect}, {is<CannotConnect>, ExitStatus::CannotConnect},
    {is<CannotListen>, ExitStatus::CannotConnect},    {is<TurnedAway>, ExitStatus::Refused},
    {is<CredentialsUnusable>, ExitStatus::Refused},   {is<StatusError>, ExitStatus::Refused},
    {is<DeadlinePassed>, ExitStatus::DeadlinePassed}, {is<ClosedByPeer>, ExitStatus::ClosedByPeer},
    {is<ProtocolBroken>, ExitStatus::ProtocolBroken},
};

/// When the peer does not accept our certificate, all that happens is that it closes the connection.
ExitStatus exitStatusOf(const CertificateRejected& error)
{
    const bool isOurs = error.getReason() == CertificateRejected::Reason::OursByThem;
    return isOurs ? ExitStatus::ClosedByPeer : ExitStatus::Refused;
}

/// How the library ends the texts about things for which this program has options.
struct Wording {
    const char* library;
    const char* program;
};
constexpr Wording kWordings[] = {
    {"does not match the pinned names", "does not match --peer-name"},
    {"does not match the pinned fingerprints", "does not match --peer-fingerprint"},
    {": it accepts only TLS", ": it accepts only TLS; give credentials instead of --plain"},
    {": use chmod 600", ": use chmod 600, or --insecure-permissions to allow it"},
    {": make it a file of this user", ": make it a file of this user, or --insecure-permissions to allow it"},
};

/// The text of an error of the library, in terms of the options of this program.
std::string wordingOf(const Error& error)
{
    std::string text = error.what();
    for (const Wording& wording : kWordings) {
        const std::size_t length = std::strlen(wording.library);
        if (text.size() < length || text.compare(text.size() - length, length, wording.library) != 0) continue;
        text.replace(text.size() - length, length, wording.program);
    }
    return text;
}

} // namespace

CommandFailure::CommandFailure(ExitStatus status, const std::string& reason)
    : std::runtime_error(reason), mStatus(status)
{}

CommandFailure::~CommandFailure() = default;

ExitStatus exitStatusOf(const std::exception& error)
{
    if (const auto* failure = dynamic_cast<const CommandFailure*>(&error)) return failure->getExitStatus();
    if (const auto* rejected = dynamic_cast<const CertificateRejected*>(&error)) return exitStatusOf(*rejected);
    for (const Row& row : kStatuses) {
        if (row.applies(error)) return row.status;
    }
    if (is<QelMessageValidationException>(error)) return ExitStatus::ProtocolBroken;
    return ExitStatus::Failed;
}

std::string userMessage(const std::exception& error)
{
    if (const auto* refusal = dynamic_cast<const StatusError*>(&error)) return refusalText(refusal->getResponse());
    if (const auto* ours = dynamic_cast<const Error*>(&error)) return wordingOf(*ours);
    // What a response holds is read here, so its exceptions are the common library's.
    const std::string prefix = is<QelMessageValidationException>(error) ? "the peer broke the protocol: " : "";
    return prefix + explain(error);
}

} // namespace qel::tool
