#pragma once

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

/// The exit status for an exception: CommandFailure has its own; each error of the library has one in a table;
/// QelMessageValidationException is ProtocolBroken; everything else is Failed.
ExitStatus exitStatusOf(const std::exception& error);

/// The line that the user reads. The library's phrase about a connection is short, such as "EOF", so what it means for
/// the command comes first: "connection lost: EOF". A CommandFailure is complete as it is; an error of the library gets
/// the option that it is about, and a StatusError the words of refusalText().
std::string userMessage(const std::exception& error);

} // namespace qel::tool
