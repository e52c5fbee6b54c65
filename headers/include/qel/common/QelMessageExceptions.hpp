#pragma once

#include <qel/common/QelExport.hpp>

#include <stdexcept>
#include <string>

namespace qel {

class QelMessage;

/// Bytes are no valid frame, a frame is not the message it was taken for, or its payload breaks the rules of its type.
/// what() is a short fixed phrase such as "i_buffer bad eyecatcher"; the values behind it are in the log.
class QEL_EXPORT QelMessageValidationException : public std::runtime_error {
public:
    explicit QelMessageValidationException(const char* what);
    explicit QelMessageValidationException(const std::string& what);
    ~QelMessageValidationException() override;
};

/// A message carries a status other than zero; thrown by QelMessage::checkStatus().
/// what() reads "QEL message [CID: ...] contains a bad status code", with the whole ID line in the middle.
class QEL_EXPORT QelMessageStatusException : public QelMessageValidationException {
public:
    explicit QelMessageStatusException(const QelMessage& message);
    ~QelMessageStatusException() override;
};

/// A message is not of the class it was cast to; thrown by qelMessageCast().
/// what() reads "Failed to cast message [CID: ...] to type <class>", with the whole ID line in the middle.
class QEL_EXPORT QelMessageCastException : public QelMessageValidationException {
public:
    /// @param typeName readable name of the class that was wanted
    QelMessageCastException(const QelMessage& message, const std::string& typeName);
    ~QelMessageCastException() override;
};

} // namespace qel
