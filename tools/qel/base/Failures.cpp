#include "base/Failures.hpp"

#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/PosixError.hpp>

#include "base/RefusalReason.hpp"

#include <cerrno>
#include <cstring>

namespace qel::tool {

namespace {

// A stream reports a passed deadline in two ways: with this text when the deadline passed before the wait began, and
// with the system's EAGAIN as the cause when it passed during the wait.
constexpr const char* kDeadlineText = "I/O deadline";

bool isDeadline(const StreamIOException& error)
{
    if (std::strcmp(error.what(), kDeadlineText) == 0) return true;
    try {
        std::rethrow_if_nested(error);
    } catch (const PosixError& cause) {
        const int code = cause.getErrorCode().getCode();
        return code == EAGAIN || code == EWOULDBLOCK;
    } catch (...) {
        return false;
    }
    return false;
}

std::string refusalText(const std::string& step, const QelMessage& response, const std::string& subject)
{
    const std::string reason = refusalReason(response, subject);
    return (reason.empty() ? step + " refused" : reason) + ": " + toString(response.getStatus());
}

} // namespace

CommandFailure::CommandFailure(ExitStatus status, const std::string& reason)
    : std::runtime_error(reason), mStatus(status)
{}

CommandFailure::~CommandFailure() = default;

RequestRefused::RequestRefused(const std::string& step, const QelMessage& response, const std::string& subject)
    : CommandFailure(ExitStatus::Refused, refusalText(step, response, subject)), mStep(step),
      mStatus(response.getStatus()), mStatusDetail(response.getStatusDetail())
{}

RequestRefused::~RequestRefused() = default;

ExitStatus exitStatusOf(const std::exception& error)
{
    if (const auto* failure = dynamic_cast<const CommandFailure*>(&error)) return failure->getExitStatus();
    if (dynamic_cast<const QelMessageValidationException*>(&error) != nullptr) return ExitStatus::ProtocolBroken;
    if (const auto* stream = dynamic_cast<const StreamIOException*>(&error)) {
        return isDeadline(*stream) ? ExitStatus::DeadlinePassed : ExitStatus::ClosedByPeer;
    }
    return ExitStatus::Failed;
}

std::string explain(const std::exception& error)
{
    std::string text = error.what();
    try {
        std::rethrow_if_nested(error);
    } catch (const std::exception& cause) {
        text += ": " + explain(cause);
    } catch (...) {
        text += ": unknown cause";
    }
    return text;
}

std::string userMessage(const std::exception& error)
{
    if (dynamic_cast<const CommandFailure*>(&error) != nullptr) return explain(error);
    switch (exitStatusOf(error)) {
    case ExitStatus::ProtocolBroken:
        return "the peer broke the protocol: " + explain(error);
    case ExitStatus::DeadlinePassed:
        return "the peer did not answer in time: " + explain(error);
    case ExitStatus::ClosedByPeer:
        return "connection lost: " + explain(error);
    default:
        return explain(error);
    }
}

} // namespace qel::tool
