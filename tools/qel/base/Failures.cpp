#include "base/Failures.hpp"

#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/PosixError.hpp>

#include <cerrno>
#include <cstring>

namespace qel::tool {

namespace {

// The stream layer reports a passed deadline in two shapes: with this text when it had passed before the wait began,
// and as the system's "try again" when it passed during the wait.
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

} // namespace

CommandFailure::CommandFailure(ExitStatus status, const std::string& reason)
    : std::runtime_error(reason), mStatus(status)
{}

CommandFailure::~CommandFailure() = default;

RequestRefused::RequestRefused(const std::string& step, const QelMessage& response)
    : CommandFailure(ExitStatus::Refused, step + " refused: " + toString(response.getStatus())), mStep(step),
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
        return "the other end broke the protocol: " + explain(error);
    case ExitStatus::DeadlinePassed:
        return "the other end did not answer in time: " + explain(error);
    case ExitStatus::ClosedByPeer:
        return "connection lost: " + explain(error);
    default:
        return explain(error);
    }
}

} // namespace qel::tool
