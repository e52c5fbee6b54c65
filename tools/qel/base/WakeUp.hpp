#pragma once

#include <qel/common/util/Poll.hpp>
#include <qel/common/util/PosixError.hpp>

#include <cerrno>

namespace qel::tool {

/// A PollInterrupt that reports a missing descriptor on construction rather than when it is used.
class WakeUp : public PollInterrupt {
public:
    /// @throws PosixError  the descriptor cannot be created
    WakeUp()
    {
        if (getPollFd().mFd.fd < 0) throw PosixError(EMFILE, "cannot open a wake-up");
    }
};

} // namespace qel::tool
