#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/StreamFormatters.hpp>

namespace qel {

QelMessageValidationException::QelMessageValidationException(const char* what) : std::runtime_error(what) {}

QelMessageValidationException::QelMessageValidationException(const std::string& what) : std::runtime_error(what) {}

QelMessageValidationException::~QelMessageValidationException() = default;

QelMessageStatusException::QelMessageStatusException(const QelMessage& message)
    : QelMessageValidationException("QEL message " + toString(message.getLogID()) + " contains a bad status code")
{}

QelMessageStatusException::~QelMessageStatusException() = default;

QelMessageCastException::QelMessageCastException(const QelMessage& message, const std::string& typeName)
    : QelMessageValidationException("Failed to cast message " + toString(message.getLogID()) + " to type " + typeName)
{}

QelMessageCastException::~QelMessageCastException() = default;

} // namespace qel
