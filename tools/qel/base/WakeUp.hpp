#pragma once

#include <qel/common/util/Poll.hpp>
#include <qel/common/util/PosixError.hpp>

#include <cerrno>

namespace qel::tool {

/// A PollInterrupt that is known to work. One that found no descriptor would fail only when it is needed, in the middle
/// of something that cannot fail.
class WakeUp : public PollInterrupt {
public:
    /// @throws PosixError  no descriptor is left
    WakeUp()
    {
        if (getPollFd().mFd.fd < 0) throw PosixError(EMFILE, "cannot open a wake-up");
    }
};

} // namespace qel::tool
