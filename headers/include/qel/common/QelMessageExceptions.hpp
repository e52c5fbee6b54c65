#pragma once

#include <qel/common/QelExport.hpp>

#include <stdexcept>
#include <string>

namespace qel {

class QelMessage;

/// A malformed frame, a frame whose identity is not that of the class, or a payload or argument that breaks the rules
/// of the class. what() is a short fixed phrase such as "i_buffer bad eyecatcher". For a malformed frame the values are
/// in the log. Lifetime and thread safety: as std::runtime_error; no exception of this file keeps a reference to a
/// message.
class QEL_EXPORT QelMessageValidationException : public std::runtime_error {
public:
    explicit QelMessageValidationException(const char* what);
    explicit QelMessageValidationException(const std::string& what);
    ~QelMessageValidationException() override;
};

/// A message carries a status other than zero; thrown by QelMessage::checkStatus().
/// what() reads "QEL message [CID: ...] contains a bad status code", with the whole ID line in the brackets.
class QEL_EXPORT QelMessageStatusException : public QelMessageValidationException {
public:
    /// @param message read now and not kept
    explicit QelMessageStatusException(const QelMessage& message);
    ~QelMessageStatusException() override;
};

/// A message is not of the class it was cast to; thrown by qelMessageCast().
/// what() reads "Failed to cast message [CID: ...] to type" and the name of the class, with the whole ID line in the
/// brackets.
class QEL_EXPORT QelMessageCastException : public QelMessageValidationException {
public:
    /// @param message read now and not kept
    /// @param typeName readable name of the target class
    QelMessageCastException(const QelMessage& message, const std::string& typeName);
    ~QelMessageCastException() override;
};

} // namespace qel
