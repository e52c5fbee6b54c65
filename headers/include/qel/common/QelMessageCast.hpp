#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/TypeInfo.hpp>

#include <memory>
#include <stdexcept>
#include <typeinfo>

/// @file
/// From a message as a registry or a stream returns it to the class it is of. The casts go by the class of the object,
/// not by the identity in its header: a frame that its own class refused is a plain QelMessage whatever it claims to
/// be.

namespace qel {

/// Hands a message over as the class it is of.
/// @param message the owner; null after success, untouched after a failure, so that the message can still be handled
/// @return the same message; never null
/// @throws QelMessageCastException the message is not a T; names T
/// @throws std::invalid_argument "message": there is no message
template <typename T>
std::unique_ptr<T> qelMessageCast(std::unique_ptr<QelMessage>& message)
{
    if (message == nullptr) throw std::invalid_argument("message");
    T* const typed = dynamic_cast<T*>(message.get());
    if (typed == nullptr) throw QelMessageCastException(*message, TypeInfo::demangleSymbol(typeid(T).name()));
    static_cast<void>(message.release());
    return std::unique_ptr<T>(typed);
}

/// Views a message as the class it is of.
/// @return the same object
/// @throws QelMessageCastException the message is not a T; names T
template <typename T>
const T& qelMessageCast(const QelMessage& message)
{
    const T* const typed = dynamic_cast<const T*>(&message);
    if (typed == nullptr) throw QelMessageCastException(message, TypeInfo::demangleSymbol(typeid(T).name()));
    return *typed;
}

/// @overload
template <typename T>
T& qelMessageCast(QelMessage& message)
{
    return const_cast<T&>(qelMessageCast<T>(static_cast<const QelMessage&>(message)));
}

} // namespace qel
