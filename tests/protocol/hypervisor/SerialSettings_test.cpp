#include <qel/protocol/SerialSettings.hpp>

#include "hypervisor/SerialSpeed.hpp"

#include <gmock/gmock.h>
#include <stdexcept>
#include <string>

namespace qel::test {

namespace {

using protocol::SerialSettings;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

TEST(SerialSettings, TheDefaultIsTheUsualOne) { EXPECT_EQ(SerialSettings().str(), "115200n8"); }

TEST(SerialSettings, ReadsEveryForm)
{
    const struct {
        const char* text;
        const char* result;
    } rows[] = {
        {"115200n8", "115200n8"},
        {"9600", "9600n8"},
        {"9600e7", "9600e7"},
        {"300o5", "300o5"},
        {"9600n81", "9600n8"},
        {"9600n82", "9600n82"},
        {"19200E72", "19200e72"},
        {"50n8", "50n8"},
        {"4000000n8", "4000000n8"},
        {"9600n8,rtscts", "9600n8,rtscts"},
        {"9600,RTSCTS", "9600n8,rtscts"},
    };
    for (const auto& row : rows)
        EXPECT_EQ(SerialSettings::parse(row.text).str(), row.result);
}

TEST(SerialSettings, ReadsEachPart)
{
    const SerialSettings settings = SerialSettings::parse("19200o72,rtscts");
    EXPECT_EQ(settings.speed, 19200U);
    EXPECT_EQ(settings.parity, SerialSettings::Parity::Odd);
    EXPECT_EQ(settings.dataBits, 7);
    EXPECT_EQ(settings.stopBits, 2);
    EXPECT_TRUE(settings.hardwareFlowControl);
    EXPECT_FALSE(SerialSettings::parse("19200o72").hardwareFlowControl);
}

TEST(SerialSettings, RefusesWhatIsNotOfTheForm)
{
    for (const char* text : {"", "n8", "9600n", "9600n4", "9600n9", "9600m8", "9600n80", "9600n83", "9600n811", " 9600",
                             "-9600", "9600 n8", "9600n8,xonxoff", "9600n8,rtscts,rtscts", ",rtscts"}) {
        EXPECT_THAT([&] { SerialSettings::parse(text); },
                    ThrowsMessage<std::invalid_argument>(
                        StrEq("settings: \"" + std::string(text) +
                              "\" is not a speed and a format such as 115200n8, with \",rtscts\" for hardware flow "
                              "control")));
    }
}

TEST(SerialSettings, RefusesASpeedThatSerialPortsDoNotHave)
{
    for (const char* text : {"0", "49n8", "9601", "4000001", "99999999999999999999n8"}) {
        EXPECT_THAT([&] { SerialSettings::parse(text); },
                    ThrowsMessage<std::invalid_argument>(
                        StrEq("settings: \"" + std::string(text) + "\" has a speed that serial ports do not have")));
    }
}

TEST(SerialSpeed, KnowsTheCodesOfTheSystem)
{
    EXPECT_EQ(protocol::toSpeedCode(50), speed_t(B50));
    EXPECT_EQ(protocol::toSpeedCode(115200), speed_t(B115200));
    EXPECT_EQ(protocol::toSpeedCode(4000000), speed_t(B4000000));
    EXPECT_EQ(protocol::toSpeedCode(115201), std::nullopt);
}

} // namespace

} // namespace qel::test
