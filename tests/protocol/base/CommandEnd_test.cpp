#include <qel/protocol/CommandEnd.hpp>

#include <gtest/gtest.h>
#include <vector>

namespace qel::test {

namespace {

using protocol::CommandEnd;
using Kind = protocol::CommandEnd::Kind;

TEST(CommandEnd, TravelsInTheStatusDetail)
{
    struct Row {
        CommandEnd end;
        std::uint16_t detail;
        const char* text;
    };
    const Row rows[] = {
        {{Kind::Exited, 0}, 0x0100, "the command exited with status 0"},
        {{Kind::Exited, 255}, 0x01FF, "the command exited with status 255"},
        {{Kind::Killed, 1}, 0x0201, "the command was killed by signal 1 (Hangup)"},
        {{Kind::Killed, 255}, 0x02FF, "the command was killed by signal 255"},
        {{Kind::ClosedTerminal, 0}, 0x0300, "the command closed its terminal"},
        {{Kind::Unknown, 0}, 0, "the command ended"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.text);
        EXPECT_EQ(protocol::toStatusDetail(row.end), row.detail);
        const CommandEnd end = protocol::commandEndFrom(row.detail);
        EXPECT_EQ(end.kind, row.end.kind);
        EXPECT_EQ(end.number, row.end.number);
        EXPECT_EQ(protocol::describe(end), row.text);
    }
}

TEST(CommandEnd, OtherStatusDetailsAreUnknown)
{
    for (const std::uint16_t detail : std::vector<std::uint16_t>{0x0001, 0x00FF, 0x0200, 0x0301, 0x0400, 0xFFFF}) {
        SCOPED_TRACE(detail);
        const CommandEnd end = protocol::commandEndFrom(detail);
        EXPECT_EQ(end.kind, Kind::Unknown);
        EXPECT_EQ(end.number, 0U);
    }
}

TEST(CommandEnd, AnUnknownEndHasNoNumberOnTheWire) { EXPECT_EQ(protocol::toStatusDetail({Kind::Unknown, 5}), 0U); }

} // namespace

} // namespace qel::test
