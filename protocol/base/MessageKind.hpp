#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageRegistry.hpp>

namespace qel::protocol {

/// Function, operation and classification of a message, as T::getMessageID() has those of a class.
inline QelMessageRegistry::Identifier kindOf(const QelMessage& message)
{
    return {static_cast<unsigned short>(message.getFunction()), static_cast<unsigned short>(message.getOperation()),
            message.getClassification()};
}

/// True when function, operation and classification of a message are those of class T, whatever the class of the
/// object: a message whose payload did not parse, or that a registry does not know, is a plain QelMessage.
template <typename T>
bool isKind(const QelMessage& message)
{
    return kindOf(message) == T::getMessageID();
}

} // namespace qel::protocol
