#pragma once

#include <qel/common/util/BitmaskEnum.hpp>

#include <type_traits>

namespace qel {

/// How QelMessageQueue::enqueue() treats a message. The values are bits; combine them with the operators of
/// util/BitmaskEnum.hpp.
enum class MessageQueuingOptions : int {
    DEFAULT = 0,      ///< normal priority; dropped when the queue is over its limit
    BLOCKING = 1,     ///< wait for room instead of being dropped
    LOW_PRIORITY = 2, ///< admitted only up to half of the limit
    BEST_EFFORT = 4   ///< for the use of the producer; the queue ignores it
};

template <>
struct is_bitmask_enum<MessageQueuingOptions> : std::true_type {};

} // namespace qel
