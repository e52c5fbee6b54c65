#include <qel/common/QelMessageGeneric.hpp>

#include "base/Failures.hpp"
#include "base/RefusalReason.hpp"

#include <gtest/gtest.h>

namespace qel::test {

namespace {

QelMessageGeneric response(unsigned short function, unsigned short operation, unsigned int status)
{
    QelMessageGeneric message(1, function, operation, MsgResponse);
    message.setStatus(static_cast<QelMessageStatusCodes>(status), 0);
    return message;
}

std::string reason(unsigned short function, unsigned short operation, unsigned int status)
{
    return tool::refusalReason(response(function, operation, status), "partition 3");
}

TEST(RefusalReason, SaysWhatToDoAboutEachRefusalOfTheServer)
{
    EXPECT_EQ(reason(0x6003, 0x0101, 37),
              "a console with this tool type and id is connected already; choose another --tool-id");
    EXPECT_EQ(reason(0x6003, 0x0101, 18),
              "the server takes no more consoles, or its rules do not let this certificate in; its log says which");
    EXPECT_EQ(reason(0x6003, 0x0102, 23), "this console has opened its session already");
    EXPECT_EQ(reason(0x6003, 0x0106, 19), "no other console has this tool type and id");
    EXPECT_EQ(reason(0x6003, 0x0106, 6), "the addressed console takes no more messages at the moment; try again later");
    EXPECT_EQ(reason(0x6002, 0x0402, 19), "partition 3 is held by another console; --force takes it, --watch looks on");
    EXPECT_EQ(reason(0x6002, 0x0402, 6),
              "the command of partition 3 cannot be started; the log of the server says why");
    EXPECT_EQ(reason(0x6002, 0x0402, 21), "the server does not have partition 3");
    EXPECT_EQ(reason(0x6002, 0x0402, 16),
              "partition 3 does not have this serial connection; --connection 0 types, 1 to 15 watch");
    EXPECT_EQ(reason(0x6002, 0x0406, 4), "another console has taken partition 3 in the meantime");
    EXPECT_EQ(reason(0x6002, 0x0403, 20), "this console does not hold partition 3");
}

TEST(RefusalReason, AStatusMeansSomethingForEveryRequest)
{
    EXPECT_EQ(reason(0x6003, 0x0107, 1), "the server does not know this request");
    EXPECT_EQ(reason(0x6003, 0x0107, 2), "the server does not know the destination of the request");
    EXPECT_EQ(reason(0x6003, 0x0107, 3), "the server does not accept the values in the request");
    EXPECT_EQ(reason(0x6003, 0x0107, 4), "the server expects another request first");
    EXPECT_EQ(reason(0x6003, 0x0107, 6), "the server could not carry out the request; its log may say why");
    EXPECT_EQ(reason(0x6003, 0x0107, 7), "the server could not carry out the request in time; try again later");
    EXPECT_EQ(reason(0x6003, 0x0107, 9), "the partition takes no more input at the moment; try again later");
    EXPECT_EQ(reason(0x6003, 0x0107, 15), "the server does not know this kind of request");
    EXPECT_EQ(reason(0x6003, 0x0107, 50), "the server does not work with this version of the program");
    EXPECT_EQ(reason(0x6003, 0x0107, 0x8006), "the hypervisor failed; its log may say why");
}

TEST(RefusalReason, IsEmptyForAnUnknownStatus)
{
    EXPECT_EQ(reason(0x6003, 0x0107, 5), "");
    EXPECT_EQ(reason(0x6003, 0x0107, 37), "") << "only the version request is refused with it";
}

TEST(RefusalReason, NamesThePartitionWithoutASubject)
{
    EXPECT_EQ(tool::refusalReason(response(0x6002, 0x0402, 21), ""), "the server does not have the partition");
}

TEST(RefusalReason, ComesBeforeTheStatusInTheMessageOfARefusal)
{
    EXPECT_EQ(tool::refusalText(response(0x6002, 0x0402, 19), "partition 3"),
              "partition 3 is held by another console; --force takes it, --watch looks on: 0x00000013 "
              "(QelMessageStatusConnectionNotAvailable)");
}

TEST(RefusalText, WithoutAReasonNamesTheRequest)
{
    EXPECT_EQ(tool::refusalText(response(0x6003, 0x0107, 18)),
              "time refused: 0x00000012 (QelMessageStatusTooManyConnections)");
    EXPECT_EQ(tool::refusalText(response(0x6003, 0x0102, 18)),
              "open session refused: 0x00000012 (QelMessageStatusTooManyConnections)");
    EXPECT_EQ(tool::refusalText(response(0x6003, 0x0999, 18)),
              "the request was refused: 0x00000012 (QelMessageStatusTooManyConnections)");
}

TEST(RequestName, IsThatOfTheCommandOrOfTheStep)
{
    struct Row {
        unsigned short function;
        unsigned short operation;
        const char* name;
    };
    const Row rows[] = {
        {0x6003, 0x0101, "version request"},
        {0x6003, 0x0102, "open session"},
        {0x6003, 0x0103, "close session"},
        {0x6003, 0x0104, "capabilities"},
        {0x6003, 0x0105, "limits"},
        {0x6003, 0x0106, "broadcast"},
        {0x6003, 0x0107, "time"},
        {0x6003, 0x0108, "set-mode"},
        {0x6003, 0x0109, "get-mode"},
        {0x6003, 0x010A, "set-metadata"},
        {0x6003, 0x010B, "get-metadata"},
        {0x6002, 0x0402, "open serial session"},
        {0x6002, 0x0403, "close serial session"},
        {0x6002, 0x0404, "max-sessions"},
        {0x6002, 0x0406, "set up serial session"},
        {0x6002, 0x0107, ""},
    };
    for (const Row& row : rows)
        EXPECT_EQ(tool::requestName(response(row.function, row.operation, 0)), row.name) << row.operation;
}

} // namespace

} // namespace qel::test
