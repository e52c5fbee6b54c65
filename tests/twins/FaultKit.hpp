#pragma once

#include "check/Messages.hpp"
#include "twins/Twin.hpp"

#include <functional>
#include <string>
#include <utility>
#include <vector>

/// @file
/// How most faults are made.

namespace qel::test {

using Change = std::function<void(TwinFrame&)>;

/// A fault in frames of the console or of the server.
inline Fault upFault(std::string name, std::function<void(TwinLink&, TwinFrame)> up)
{
    Fault fault;
    fault.name = std::move(name);
    fault.up = std::move(up);
    return fault;
}
inline Fault downFault(std::string name, std::function<void(TwinLink&, TwinFrame)> down)
{
    Fault fault;
    fault.name = std::move(name);
    fault.down = std::move(down);
    return fault;
}

/// A fault that nearly every case meets, tried with some cases only.
inline Fault only(Fault fault, std::vector<std::string> cases)
{
    fault.only = std::move(cases);
    return fault;
}

/// The same, before a server whose deadlines are short.
inline Fault onlyInTime(Fault fault, std::vector<std::string> cases)
{
    fault.inTime = true;
    return only(std::move(fault), std::move(cases));
}

/// Responses to one operation are changed.
inline Fault response(std::string name, unsigned int function, unsigned int operation, Change change)
{
    return downFault(std::move(name), [=](TwinLink& link, TwinFrame frame) {
        if (frame.isResponse() && frame.is(function, operation)) change(frame);
        link.toConsole(frame);
    });
}

/// Responses to one operation have another status. One that becomes good stays without payload.
inline Fault status(std::string name, unsigned int function, unsigned int operation, unsigned int from, unsigned int to)
{
    return response(std::move(name), function, operation, [=](TwinFrame& frame) {
        if (frame.status() == from) frame.put(22, 2, to);
    });
}

/// The same for all operations.
inline Fault statusOfAll(std::string name, unsigned int from, unsigned int to)
{
    return downFault(std::move(name), [=](TwinLink& link, TwinFrame frame) {
        if (frame.isResponse() && frame.status() == from) frame.put(22, 2, to);
        link.toConsole(frame);
    });
}

/// Good responses to one operation have another payload.
inline Fault payload(std::string name, unsigned int function, unsigned int operation,
                     std::function<std::string(std::string)> make)
{
    return response(std::move(name), function, operation, [=](TwinFrame& frame) {
        if (frame.status() == 0) frame.setPayload(make(frame.payload()));
    });
}

/// Notices of one operation are changed.
inline Fault notice(std::string name, unsigned int function, unsigned int operation, Change change)
{
    return downFault(std::move(name), [=](TwinLink& link, TwinFrame frame) {
        if (frame.isNotice() && frame.is(function, operation)) change(frame);
        link.toConsole(frame);
    });
}

/// Frames of the console are changed before the server sees them.
inline Fault seen(std::string name, Change change)
{
    return upFault(std::move(name), [=](TwinLink& link, TwinFrame frame) {
        change(frame);
        link.toServer(frame);
    });
}

/// Frames of the console that meet a condition end the connection.
inline Fault closesFor(std::string name, std::function<bool(const TwinFrame&)> isMeant)
{
    return upFault(std::move(name), [=](TwinLink& link, TwinFrame frame) {
        if (isMeant(frame)) return link.cut();
        link.toServer(frame);
    });
}

/// Frames of the console that meet a condition are dropped.
inline Fault ignores(std::string name, std::function<bool(const TwinFrame&)> isMeant)
{
    return upFault(std::move(name), [=](TwinLink& link, TwinFrame frame) {
        if (!isMeant(frame)) link.toServer(frame);
    });
}

/// Requests that meet a condition get a status.
inline Fault refuses(std::string name, unsigned int status, std::function<bool(const TwinFrame&)> isMeant)
{
    return upFault(std::move(name), [=](TwinLink& link, TwinFrame frame) {
        if (frame.isRequest() && isMeant(frame)) return link.toConsole(frame.response(status));
        link.toServer(frame);
    });
}

} // namespace qel::test
