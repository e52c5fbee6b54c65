#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>

#include <memory>
#include <tuple>

namespace qel {

namespace detail {

/// Out of line, so that not every message type carries the code.
/// @throws QelMessageValidationException "bad operation", always
[[noreturn]] QEL_EXPORT void throwBadOperation();

} // namespace detail

/// Base of every typed message: binds a class to one identity, which is a function code, an operation and a
/// classification. It writes the identity to frames that are built and checks it in frames that are received.
///
/// A message class looks like this:
/// @code
/// class QEL_EXPORT ExampleReq : public QelMessageMetadata<ExampleReq, function, operation, classification> {
/// public:
///     explicit ExampleReq(const std::string& text)                       // built: one allocation of the final size
///         : QelMessageMetadata(PayloadLength(sizeof(Data) + text.size())) // zeros and a new caller id
///     {
///         pPayload<Data>().mLength = ...;                                 // filled in place
///     }
///     ExampleReq(const char* i_buffer, unsigned int i_length)            // received: frame, then identity ...
///         : QelMessageMetadata(i_buffer, i_length)
///     {
///         if (dataLength() < sizeof(Data)) throw ...;                     // ... then the payload
///     }
///     ~ExampleReq() override;                                            // defined in the .cpp
/// };
/// @endcode
/// A class without payload inherits all constructors (`using QelMessageMetadata::QelMessageMetadata;`). A template
/// between this one and the concrete class writes the length as `QelMessage::PayloadLength`.
///
/// Ownership, lifetime and thread safety: as QelMessage.
/// @tparam T the concrete class, which derives from this one and can be copied
/// @tparam FunctionCode with OpType and Classification the identity: the key of the class in a registry
template <typename T, QelMessageFunctionCodes FunctionCode, QelMessageOpTypes OpType,
          QelMessageClassification::Value Classification>
class QEL_EXPORT QelMessageMetadata : public QelMessage {
public:
    /// @return the identity: function code, operation, classification
    static constexpr std::tuple<unsigned short, unsigned short, QelMessageClassification::Value> getMessageID()
    {
        return {static_cast<unsigned short>(FunctionCode), static_cast<unsigned short>(OpType), Classification};
    }

    /// Builds a message without payload, with a new caller id from QelMessage::generateNextUint32().
    QelMessageMetadata() : QelMessageMetadata(generateNextUint32()) {}

    /// Builds a message without payload.
    /// @param callerId for a response, the caller id of its request
    explicit QelMessageMetadata(unsigned int callerId)
        : QelMessage(callerId, FunctionCode, OpType, QelMessageClassification::toFlags(Classification))
    {}

    /// Parses a received frame: checks the frame, then its identity, and keeps a copy.
    /// @param i_buffer at least `i_length` readable bytes; not kept
    /// @param i_length bytes
    /// @throws QelMessageValidationException as QelMessage does, then "bad operation"
    QelMessageMetadata(const char* i_buffer, unsigned int i_length) : QelMessage(i_buffer, i_length)
    {
        pValidateOperation();
    }

    QelMessageMetadata(const QelMessageMetadata&) = default;
    QelMessageMetadata& operator=(const QelMessageMetadata&) = default;
    ~QelMessageMetadata() override = default;

    /// @return a new T with a copy of the frame; never null
    std::unique_ptr<QelMessage> clone() const override { return std::make_unique<T>(static_cast<const T&>(*this)); }

protected:
    /// Builds a message with a payload of zeros and a new caller id, for classes that fill the payload in place. The
    /// caller id is drawn after the argument is evaluated: an argument check that throws uses up no id.
    /// @throws std::invalid_argument "length": the frame length would not fit its 32-bit field
    explicit QelMessageMetadata(PayloadLength i_payloadLength)
        : QelMessageMetadata(generateNextUint32(), i_payloadLength)
    {}

    /// The same with a given caller id.
    /// @param callerId for a response, the caller id of its request
    /// @param i_payloadLength bytes
    /// @throws std::invalid_argument "length": the frame length would not fit its 32-bit field
    QelMessageMetadata(unsigned int callerId, PayloadLength i_payloadLength)
        : QelMessage(callerId, FunctionCode, OpType, QelMessageClassification::toFlags(Classification), i_payloadLength)
    {}

    /// Checks that the frame carries the identity of this class. Meaningless flag bits are ignored.
    /// @throws QelMessageValidationException "bad operation": any part of the identity differs
    void pValidateOperation() const
    {
        if (getFunction() != FunctionCode || getOperation() != OpType || getClassification() != Classification) {
            detail::throwBadOperation();
        }
    }
};

} // namespace qel
