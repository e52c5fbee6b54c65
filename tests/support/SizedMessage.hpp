#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageGeneric.hpp>

#include <memory>
#include <stdexcept>
#include <vector>

namespace qel::test {

/// A message whose whole frame has the given length, for tests that count bytes.
class SizedMessage : public QelMessageGeneric {
public:
    static constexpr unsigned int kSmallest = 32; // a header alone

    /// @param length  bytes of the frame, kSmallest or more
    explicit SizedMessage(unsigned int length, unsigned int callerId = 0, unsigned short function = 0x6003,
                          unsigned short operation = 0x8001)
        : QelMessageGeneric(callerId, function, operation, NoFlagSet)
    {
        if (length < kSmallest) throw std::invalid_argument("shorter than a header");
        pAllocData(length - kSmallest);
    }
};

inline std::unique_ptr<QelMessage> sized(unsigned int length, unsigned int callerId = 0)
{
    return std::make_unique<SizedMessage>(length, callerId);
}

} // namespace qel::test
