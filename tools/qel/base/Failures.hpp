#pragma once

#include <qel/common/QelMessage.hpp>

#include "base/ExitStatus.hpp"

#include <exception>
#include <stdexcept>
#include <string>

namespace qel::tool {

/// A command gives up; says with which exit status and, in what(), why, as one line for a person to read.
class CommandFailure : public std::runtime_error {
public:
    CommandFailure(ExitStatus status, const std::string& reason);
    ~CommandFailure() override;

    ExitStatus getExitStatus() const noexcept { return mStatus; }

private:
    ExitStatus mStatus;
};

/// The other end answered a request with a status other than zero. Ends a command with ExitStatus::Refused.
class RequestRefused : public CommandFailure {
public:
    /// @param step  what was asked for, in a word or two, such as "open session"
    /// @param response  borrowed for the call; its status and status detail are kept
    RequestRefused(const std::string& step, const QelMessage& response);
    ~RequestRefused() override;

    const std::string& getStep() const noexcept { return mStep; }
    QelMessageStatusCodes getStatus() const noexcept { return mStatus; }
    unsigned short getStatusDetail() const noexcept { return mStatusDetail; }

private:
    std::string mStep;
    QelMessageStatusCodes mStatus;
    unsigned short mStatusDetail;
};

/// Which exit status an exception of the library or of this program ends a command with:
/// CommandFailure its own; QelMessageValidationException ProtocolBroken; StreamIOException DeadlinePassed when a
/// deadline passed and ClosedByPeer otherwise; everything else Failed.
ExitStatus exitStatusOf(const std::exception& error);

/// One line that says what happened, the nested causes included: "outer: inner".
std::string explain(const std::exception& error);

/// The line for whoever typed the command: explain(), and in front of what the library says of a connection, which is a
/// short phrase such as "EOF", what that means for the command. A CommandFailure says so itself.
std::string userMessage(const std::exception& error);

} // namespace qel::tool
