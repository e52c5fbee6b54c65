#include <qel/common/QelMessageGeneric.hpp>

namespace qel {

QelMessageGeneric::QelMessageGeneric() = default;

QelMessageGeneric::QelMessageGeneric(unsigned int i_callerId, unsigned short i_function, unsigned short i_operation,
                                     QelMessageFlags i_flags)
    : QelMessage(i_callerId, i_function, i_operation, i_flags)
{}

QelMessageGeneric::QelMessageGeneric(const char* i_buffer, unsigned int i_length) : QelMessage(i_buffer, i_length) {}

QelMessageGeneric::QelMessageGeneric(const QelMessage& i_message) : QelMessage(i_message) {}

QelMessageGeneric::QelMessageGeneric(const QelMessageGeneric& i_message) = default;

QelMessageGeneric& QelMessageGeneric::operator=(const QelMessage& i_message)
{
    QelMessage::operator=(i_message);
    return *this;
}

QelMessageGeneric& QelMessageGeneric::operator=(const QelMessageGeneric& i_message) = default;

QelMessageGeneric::~QelMessageGeneric() = default;

std::unique_ptr<QelMessage> QelMessageGeneric::clone() const { return std::make_unique<QelMessageGeneric>(*this); }

void QelMessageGeneric::setStatus(QelMessageStatusCodes status, unsigned short statusDetail)
{
    pGetHeader()->mStatus = status;
    if (ExtendedHeader* const extended = pGetExtendedHeader()) extended->mStatusDetail = statusDetail;
}

void QelMessageGeneric::setData(const char* i_data, unsigned int i_length) { pSetData(i_data, i_length); }

} // namespace qel
