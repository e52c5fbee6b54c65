#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/TypeInfo.hpp>

#include <memory>
#include <stdexcept>
#include <typeinfo>

/// @file
/// Casts from a message, as a registry or a stream returns it, to its class. The class of the object decides, not the
/// identity in its header: a frame that its class refused is a plain QelMessage.
///
/// Thread safety: as the message, which belongs to one thread at a time.

namespace qel {

/// Moves a message into a pointer to its class.
/// @param message the owner; null after success, unchanged after a failure, so that the message can still be handled
/// @return the same message; never null
/// @throws QelMessageCastException the message is not a T; the text names T
/// @throws std::invalid_argument "message": the pointer is null
template <typename T>
std::unique_ptr<T> qelMessageCast(std::unique_ptr<QelMessage>& message)
{
    if (message == nullptr) throw std::invalid_argument("message");
    T* const typed = dynamic_cast<T*>(message.get());
    if (typed == nullptr) throw QelMessageCastException(*message, TypeInfo::demangleSymbol(typeid(T).name()));
    static_cast<void>(message.release());
    return std::unique_ptr<T>(typed);
}

/// Views a message as its class.
/// @return the same object; valid as long as `message`
/// @throws QelMessageCastException the message is not a T; the text names T
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
