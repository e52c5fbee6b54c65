#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/protocol/Error.hpp>

#include "base/ExitStatus.hpp"
#include "base/Library.hpp"

#include <exception>
#include <stdexcept>
#include <string>

namespace qel::tool {

/// Ends a command: carries the exit status and, in what(), the reason in one line for a person.
class CommandFailure : public std::runtime_error {
public:
    CommandFailure(ExitStatus status, const std::string& reason);
    ~CommandFailure() override;

    ExitStatus getExitStatus() const noexcept { return mStatus; }

private:
    ExitStatus mStatus;
};

/// The peer answered a request with a status other than zero. Ends a command with ExitStatus::Refused.
/// what() is the reason in words, then the status: "partition 3 is held by another console; --force takes it:
/// 0x00000013 (QelMessageStatusConnectionNotAvailable)". See refusalReason().
class RequestRefused : public CommandFailure {
public:
    /// @param step  the name of the request, such as "open session"; part of what() only for an unknown status
    /// @param response  borrowed for the call; its status and status detail are kept
    /// @param subject  what the request is about, as refusalReason() takes it
    RequestRefused(const std::string& step, const QelMessage& response, const std::string& subject = {});
    ~RequestRefused() override;

    const std::string& getStep() const noexcept { return mStep; }
    QelMessageStatusCodes getStatus() const noexcept { return mStatus; }
    unsigned short getStatusDetail() const noexcept { return mStatusDetail; }

private:
    std::string mStep;
    QelMessageStatusCodes mStatus;
    unsigned short mStatusDetail;
};

/// The exit status for an exception: CommandFailure has its own; each error of the library has one in a table;
/// QelMessageValidationException is ProtocolBroken; StreamIOException is DeadlinePassed when a deadline passed, else
/// ClosedByPeer; everything else is Failed.
ExitStatus exitStatusOf(const std::exception& error);

/// The line that the user reads. The library's phrase about a connection is short, such as "EOF", so what it means for
/// the command comes first: "connection lost: EOF". A CommandFailure is complete as it is; an error of the library gets
/// the option that it is about.
std::string userMessage(const std::exception& error);

} // namespace qel::tool
