#include <qel/common/QelMessageIdentifiers.hpp>
#include <qel/common/StreamFormatters.hpp>

#include <gtest/gtest.h>
#include <iomanip>
#include <set>
#include <sstream>
#include <string>
#include <type_traits>
#include <utility>

namespace qel {
namespace {

template <typename T>
std::string printed(const T& value)
{
    return toString(value);
}

std::string hex16(unsigned int value)
{
    std::ostringstream os;
    os << "0x" << std::hex << std::uppercase << std::setw(4) << std::setfill('0') << value;
    return os.str();
}

std::pair<QelMessageFunctionCodes, QelMessageOpTypes> operationOf(unsigned int function, unsigned int operation)
{
    return {static_cast<QelMessageFunctionCodes>(function), static_cast<QelMessageOpTypes>(operation)};
}

TEST(QelMessageIdentifiers, HaveTheWidthOfTheirHeaderField)
{
    static_assert(std::is_same<std::underlying_type_t<QelMessageFunctionCodes>, unsigned short>::value, "");
    static_assert(std::is_same<std::underlying_type_t<QelMessageOpTypes>, unsigned short>::value, "");
    static_assert(std::is_same<std::underlying_type_t<QelMessageStatusCodes>, unsigned short>::value, "");
    static_assert(std::is_same<std::underlying_type_t<QelMessageFlags>, unsigned char>::value, "");
    static_assert(std::is_same<std::underlying_type_t<QelMessageClassification::Value>, unsigned int>::value, "");
    static_assert(!std::is_default_constructible<QelMessageClassification>::value, "a scope without objects");
}

// --- functions

struct FunctionRow {
    unsigned int value;
    const char* name;
};

const FunctionRow kFunctions[] = {
    {0x0000, "QelMessageFunctionInvalid"},
    {0x6001, "QelMessageFunctionQel"},
    {0x6002, "QelMessageFunctionVirtualSerial"},
    {0x6003, "QelMessageFunctionQelInterfaceCmp"},
    {0x7000, "QelMessageFunctionDax"},
    {0x8000, "QelMessageFunctionKrogCmdRouter"},
    {0x8001, "QelMessageFunctionKrogLparConfig"},
    {0x8002, "QelMessageFunctionKrogLparDlpar"},
    {0x8003, "QelMessageFunctionKrogVsp"},
    {0x8004, "QelMessageFunctionKrogRellAp"},
    {0x8005, "QelMessageFunctionKrogConcMaint"},
    {0x8006, "QelMessageFunctionKrogPerfCmd"},
    {0x8007, "QelMessageFunctionKrogMigration"},
    {0x8008, "QelMessageFunctionKrogHypePipe"},
    {0x8009, "QelMessageFunctionKrogNvRam"},
    {0x800A, "QelMessageFunctionQelKrog"},
};

TEST(QelMessageFunctionCodes, PrintTheirNames)
{
    for (const FunctionRow& row : kFunctions) {
        EXPECT_EQ(printed(static_cast<QelMessageFunctionCodes>(row.value)), hex16(row.value) + " (" + row.name + ")");
    }
}

TEST(QelMessageFunctionCodes, PrintAsUnknownWithoutAName)
{
    std::set<unsigned int> known;
    for (const FunctionRow& row : kFunctions)
        known.insert(row.value);
    for (unsigned int value = 0; value <= 0xFFFF; ++value) {
        if (known.count(value) != 0) continue;
        ASSERT_EQ(printed(static_cast<QelMessageFunctionCodes>(value)), hex16(value) + " (unknown function)");
    }
}

TEST(QelMessageFunctionCodes, HaveTheirValues)
{
    EXPECT_EQ(QelMessageFunctionInvalid, 0x0000);
    EXPECT_EQ(QelMessageFunctionQel, 0x6001);
    EXPECT_EQ(QelMessageFunctionVirtualSerial, 0x6002);
    EXPECT_EQ(QelMessageFunctionQelInterfaceCmp, 0x6003);
    EXPECT_EQ(QelMessageFunctionDax, 0x7000);
    EXPECT_EQ(QelMessageFunctionKrogBase, 0x8000);
    EXPECT_EQ(QelMessageFunctionKrogCmdRouter, 0x8000);
    EXPECT_EQ(QelMessageFunctionKrogLparConfig, 0x8001);
    EXPECT_EQ(QelMessageFunctionKrogLparDlpar, 0x8002);
    EXPECT_EQ(QelMessageFunctionKrogVsp, 0x8003);
    EXPECT_EQ(QelMessageFunctionKrogRellAp, 0x8004);
    EXPECT_EQ(QelMessageFunctionKrogConcMaint, 0x8005);
    EXPECT_EQ(QelMessageFunctionKrogPerfCmd, 0x8006);
    EXPECT_EQ(QelMessageFunctionKrogMigration, 0x8007);
    EXPECT_EQ(QelMessageFunctionKrogHypePipe, 0x8008);
    EXPECT_EQ(QelMessageFunctionKrogNvRam, 0x8009);
    EXPECT_EQ(QelMessageFunctionQelKrog, 0x800A);
}

TEST(QelMessageFunctionCodes, BasePrintsAsTheCommandRouter)
{
    EXPECT_EQ(printed(QelMessageFunctionKrogBase), "0x8000 (QelMessageFunctionKrogCmdRouter)");
}

// --- operations

struct OperationRow {
    unsigned int function;
    unsigned int value;
    QelMessageOpTypes enumerator;
    const char* name;
};

const OperationRow kOperations[] = {
    {0x6001, 0x0001, QelMessageOpUpgradeConnection, "QelMessageOpUpgradeConnection"},
    {0x6001, 0x0002, QelMessageOpAbortHandshake, "QelMessageOpAbortHandshake"},
    {0x6003, 0x0101, QelMessageOpGetEnclTypeAndInterfaceVersion, "QelMessageOpGetEnclTypeAndInterfaceVersion"},
    {0x6003, 0x0102, QelMessageOpOpenKrogSession, "QelMessageOpOpenKrogSession"},
    {0x6003, 0x0103, QelMessageOpCloseKrogSession, "QelMessageOpCloseKrogSession"},
    {0x6003, 0x0104, QelMessageOpExchIntCapabilities, "QelMessageOpExchIntCapabilities"},
    {0x6003, 0x0105, QelMessageOpGetInterfaceImplementationLimits, "QelMessageOpGetInterfaceImplementationLimits"},
    {0x6003, 0x0106, QelMessageOpDaxBroadcast, "QelMessageOpDaxBroadcast"},
    {0x6003, 0x0107, QelMessageOpGetQelTod, "QelMessageOpGetQelTod"},
    {0x6003, 0x0108, QelMessageOpSetGlobalModeAttribute, "QelMessageOpSetGlobalModeAttribute"},
    {0x6003, 0x0109, QelMessageOpGetGlobalModeAttribute, "QelMessageOpGetGlobalModeAttribute"},
    {0x6003, 0x010A, QelMessageOpSetGlobalSaveAreaMetadata, "QelMessageOpSetGlobalSaveAreaMetadata"},
    {0x6003, 0x010B, QelMessageOpGetGlobalSaveAreaMetadata, "QelMessageOpGetGlobalSaveAreaMetadata"},
    {0x6002, 0x0402, QelMessageOpOpenVirtualSerialSession, "QelMessageOpOpenVirtualSerialSession"},
    {0x6002, 0x0403, QelMessageOpCloseVirtualSerialSession, "QelMessageOpCloseVirtualSerialSession"},
    {0x6002, 0x0404, QelMessageOpGetMaxVirtualSerialSessions, "QelMessageOpGetMaxVirtualSerialSessions"},
    {0x6002, 0x0405, QelMessageOpSendVirtualSerialDataToOs, "QelMessageOpSendVirtualSerialDataToOs"},
    {0x6002, 0x0406, QelMessageOpSetupVirtualSerialSession, "QelMessageOpSetupVirtualSerialSession"},
    {0x7000, 0x0401, QelMessageOpSendVirtualSerialDataToMc, "QelMessageOpSendVirtualSerialDataToMc"},
    {0x7000, 0xA005, QelMessageOpSendVirtualSerialSessionClosed, "QelMessageOpSendVirtualSerialSessionClosed"},
    {0x7000, 0xA009, QelMessageOpSendKrogConnectionClosed, "QelMessageOpSendKrogConnectionClosed"},
    {0x7000, 0x0B0B, QelMessageOpOutboundBroadcastAsync, "QelMessageOpOutboundBroadcastAsync"},
    {0x8000, 0x0001, QelMessageOpOpenKrogCmdRouterSession, "QelMessageOpOpenKrogCmdRouterSession"},
    {0x8000, 0x810D, QelMessageOpEnablePartitionHeartbeat, "QelMessageOpEnablePartitionHeartbeat"},
    {0x800A, 0x0001, QelMessageOpOpenQelKrogSession, "QelMessageOpOpenQelKrogSession"},
    {0x800A, 0x0002, QelMessageOpCloseQelKrogSession, "QelMessageOpCloseQelKrogSession"},
    {0x800A, 0x0003, QelMessageOpChangeNotification, "QelMessageOpChangeNotification"},
    {0x800A, 0x0004, QelMessageOpCertificateSigningRequest, "QelMessageOpCertificateSigningRequest"},
    {0x800A, 0x0005, QelMessageOpRunMacro, "QelMessageOpRunMacro"},
    {0x800A, 0x0101, QelMessageOpGetConfigurablePorts, "QelMessageOpGetConfigurablePorts"},
    {0x800A, 0x0102, QelMessageOpGetSystemNetworkConfig, "QelMessageOpGetSystemNetworkConfig"},
    {0x800A, 0x0103, QelMessageOpGetNetworkPortIPv4Config, "QelMessageOpGetNetworkPortIPv4Config"},
    {0x800A, 0x8103, QelMessageOpSetNetworkPortIPv4Info, "QelMessageOpSetNetworkPortIPv4Info"},
    {0x800A, 0x0104, QelMessageOpGetNetworkPortIPv6Config, "QelMessageOpGetNetworkPortIPv6Config"},
    {0x800A, 0x8104, QelMessageOpSetNetworkPortIPv6Info, "QelMessageOpSetNetworkPortIPv6Info"},
    {0x800A, 0x8105, QelMessageOpSetNetworkPortStaticInfo, "QelMessageOpSetNetworkPortStaticInfo"},
    {0x800A, 0x8106, QelMessageOpSetRootCertificate, "QelMessageOpSetRootCertificate"},
    {0x800A, 0x8107, QelMessageOpMacroOutput, "QelMessageOpMacroOutput"},
    {0x800A, 0x0108, QelMessageOpGetRtadState, "QelMessageOpGetRtadState"},
    {0x800A, 0x0109, QelMessageOpGetResourceDumpStatus, "QelMessageOpGetResourceDumpStatus"},
    {0x800A, 0x8109, QelMessageOpResourceDumpReady, "QelMessageOpResourceDumpReady"},
    {0x800A, 0x810A, QelMessageOpSendErrorLog, "QelMessageOpSendErrorLog"},
};
static_assert(sizeof(kOperations) / sizeof(kOperations[0]) == 42, "every operation that has a name");

TEST(QelMessageOpTypes, PrintTheirNamesUnderTheirFunction)
{
    for (const OperationRow& row : kOperations) {
        EXPECT_EQ(row.enumerator, row.value) << row.name;
        EXPECT_EQ(printed(operationOf(row.function, row.value)), hex16(row.value) + " (" + row.name + ")");
    }
}

TEST(QelMessageOpTypes, PrintAsUnknownUnderEveryOtherFunction)
{
    std::set<std::pair<unsigned int, unsigned int>> known;
    std::set<unsigned int> values = {0x0000, 0x0006, 0x0407, 0xFFFF};
    for (const OperationRow& row : kOperations) {
        known.insert({row.function, row.value});
        values.insert(row.value);
    }
    for (const FunctionRow& function : kFunctions) {
        for (const unsigned int value : values) {
            if (known.count({function.value, value}) != 0) continue;
            EXPECT_EQ(printed(operationOf(function.value, value)),
                      hex16(value) + " (unknown operation for function " + hex16(function.value) + ")");
        }
    }
}

TEST(QelMessageOpTypes, PrintByTheirFunction)
{
    EXPECT_EQ(printed(operationOf(0x6001, 0x0001)), "0x0001 (QelMessageOpUpgradeConnection)");
    EXPECT_EQ(printed(operationOf(0x8000, 0x0001)), "0x0001 (QelMessageOpOpenKrogCmdRouterSession)");
    EXPECT_EQ(printed(operationOf(0x800A, 0x0001)), "0x0001 (QelMessageOpOpenQelKrogSession)");
    EXPECT_EQ(printed(operationOf(0x6003, 0x0001)), "0x0001 (unknown operation for function 0x6003)");
}

TEST(QelMessageOpTypes, UnspecifiedHasNoName)
{
    EXPECT_EQ(QelMessageOpUnspecified, 0);
    EXPECT_EQ(printed(operationOf(0x0000, 0x0000)), "0x0000 (unknown operation for function 0x0000)");
}

TEST(QelMessageOpTypes, ToTheConsoleBelongToTheConsoleFunction)
{
    EXPECT_EQ(printed(operationOf(0x6002, 0x0401)), "0x0401 (unknown operation for function 0x6002)");
    EXPECT_EQ(printed(operationOf(0x6002, 0xA005)), "0xA005 (unknown operation for function 0x6002)");
}

TEST(QelMessageOpTypes, PrintWithTheTypesOfTheAccessors)
{
    const QelMessageFunctionCodes function = QelMessageFunctionDax;
    const QelMessageOpTypes operation = QelMessageOpOutboundBroadcastAsync;
    EXPECT_EQ(printed(std::make_pair(function, operation)), "0x0B0B (QelMessageOpOutboundBroadcastAsync)");
}

// --- status codes

const FunctionRow kStatusCodes[] = {
    {0, "QelMessageStatusNoError"},
    {1, "QelMessageStatusInvalidOperation"},
    {2, "QelMessageStatusInvalidDestination"},
    {3, "QelMessageStatusInvalidData"},
    {4, "QelMessageStatusInvalidCmdSequence"},
    {6, "QelMessageStatusCmdFailed"},
    {7, "QelMessageStatusCmdTimeout"},
    {9, "QelMessageStatusVttyBufferFull"},
    {15, "QelMessageStatusInvalidFunction"},
    {16, "QelMessageStatusInvalidConnectionNumber"},
    {18, "QelMessageStatusTooManyConnections"},
    {19, "QelMessageStatusConnectionNotAvailable"},
    {20, "QelMessageStatusConnectionClosureFailure"},
    {21, "QelMessageStatusInvalidLparId"},
    {23, "QelMessageStatusKrogSessionAlreadyOpen"},
    {37, "QelMessageStatusDaxAlreadyConnected"},
    {50, "QelMessageStatusIncompatibleClient"},
    {0x8006, "QelMessageStatusHypervisorGenericError"},
};

std::string hexStatus(unsigned int value) { return "0x0000" + hex16(value).substr(2); }

TEST(QelMessageStatusCodes, PrintTheirNamesAfterEightDigits)
{
    for (const FunctionRow& row : kStatusCodes) {
        EXPECT_EQ(printed(static_cast<QelMessageStatusCodes>(row.value)), hexStatus(row.value) + " (" + row.name + ")");
    }
    EXPECT_EQ(printed(QelMessageStatusInvalidFunction), "0x0000000F (QelMessageStatusInvalidFunction)");
}

TEST(QelMessageStatusCodes, PrintAsUnknownInTheGaps)
{
    std::set<unsigned int> known;
    for (const FunctionRow& row : kStatusCodes)
        known.insert(row.value);
    for (unsigned int value = 0; value <= 0xFFFF; ++value) {
        if (known.count(value) != 0) continue;
        ASSERT_EQ(printed(static_cast<QelMessageStatusCodes>(value)), hexStatus(value) + " (unknown status code)");
    }
    EXPECT_EQ(printed(static_cast<QelMessageStatusCodes>(5)), "0x00000005 (unknown status code)");
}

TEST(QelMessageStatusCodes, HaveTheirValues)
{
    EXPECT_EQ(QelMessageStatusNoError, 0);
    EXPECT_EQ(QelMessageStatusInvalidOperation, 1);
    EXPECT_EQ(QelMessageStatusInvalidDestination, 2);
    EXPECT_EQ(QelMessageStatusInvalidData, 3);
    EXPECT_EQ(QelMessageStatusInvalidCmdSequence, 4);
    EXPECT_EQ(QelMessageStatusCmdFailed, 6);
    EXPECT_EQ(QelMessageStatusCmdTimeout, 7);
    EXPECT_EQ(QelMessageStatusVttyBufferFull, 9);
    EXPECT_EQ(QelMessageStatusInvalidFunction, 15);
    EXPECT_EQ(QelMessageStatusInvalidConnectionNumber, 16);
    EXPECT_EQ(QelMessageStatusTooManyConnections, 18);
    EXPECT_EQ(QelMessageStatusConnectionNotAvailable, 19);
    EXPECT_EQ(QelMessageStatusConnectionClosureFailure, 20);
    EXPECT_EQ(QelMessageStatusInvalidLparId, 21);
    EXPECT_EQ(QelMessageStatusKrogSessionAlreadyOpen, 23);
    EXPECT_EQ(QelMessageStatusDaxAlreadyConnected, 37);
    EXPECT_EQ(QelMessageStatusIncompatibleClient, 50);
    EXPECT_EQ(QelMessageStatusHypervisorGenericError, 0x8006);
}

// --- flags and classification

TEST(QelMessageFlags, PrintTheNamesOfTheKnownBits)
{
    EXPECT_EQ(printed(NoFlagSet), "0x00 (no flags set)");
    EXPECT_EQ(printed(MsgResponse), "0x40 (MsgResponse)");
    EXPECT_EQ(printed(MsgResponseExpected), "0x80 (MsgResponseExpected)");
    EXPECT_EQ(printed(MsgResponse | MsgResponseExpected), "0xC0 (MsgResponse, MsgResponseExpected)");
}

TEST(QelMessageFlags, PrintTheOtherBitsInTheNumberOnly)
{
    EXPECT_EQ(printed(static_cast<QelMessageFlags>(0x3F)), "0x3F (no flags set)");
    EXPECT_EQ(printed(static_cast<QelMessageFlags>(0x41)), "0x41 (MsgResponse)");
    EXPECT_EQ(printed(static_cast<QelMessageFlags>(0xBF)), "0xBF (MsgResponseExpected)");
    EXPECT_EQ(printed(static_cast<QelMessageFlags>(0xFF)), "0xFF (MsgResponse, MsgResponseExpected)");
}

TEST(QelMessageFlags, HaveTheirValues)
{
    EXPECT_EQ(NoFlagSet, 0x00);
    EXPECT_EQ(MsgResponse, 0x40);
    EXPECT_EQ(MsgResponseExpected, 0x80);
}

TEST(QelMessageFlags, CombineWithoutLosingTheirType)
{
    static_assert(std::is_same<decltype(MsgResponse | MsgResponseExpected), QelMessageFlags>::value, "");
    static_assert(std::is_same<decltype(MsgResponse & MsgResponseExpected), QelMessageFlags>::value, "");
    static_assert(std::is_same<decltype(~MsgResponse), QelMessageFlags>::value, "");
    EXPECT_EQ(MsgResponse | MsgResponseExpected, 0xC0);
    EXPECT_EQ(MsgResponse | NoFlagSet, 0x40);
    EXPECT_EQ(MsgResponse & MsgResponseExpected, NoFlagSet);
    EXPECT_EQ(static_cast<QelMessageFlags>(0xFF) & MsgResponseExpected, 0x80);
    EXPECT_EQ(~MsgResponse, 0xBF);
    QelMessageFlags flags = MsgResponse;
    flags |= MsgResponseExpected;
    EXPECT_EQ(printed(flags), "0xC0 (MsgResponse, MsgResponseExpected)");
}

TEST(QelMessageClassification, HasItsValues)
{
    EXPECT_EQ(QelMessageClassification::Unknown, 0U);
    EXPECT_EQ(QelMessageClassification::Request, 1U);
    EXPECT_EQ(QelMessageClassification::Response, 2U);
    EXPECT_EQ(QelMessageClassification::Async, 3U);
}

TEST(QelMessageClassification, ConvertsToFlags)
{
    EXPECT_EQ(QelMessageClassification::toFlags(QelMessageClassification::Request), 0x80);
    EXPECT_EQ(QelMessageClassification::toFlags(QelMessageClassification::Response), 0x40);
    EXPECT_EQ(QelMessageClassification::toFlags(QelMessageClassification::Async), 0x00);
    EXPECT_EQ(QelMessageClassification::toFlags(QelMessageClassification::Unknown), 0x00);
}

TEST(QelMessageClassification, ComesFromTheTwoTopBitsOfEveryFlagByte)
{
    for (unsigned int value = 0; value <= 0xFF; ++value) {
        SCOPED_TRACE(value);
        const QelMessageClassification::Value classification =
            QelMessageClassification::fromFlags(static_cast<QelMessageFlags>(value));
        if (value < 0x40) {
            EXPECT_EQ(classification, QelMessageClassification::Async);
        } else if (value < 0x80) {
            EXPECT_EQ(classification, QelMessageClassification::Response);
        } else if (value < 0xC0) {
            EXPECT_EQ(classification, QelMessageClassification::Request);
        } else {
            EXPECT_EQ(classification, QelMessageClassification::Unknown);
        }
    }
}

// --- the stream

TEST(QelMessageIdentifiers, PrintTheSameForAnyBaseCaseAndFillOfTheStream)
{
    std::ostringstream os;
    os << std::oct << std::nouppercase << std::setfill('*') << QelMessageFunctionDax << ' ' << std::dec
       << std::setfill('*') << operationOf(0x7000, 0xA009) << ' ' << std::dec << std::setfill('*')
       << QelMessageStatusCmdFailed << ' ' << std::dec << std::setfill('*') << static_cast<QelMessageFlags>(0x0F);
    EXPECT_EQ(os.str(), "0x7000 (QelMessageFunctionDax) 0xA009 (QelMessageOpSendKrogConnectionClosed) "
                        "0x00000006 (QelMessageStatusCmdFailed) 0x0F (no flags set)");
}

TEST(QelMessageIdentifiers, LeaveTheStreamInUpperCaseHexadecimal)
{
    std::ostringstream os;
    os << MsgResponse << ' ' << 0xABC;
    EXPECT_EQ(os.str(), "0x40 (MsgResponse) ABC");
}

} // namespace
} // namespace qel
