#pragma once

#include <qel/common/HexWidth.hpp>
#include <qel/common/QelExport.hpp>
#include <qel/common/util/BitmaskEnum.hpp>

#include <cstddef>
#include <iosfwd>
#include <type_traits>
#include <utility>

/// @file
/// The identifiers of the message header: function codes, operations, flags, status codes and the classification that
/// the flags give, and the text that each of them prints. The enumerations are unscoped and have the width of their
/// header field, so that any number a peer sends can be held, compared and printed.
///
/// Thread safety: the values are plain integers. Any thread may print them; the stream belongs to one thread at a time.
/// State of the stream: every operator here prints its number through hexFormat() and leaves the stream in upper-case
/// hexadecimal with fill character '0'. On a stream whose locale groups digits the numbers are grouped too: 0x6.003.

namespace qel {

/// Which part of the system a message addresses. Header field `mFunction`, 16 bits.
enum QEL_EXPORT QelMessageFunctionCodes : unsigned short {
    QelMessageFunctionInvalid = 0x0000,
    QelMessageFunctionQel = 0x6001, ///< internal connection handshake
    QelMessageFunctionVirtualSerial = 0x6002,
    QelMessageFunctionQelInterfaceCmp = 0x6003,
    QelMessageFunctionDax = 0x7000,      ///< asynchronous messages to the console
    QelMessageFunctionKrogBase = 0x8000, ///< first function of the hypervisor; prints as the command router
    QelMessageFunctionKrogCmdRouter = 0x8000,
    QelMessageFunctionKrogLparConfig = 0x8001,
    QelMessageFunctionKrogLparDlpar = 0x8002,
    QelMessageFunctionKrogVsp = 0x8003,
    QelMessageFunctionKrogRellAp = 0x8004,
    QelMessageFunctionKrogConcMaint = 0x8005,
    QelMessageFunctionKrogPerfCmd = 0x8006,
    QelMessageFunctionKrogMigration = 0x8007,
    QelMessageFunctionKrogHypePipe = 0x8008,
    QelMessageFunctionKrogNvRam = 0x8009,
    QelMessageFunctionQelKrog = 0x800A
};

/// The operation within a function. Header field `mOperation`, 16 bits. A value is meaningful only together with its
/// function code: 0x0001 is three different operations under three functions.
enum QEL_EXPORT QelMessageOpTypes : unsigned short {
    QelMessageOpUnspecified = 0x0000, ///< has no printed name

    // QelMessageFunctionQel
    QelMessageOpUpgradeConnection = 0x0001,
    QelMessageOpAbortHandshake = 0x0002,

    // QelMessageFunctionQelInterfaceCmp
    QelMessageOpGetEnclTypeAndInterfaceVersion = 0x0101,
    QelMessageOpOpenKrogSession = 0x0102,
    QelMessageOpCloseKrogSession = 0x0103,
    QelMessageOpExchIntCapabilities = 0x0104,
    QelMessageOpGetInterfaceImplementationLimits = 0x0105,
    QelMessageOpDaxBroadcast = 0x0106,
    QelMessageOpGetQelTod = 0x0107,
    QelMessageOpSetGlobalModeAttribute = 0x0108,
    QelMessageOpGetGlobalModeAttribute = 0x0109,
    QelMessageOpSetGlobalSaveAreaMetadata = 0x010A,
    QelMessageOpGetGlobalSaveAreaMetadata = 0x010B,

    // QelMessageFunctionVirtualSerial
    QelMessageOpOpenVirtualSerialSession = 0x0402,
    QelMessageOpCloseVirtualSerialSession = 0x0403,
    QelMessageOpGetMaxVirtualSerialSessions = 0x0404,
    QelMessageOpSendVirtualSerialDataToOs = 0x0405,
    QelMessageOpSetupVirtualSerialSession = 0x0406,

    // QelMessageFunctionDax: messages to the console, those of virtual serial sessions included
    QelMessageOpSendVirtualSerialDataToMc = 0x0401,
    QelMessageOpSendVirtualSerialSessionClosed = 0xA005,
    QelMessageOpSendKrogConnectionClosed = 0xA009,
    QelMessageOpOutboundBroadcastAsync = 0x0B0B,

    // QelMessageFunctionKrogCmdRouter
    QelMessageOpOpenKrogCmdRouterSession = 0x0001,
    QelMessageOpEnablePartitionHeartbeat = 0x810D,

    // QelMessageFunctionQelKrog
    QelMessageOpOpenQelKrogSession = 0x0001,
    QelMessageOpCloseQelKrogSession = 0x0002,
    QelMessageOpChangeNotification = 0x0003,
    QelMessageOpCertificateSigningRequest = 0x0004,
    QelMessageOpRunMacro = 0x0005,
    QelMessageOpGetConfigurablePorts = 0x0101,
    QelMessageOpGetSystemNetworkConfig = 0x0102,
    QelMessageOpGetNetworkPortIPv4Config = 0x0103,
    QelMessageOpSetNetworkPortIPv4Info = 0x8103,
    QelMessageOpGetNetworkPortIPv6Config = 0x0104,
    QelMessageOpSetNetworkPortIPv6Info = 0x8104,
    QelMessageOpSetNetworkPortStaticInfo = 0x8105,
    QelMessageOpSetRootCertificate = 0x8106,
    QelMessageOpMacroOutput = 0x8107,
    QelMessageOpGetRtadState = 0x0108,
    QelMessageOpGetResourceDumpStatus = 0x0109,
    QelMessageOpResourceDumpReady = 0x8109,
    QelMessageOpSendErrorLog = 0x810A
};

/// The result of a request. Header field `mStatus`, 16 bits; the numbers between the named ones are undefined.
enum QEL_EXPORT QelMessageStatusCodes : unsigned short {
    QelMessageStatusNoError = 0,
    QelMessageStatusInvalidOperation = 1,
    QelMessageStatusInvalidDestination = 2,
    QelMessageStatusInvalidData = 3,
    QelMessageStatusInvalidCmdSequence = 4,
    QelMessageStatusCmdFailed = 6,
    QelMessageStatusCmdTimeout = 7,
    QelMessageStatusVttyBufferFull = 9,
    QelMessageStatusInvalidFunction = 15,
    QelMessageStatusInvalidConnectionNumber = 16,
    QelMessageStatusTooManyConnections = 18,
    QelMessageStatusConnectionNotAvailable = 19,
    QelMessageStatusConnectionClosureFailure = 20,
    QelMessageStatusInvalidLparId = 21,
    QelMessageStatusKrogSessionAlreadyOpen = 23,
    QelMessageStatusDaxAlreadyConnected = 37,
    QelMessageStatusIncompatibleClient = 50,
    QelMessageStatusHypervisorGenericError = 0x8006
};

/// Status codes print eight digits, twice as many as their header field has.
template <>
struct HexWidth<QelMessageStatusCodes> : std::integral_constant<std::size_t, 8> {};

/// The flag bits of a message. Header field `mFlags`, 8 bits; the other six bits are meaningless and ignored.
enum QEL_EXPORT QelMessageFlags : unsigned char {
    NoFlagSet = 0x00,
    MsgResponse = 0x40,        ///< the message answers a request
    MsgResponseExpected = 0x80 ///< the message is a request
};

/// Flags combined with `|` and `&` stay flags, so that a combination still prints by name.
template <>
struct is_bitmask_enum<QelMessageFlags> : std::true_type {};

/// The kind of a message: request, response or asynchronous. A scope for the enumeration and its two conversions; it
/// has no objects.
struct QEL_EXPORT QelMessageClassification {
    enum Value : unsigned int {
        Unknown = 0, ///< both flags are set; no message of the protocol has this kind
        Request = 1,
        Response = 2,
        Async = 3 ///< a message that expects no response
    };

    QelMessageClassification() = delete;

    /// @return the flags of a message of this classification; NoFlagSet for `Async` and `Unknown`
    static constexpr QelMessageFlags toFlags(Value value) noexcept
    {
        return value == Request ? MsgResponseExpected : value == Response ? MsgResponse : NoFlagSet;
    }

    /// @return the classification that the two known flags give; the other six bits never change it
    static constexpr Value fromFlags(QelMessageFlags flags) noexcept
    {
        // The upper two bits count down from Async. Each received message needs this twice, so there is no branch.
        constexpr unsigned int kMeaninglessBits = 6;
        static_assert(Async - (NoFlagSet >> kMeaninglessBits) == Async &&
                          Async - (MsgResponse >> kMeaninglessBits) == Response &&
                          Async - (MsgResponseExpected >> kMeaninglessBits) == Request,
                      "the classification follows from the flags");
        return static_cast<Value>(Async - (flags >> kMeaninglessBits));
    }
};

/// Prints "0x6003 (QelMessageFunctionQelInterfaceCmp)", or "unknown function" in place of the name.
QEL_EXPORT std::ostream& operator<<(std::ostream& os, QelMessageFunctionCodes function);

/// Prints an operation of a function: "0x0101 (QelMessageOpGetEnclTypeAndInterfaceVersion)", or "unknown operation for
/// function 0x6003" in place of the name.
QEL_EXPORT std::ostream& operator<<(std::ostream& os,
                                    const std::pair<QelMessageFunctionCodes, QelMessageOpTypes>& operation);

/// Prints "0x00000004 (QelMessageStatusInvalidCmdSequence)", or "unknown status code" in place of the name. Status
/// codes print eight digits.
QEL_EXPORT std::ostream& operator<<(std::ostream& os, QelMessageStatusCodes status);

/// Prints "0xC0 (MsgResponse, MsgResponseExpected)", or "no flags set" in place of the names when neither is set.
QEL_EXPORT std::ostream& operator<<(std::ostream& os, QelMessageFlags flags);

} // namespace qel
