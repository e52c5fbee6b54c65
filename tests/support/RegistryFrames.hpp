#pragma once

#include <qel/common/QelMessageRegistry.hpp>

#include "support/Bytes.hpp"
#include "support/RawFrame.hpp"

#include <memory>
#include <tuple>
#include <typeinfo>
#include <vector>

namespace qel::test {

/// What a registry makes of a frame, which it gets in a block of its exact length.
inline std::unique_ptr<QelMessage> deserialize(const QelMessageRegistry& registry, const std::vector<char>& frame)
{
    return registry.deserialize(heapCopy(frame).get(), static_cast<unsigned int>(frame.size()));
}

inline const std::type_info& classOf(const QelMessage& message) { return typeid(message); }

/// A frame of the new form without a payload.
inline RawFrame frameOfIdentity(const QelMessageRegistry::Identifier& identity)
{
    RawFrame frame = RawFrame::newForm();
    frame.callerId(0x1234).function(std::get<0>(identity)).operation(std::get<1>(identity));
    return frame.flags(QelMessageClassification::toFlags(std::get<2>(identity)));
}

} // namespace qel::test
