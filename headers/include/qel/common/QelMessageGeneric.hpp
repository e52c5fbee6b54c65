#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>

#include <memory>

namespace qel {

/// A message of any identity, for programs that build or change a frame field by field. Unlike a typed message it can
/// be given a payload and a status:
/// @code
/// QelMessageGeneric refused(response);            // the same bytes as the typed response ...
/// refused.setStatus(QelMessageStatusInvalidData); // ... with a status
/// @endcode
/// Ownership, lifetime and thread safety: as QelMessage.
class QEL_EXPORT QelMessageGeneric : public QelMessage {
public:
    /// Builds a frame of the new form without payload: eyecatcher, version and frame length; all other fields are zero.
    /// Draws no caller id.
    QelMessageGeneric();

    /// Builds a frame of the new form without payload.
    QelMessageGeneric(unsigned int i_callerId, unsigned short i_function, unsigned short i_operation,
                      QelMessageFlags i_flags);

    /// Checks received bytes and copies the frame that they begin with, whatever its identity.
    /// @param i_buffer at least `i_length` readable bytes; not kept
    /// @param i_length bytes
    /// @throws QelMessageValidationException as QelMessage does
    QelMessageGeneric(const char* i_buffer, unsigned int i_length);

    /// Copies the frame of any message, but not its type.
    QelMessageGeneric(const QelMessage& i_message);
    QelMessageGeneric(const QelMessageGeneric& i_message);

    /// Replaces the frame with a copy of the other's. Self-assignment loses the contents, as in QelMessage.
    QelMessageGeneric& operator=(const QelMessage& i_message);
    QelMessageGeneric& operator=(const QelMessageGeneric& i_message);

    ~QelMessageGeneric() override;

    /// @return a new QelMessageGeneric with a copy of the frame; never null
    std::unique_ptr<QelMessage> clone() const override;

    /// Sets the status and, in a header of the new form, the status detail. The old form has no detail: it is dropped.
    void setStatus(QelMessageStatusCodes status, unsigned short statusDetail = 0);

    /// Replaces the payload with a copy of the bytes. Of the header only the lengths change. The bytes may lie in this
    /// message's own payload.
    /// @param i_data `i_length` bytes; may be null when `i_length` is 0
    /// @param i_length bytes of the new payload
    /// @throws std::invalid_argument "data": null with a length other than 0; "length": the frame length would not fit
    ///         its 32-bit field; nothing changes
    void setData(const char* i_data, unsigned int i_length);
};

} // namespace qel
