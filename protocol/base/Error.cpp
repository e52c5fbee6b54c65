#include <qel/common/StreamFormatters.hpp>
#include <qel/protocol/Error.hpp>

#include <utility>

namespace qel::protocol {

Error::Error(const std::string& what, std::string peer) : std::runtime_error(what), mPeer(std::move(peer)) {}
Error::~Error() = default;

void Error::addContext(const std::string& attempt, const std::string& peer)
{
    static_cast<std::runtime_error&>(*this) = std::runtime_error(attempt + what());
    mPeer = peer;
}

NameNotResolved::~NameNotResolved() = default;
CannotConnect::~CannotConnect() = default;
CannotListen::~CannotListen() = default;
TurnedAway::~TurnedAway() = default;

CredentialsUnusable::CredentialsUnusable(const std::string& what, Reason reason) : Error(what), mReason(reason) {}
CredentialsUnusable::~CredentialsUnusable() = default;

CertificateRejected::CertificateRejected(Reason reason, const std::string& what, std::string peer)
    : Error(what, std::move(peer)), mReason(reason)
{}
CertificateRejected::~CertificateRejected() = default;

DeadlinePassed::~DeadlinePassed() = default;
ClosedByPeer::~ClosedByPeer() = default;
ProtocolBroken::~ProtocolBroken() = default;
LimitReached::~LimitReached() = default;

StatusError::StatusError(const QelMessage& response, std::string peer)
    : Error("the request was refused: " + toString(response.getLogID()), std::move(peer)), mResponse(response.clone())
{}
StatusError::~StatusError() = default;

std::string explain(const std::exception& error)
{
    std::string text = error.what();
    if (dynamic_cast<const Error*>(&error) != nullptr) return text;
    try {
        std::rethrow_if_nested(error);
    } catch (const std::exception& cause) {
        text += ": " + explain(cause);
    } catch (...) {
        text += ": unknown cause";
    }
    return text;
}

} // namespace qel::protocol
