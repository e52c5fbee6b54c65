#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>

#include <memory>

namespace qel {

/// A message of any identity, for those who build or change a frame by hand: it can be given a payload and a status,
/// which the typed messages cannot.
/// @code
/// QelMessageGeneric refused(response);   // the same bytes as the typed response ...
/// refused.setStatus(QelMessageStatusInvalidData); // ... with a status
/// @endcode
/// Ownership and thread safety: as QelMessage.
class QEL_EXPORT QelMessageGeneric : public QelMessage {
public:
    /// A frame of the new form without payload: eyecatcher, version and frame length, and zeros in all other fields. No
    /// caller id is taken.
    QelMessageGeneric();

    /// A frame of the new form without payload.
    QelMessageGeneric(unsigned int i_callerId, unsigned short i_function, unsigned short i_operation,
                      QelMessageFlags i_flags);

    /// Checks received bytes and keeps a copy of the frame they begin with, whatever its identity.
    /// @param i_buffer at least `i_length` readable bytes; not kept
    /// @throws QelMessageValidationException as QelMessage does
    QelMessageGeneric(const char* i_buffer, unsigned int i_length);

    /// Copies the frame of any message; its type is not kept.
    QelMessageGeneric(const QelMessage& i_message);
    QelMessageGeneric(const QelMessageGeneric& i_message);

    /// Replaces the frame with a copy of the other's. Self-assignment is not provided for, as in QelMessage.
    QelMessageGeneric& operator=(const QelMessage& i_message);
    QelMessageGeneric& operator=(const QelMessageGeneric& i_message);

    ~QelMessageGeneric() override;

    /// @return a new QelMessageGeneric with a copy of the frame; never null
    std::unique_ptr<QelMessage> clone() const override;

    /// Sets the status, and the detail where the header has room for it: the old form has not and drops it.
    void setStatus(QelMessageStatusCodes status, unsigned short statusDetail = 0);

    /// Replaces the payload with a copy of the bytes; all header fields but the lengths stay as they are. The bytes may
    /// lie in this message's own payload.
    /// @param i_data `i_length` bytes; may be null when `i_length` is 0
    /// @throws std::invalid_argument "data": null with a length other than 0; "length": the frame length would not fit
    ///         its 32-bit field; nothing is changed
    void setData(const char* i_data, unsigned int i_length);
};

} // namespace qel
