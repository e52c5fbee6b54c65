#pragma once

#include <qel/common/QelMessage.hpp>

#include <tuple>

namespace qel::protocol {

/// True when function, operation and classification of a message are those of class T, whatever the class of the
/// object: a message whose payload did not parse, or that a registry does not know, is a plain QelMessage.
template <typename T>
bool isKind(const QelMessage& message)
{
    return std::make_tuple(static_cast<unsigned short>(message.getFunction()),
                           static_cast<unsigned short>(message.getOperation()),
                           message.getClassification()) == T::getMessageID();
}

} // namespace qel::protocol
