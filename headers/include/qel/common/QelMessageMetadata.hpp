#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>

#include <memory>
#include <tuple>

namespace qel {

namespace detail {

/// @throws QelMessageValidationException "bad operation". Out of line, so that not every message type carries it.
[[noreturn]] QEL_EXPORT void throwBadOperation();

} // namespace detail

/// Base of every typed message: ties a class to one function code, operation and classification. It writes them into
/// frames that are built and checks them in frames that are received.
///
/// How a message class is made of it:
/// @code
/// class QEL_EXPORT ExampleReq : public QelMessageMetadata<ExampleReq, function, operation, classification> {
/// public:
///     explicit ExampleReq(const std::string& text)                       // built: one allocation of the final size
///         : QelMessageMetadata(PayloadLength(sizeof(Data) + text.size())) // all zeros, new caller id
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
/// A class without payload takes over all constructors (`using QelMessageMetadata::QelMessageMetadata;`). A template
/// between this one and the concrete class names the length `QelMessage::PayloadLength`.
///
/// @tparam T the concrete class, which derives from this one and can be copied
/// @tparam FunctionCode,OpType,Classification the identity; the key under which a registry knows the class
/// Ownership and thread safety: as QelMessage.
template <typename T, QelMessageFunctionCodes FunctionCode, QelMessageOpTypes OpType,
          QelMessageClassification::Value Classification>
class QEL_EXPORT QelMessageMetadata : public QelMessage {
public:
    /// The identity: function code, operation, classification.
    static constexpr std::tuple<unsigned short, unsigned short, QelMessageClassification::Value> getMessageID()
    {
        return {static_cast<unsigned short>(FunctionCode), static_cast<unsigned short>(OpType), Classification};
    }

    /// A new message without payload and with a caller id of its own from QelMessage::generateNextUint32().
    QelMessageMetadata() : QelMessageMetadata(generateNextUint32()) {}

    /// A new message without payload; a response is given the caller id of the request it answers.
    explicit QelMessageMetadata(unsigned int callerId)
        : QelMessage(callerId, FunctionCode, OpType, QelMessageClassification::toFlags(Classification))
    {}

    /// Takes a received frame: checks the frame, then its identity, and keeps a copy.
    /// @param i_buffer at least `i_length` readable bytes; not kept
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
    /// A new message with a payload of zeros and a caller id of its own, for classes that fill the payload in place.
    /// @throws std::invalid_argument "length": the frame length would not fit its 32-bit field
    explicit QelMessageMetadata(PayloadLength i_payloadLength)
        : QelMessageMetadata(generateNextUint32(), i_payloadLength)
    {}

    /// The same with a given caller id: a response is given that of the request it answers.
    QelMessageMetadata(unsigned int callerId, PayloadLength i_payloadLength)
        : QelMessage(callerId, FunctionCode, OpType, QelMessageClassification::toFlags(Classification), i_payloadLength)
    {}

    /// Checks that the frame carries the identity of this class; flag bits without a meaning do not count.
    /// @throws QelMessageValidationException "bad operation", whichever part of the identity differs
    void pValidateOperation() const
    {
        if (getFunction() != FunctionCode || getOperation() != OpType || getClassification() != Classification) {
            detail::throwBadOperation();
        }
    }
};

} // namespace qel
