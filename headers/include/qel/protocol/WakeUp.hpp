#pragma once

#include <qel/common/util/Poll.hpp>
#include <qel/protocol/ProtocolExport.hpp>

namespace qel::protocol {

/// A PollInterrupt that reports a missing descriptor on construction rather than when it is used. Any thread may call
/// interrupt(), which makes getPollFd() readable; the waiting thread calls eoi().
class QEL_PROTOCOL_EXPORT WakeUp : public PollInterrupt {
public:
    /// @throws PosixError  "cannot open a wake-up": there is no descriptor for it
    WakeUp();
};

} // namespace qel::protocol
