#include "base/StreamFailure.hpp"

#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/Error.hpp>

#include <cerrno>
#include <cstring>

namespace qel::protocol {

bool isDeadline(const StreamIOException& error)
{
    if (std::strcmp(error.what(), "I/O deadline") == 0) return true;
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

void throwStreamFailure(const StreamIOException& error, const std::string& peer)
{
    const std::string cause = explain(error);
    if (isDeadline(error)) std::throw_with_nested(DeadlinePassed("the peer did not answer in time: " + cause, peer));
    std::throw_with_nested(ClosedByPeer("connection lost: " + cause, peer));
}

} // namespace qel::protocol
