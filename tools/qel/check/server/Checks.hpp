#pragma once

#include "check/Trial.hpp"

#include <cstddef>
#include <string>

/// @file
/// What several families of cases check, and how most of their cases look.

namespace qel::tool::check {

/// Sends a request that must have exactly one response, with status 0. @return it
Frame onlyResponse(Wire& wire, const Draft& request);

/// Fails unless a response has the header that the tables say: its request's function and operation, 0x40 alone in its
/// flags, no pad, and zero in the reserved fields.
void requireResponseHeader(const Frame& response, unsigned int function, unsigned int operation);

/// Fails unless a notice has such a header.
void requireNoticeHeader(const Frame& notice);

void requirePayload(const Frame& frame, std::size_t length);
void requireZero(const Frame& frame, std::size_t begin, std::size_t end, const std::string& what);

/// How a case prepares the connection on which it sends its request.
using Prepare = Wire& (*)(Trial&);
Wire& connected(Trial& trial);
Wire& identified(Trial& trial);
Wire& withSession(Trial& trial);

/// A case that sends one request, which gets a status.
/// @param prepare  the connection to send it on
Case getsStatus(std::string id, std::string requirement, const char* anchor, Level level, Prepare prepare,
                Draft request, unsigned int status, unsigned int needs = kNothing);

/// The same for a payload that does not parse: status 3, an empty payload, and the connection goes on.
Case isInvalid(std::string id, std::string requirement, const char* anchor, Prepare prepare, Draft request);

/// A case that sends one message that has no answer and no effect.
Case isIgnored(std::string id, std::string requirement, const char* anchor, Level level, Prepare prepare,
               Draft message);

/// Joins families. @param parts  functions that return cases
template <typename... Parts>
Cases joined(Parts... parts)
{
    Cases all;
    for (Cases (*const part)() : {static_cast<Cases (*)()>(parts)...}) {
        for (Case& aCase : part())
            all.push_back(std::move(aCase));
    }
    return all;
}

} // namespace qel::tool::check
