#include <qel/common/QelMessageIdentifiers.hpp>
#include <qel/common/StreamFormatters.hpp>

#include <map>
#include <ostream>

namespace qel {

namespace {

// The printed text is the name of the enumerator.
#define QEL_NAMED(enumerator)                                                                                          \
    {                                                                                                                  \
        enumerator, #enumerator                                                                                        \
    }
#define QEL_NAMED_OF(function, enumerator)                                                                             \
    {                                                                                                                  \
        {function, enumerator}, #enumerator                                                                            \
    }

/// @return the name of a value; null when it has none
template <typename Key>
const char* findName(const std::map<Key, const char*>& names, const Key& key)
{
    const auto found = names.find(key);
    return found == names.end() ? nullptr : found->second;
}

using FunctionNames = std::map<QelMessageFunctionCodes, const char*>;
using OperationNames = std::map<std::pair<QelMessageFunctionCodes, QelMessageOpTypes>, const char*>;
using StatusNames = std::map<QelMessageStatusCodes, const char*>;

const FunctionNames& functionNames()
{
    static const FunctionNames names = {
        QEL_NAMED(QelMessageFunctionInvalid),
        QEL_NAMED(QelMessageFunctionQel),
        QEL_NAMED(QelMessageFunctionVirtualSerial),
        QEL_NAMED(QelMessageFunctionQelInterfaceCmp),
        QEL_NAMED(QelMessageFunctionDax),
        QEL_NAMED(QelMessageFunctionKrogCmdRouter),
        QEL_NAMED(QelMessageFunctionKrogLparConfig),
        QEL_NAMED(QelMessageFunctionKrogLparDlpar),
        QEL_NAMED(QelMessageFunctionKrogVsp),
        QEL_NAMED(QelMessageFunctionKrogRellAp),
        QEL_NAMED(QelMessageFunctionKrogConcMaint),
        QEL_NAMED(QelMessageFunctionKrogPerfCmd),
        QEL_NAMED(QelMessageFunctionKrogMigration),
        QEL_NAMED(QelMessageFunctionKrogHypePipe),
        QEL_NAMED(QelMessageFunctionKrogNvRam),
        QEL_NAMED(QelMessageFunctionQelKrog),
    };
    return names;
}

const OperationNames& operationNames()
{
    static const OperationNames names = {
        QEL_NAMED_OF(QelMessageFunctionQel, QelMessageOpUpgradeConnection),
        QEL_NAMED_OF(QelMessageFunctionQel, QelMessageOpAbortHandshake),

        QEL_NAMED_OF(QelMessageFunctionQelInterfaceCmp, QelMessageOpGetEnclTypeAndInterfaceVersion),
        QEL_NAMED_OF(QelMessageFunctionQelInterfaceCmp, QelMessageOpOpenKrogSession),
        QEL_NAMED_OF(QelMessageFunctionQelInterfaceCmp, QelMessageOpCloseKrogSession),
        QEL_NAMED_OF(QelMessageFunctionQelInterfaceCmp, QelMessageOpExchIntCapabilities),
        QEL_NAMED_OF(QelMessageFunctionQelInterfaceCmp, QelMessageOpGetInterfaceImplementationLimits),
        QEL_NAMED_OF(QelMessageFunctionQelInterfaceCmp, QelMessageOpDaxBroadcast),
        QEL_NAMED_OF(QelMessageFunctionQelInterfaceCmp, QelMessageOpGetQelTod),
        QEL_NAMED_OF(QelMessageFunctionQelInterfaceCmp, QelMessageOpSetGlobalModeAttribute),
        QEL_NAMED_OF(QelMessageFunctionQelInterfaceCmp, QelMessageOpGetGlobalModeAttribute),
        QEL_NAMED_OF(QelMessageFunctionQelInterfaceCmp, QelMessageOpSetGlobalSaveAreaMetadata),
        QEL_NAMED_OF(QelMessageFunctionQelInterfaceCmp, QelMessageOpGetGlobalSaveAreaMetadata),

        QEL_NAMED_OF(QelMessageFunctionVirtualSerial, QelMessageOpOpenVirtualSerialSession),
        QEL_NAMED_OF(QelMessageFunctionVirtualSerial, QelMessageOpCloseVirtualSerialSession),
        QEL_NAMED_OF(QelMessageFunctionVirtualSerial, QelMessageOpGetMaxVirtualSerialSessions),
        QEL_NAMED_OF(QelMessageFunctionVirtualSerial, QelMessageOpSendVirtualSerialDataToOs),
        QEL_NAMED_OF(QelMessageFunctionVirtualSerial, QelMessageOpSetupVirtualSerialSession),

        QEL_NAMED_OF(QelMessageFunctionDax, QelMessageOpSendVirtualSerialDataToMc),
        QEL_NAMED_OF(QelMessageFunctionDax, QelMessageOpSendVirtualSerialSessionClosed),
        QEL_NAMED_OF(QelMessageFunctionDax, QelMessageOpSendKrogConnectionClosed),
        QEL_NAMED_OF(QelMessageFunctionDax, QelMessageOpOutboundBroadcastAsync),

        QEL_NAMED_OF(QelMessageFunctionKrogCmdRouter, QelMessageOpOpenKrogCmdRouterSession),
        QEL_NAMED_OF(QelMessageFunctionKrogCmdRouter, QelMessageOpEnablePartitionHeartbeat),

        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpOpenQelKrogSession),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpCloseQelKrogSession),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpChangeNotification),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpCertificateSigningRequest),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpRunMacro),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpGetConfigurablePorts),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpGetSystemNetworkConfig),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpGetNetworkPortIPv4Config),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpSetNetworkPortIPv4Info),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpGetNetworkPortIPv6Config),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpSetNetworkPortIPv6Info),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpSetNetworkPortStaticInfo),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpSetRootCertificate),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpMacroOutput),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpGetRtadState),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpGetResourceDumpStatus),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpResourceDumpReady),
        QEL_NAMED_OF(QelMessageFunctionQelKrog, QelMessageOpSendErrorLog),
    };
    return names;
}

const StatusNames& statusNames()
{
    static const StatusNames names = {
        QEL_NAMED(QelMessageStatusNoError),
        QEL_NAMED(QelMessageStatusInvalidOperation),
        QEL_NAMED(QelMessageStatusInvalidDestination),
        QEL_NAMED(QelMessageStatusInvalidData),
        QEL_NAMED(QelMessageStatusInvalidCmdSequence),
        QEL_NAMED(QelMessageStatusCmdFailed),
        QEL_NAMED(QelMessageStatusCmdTimeout),
        QEL_NAMED(QelMessageStatusVttyBufferFull),
        QEL_NAMED(QelMessageStatusInvalidFunction),
        QEL_NAMED(QelMessageStatusInvalidConnectionNumber),
        QEL_NAMED(QelMessageStatusTooManyConnections),
        QEL_NAMED(QelMessageStatusConnectionNotAvailable),
        QEL_NAMED(QelMessageStatusConnectionClosureFailure),
        QEL_NAMED(QelMessageStatusInvalidLparId),
        QEL_NAMED(QelMessageStatusKrogSessionAlreadyOpen),
        QEL_NAMED(QelMessageStatusDaxAlreadyConnected),
        QEL_NAMED(QelMessageStatusIncompatibleClient),
        QEL_NAMED(QelMessageStatusHypervisorGenericError),
    };
    return names;
}

#undef QEL_NAMED
#undef QEL_NAMED_OF

} // namespace

std::ostream& operator<<(std::ostream& os, QelMessageFunctionCodes function)
{
    const char* const name = findName(functionNames(), function);
    return os << hexFormat(function) << " (" << (name != nullptr ? name : "unknown function") << ')';
}

std::ostream& operator<<(std::ostream& os, const std::pair<QelMessageFunctionCodes, QelMessageOpTypes>& operation)
{
    os << hexFormat(operation.second) << " (";
    if (const char* const name = findName(operationNames(), operation)) {
        os << name;
    } else {
        os << "unknown operation for function " << hexFormat(operation.first);
    }
    return os << ')';
}

std::ostream& operator<<(std::ostream& os, QelMessageStatusCodes status)
{
    const char* const name = findName(statusNames(), status);
    return os << hexFormat(status) << " (" << (name != nullptr ? name : "unknown status code") << ')';
}

std::ostream& operator<<(std::ostream& os, QelMessageFlags flags)
{
    os << hexFormat(flags) << " (";
    const char* separator = "";
    if ((flags & MsgResponse) != NoFlagSet) {
        os << "MsgResponse";
        separator = ", ";
    }
    if ((flags & MsgResponseExpected) != NoFlagSet) os << separator << "MsgResponseExpected";
    if ((flags & (MsgResponse | MsgResponseExpected)) == NoFlagSet) os << "no flags set";
    return os << ')';
}

} // namespace qel
