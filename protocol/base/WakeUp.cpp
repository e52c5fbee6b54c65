#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/WakeUp.hpp>

#include <cerrno>

namespace qel::protocol {

WakeUp::WakeUp()
{
    if (getPollFd().mFd.fd < 0) throw PosixError(EMFILE, "cannot open a wake-up");
}

} // namespace qel::protocol
