#include <qel/common/EndianExtensions.hpp>

#include "support/Bytes.hpp"

#include <cstddef>
#include <gtest/gtest.h>
#include <type_traits>

namespace qel {
namespace {

typedef endian_uint<unsigned char, 4321> be_uint8_t;

// Naturally aligned members would make this six bytes.
struct OddRecord {
    be_uint16_t first;
    be_uint16_t second;
    be_uint8_t third;
};
static_assert(sizeof(OddRecord) == 5 && alignof(OddRecord) == 1, "overlays the frame buffer");

struct MixedRecord {
    be_uint8_t tag;        // 0
    be_uint32_t length;    // 1
    be_uint16_t operation; // 5
};
static_assert(sizeof(MixedRecord) == 7 && alignof(MixedRecord) == 1, "overlays the frame buffer");

TEST(EndianUint, HasTheSizeOfItsTypeAndAlignment1)
{
    EXPECT_EQ(sizeof(be_uint8_t), 1U);
    EXPECT_EQ(sizeof(be_uint16_t), 2U);
    EXPECT_EQ(sizeof(be_uint32_t), 4U);
    EXPECT_EQ(alignof(be_uint8_t), 1U);
    EXPECT_EQ(alignof(be_uint16_t), 1U);
    EXPECT_EQ(alignof(be_uint32_t), 1U);
    EXPECT_EQ(offsetof(MixedRecord, length), 1U);
    EXPECT_EQ(offsetof(MixedRecord, operation), 5U);
}

TEST(EndianUint, IsTrivial)
{
    EXPECT_TRUE(std::is_trivial<be_uint8_t>::value);
    EXPECT_TRUE(std::is_trivial<be_uint16_t>::value);
    EXPECT_TRUE(std::is_trivial<be_uint32_t>::value);
    EXPECT_TRUE(std::is_standard_layout<be_uint32_t>::value);
}

TEST(EndianUint, StoresTheMostSignificantByteFirst)
{
    const be_uint8_t narrow(0xAB);
    const be_uint16_t middle(0x1234);
    const be_uint32_t wide(0x12345678);
    EXPECT_EQ(test::hex(&narrow, sizeof(narrow)), "AB");
    EXPECT_EQ(test::hex(&middle, sizeof(middle)), "1234");
    EXPECT_EQ(test::hex(&wide, sizeof(wide)), "12345678");
}

TEST(EndianUint, ReadsBackInHostOrder)
{
    EXPECT_EQ(be_uint8_t(0xFF).value(), 0xFF);
    EXPECT_EQ(be_uint16_t(0xFEDC).value(), 0xFEDC);
    EXPECT_EQ(be_uint32_t(0xFEDCBA98).value(), 0xFEDCBA98);
    EXPECT_EQ(be_uint16_t(0).value(), 0);
    EXPECT_EQ(be_uint32_t(0xFFFFFFFF).value(), 0xFFFFFFFF);
}

TEST(EndianUint, RoundTripsEvery16BitValue)
{
    for (unsigned int value = 0; value <= 0xFFFF; ++value) {
        ASSERT_EQ(be_uint16_t(static_cast<unsigned short>(value)).value(), value);
    }
}

TEST(EndianUint, ConvertsImplicitlyToAndFromPlainIntegers)
{
    be_uint16_t field = 0x0102;
    const unsigned short read = field;
    EXPECT_EQ(read, 0x0102);
    field = 0x0304;
    EXPECT_EQ(field, 0x0304);
    EXPECT_EQ(test::hex(&field, sizeof(field)), "0304");
    EXPECT_TRUE((std::is_convertible<unsigned int, be_uint32_t>::value));
    EXPECT_TRUE((std::is_convertible<be_uint32_t, unsigned int>::value));
}

TEST(EndianUint, ReadsReceivedBytesAtAnOddAddress)
{
    const std::vector<char> received = test::bytes({0x99, 0x00, 0x01, 0x02, 0xFF, 0xFE, 0x80});
    const std::unique_ptr<char[]> copy = test::heapCopy(received);
    for (std::size_t offset = 0; offset < 3; ++offset) {
        SCOPED_TRACE(offset);
        const auto* wide = reinterpret_cast<const be_uint32_t*>(copy.get() + offset);
        unsigned int expected = 0;
        for (std::size_t i = 0; i < 4; ++i) {
            expected = expected << 8 | static_cast<unsigned char>(received[offset + i]);
        }
        EXPECT_EQ(wide->value(), expected);
    }
    EXPECT_EQ(reinterpret_cast<const be_uint16_t*>(copy.get() + 5)->value(), 0xFE80);
}

TEST(EndianUint, WritesOnlyItsOwnBytes)
{
    const std::unique_ptr<char[]> buffer = test::heapCopy(std::string("abcdefg"));
    auto* record = reinterpret_cast<MixedRecord*>(buffer.get());
    record->length = 0x01020304;
    EXPECT_EQ(test::hex(buffer.get(), 7), "61010203046667");
}

TEST(EndianUint, ConvertSwapsHostOrderAndWireOrder)
{
    const unsigned short host16 = 0x1234;
    const unsigned short wire16 = be_uint16_t::convert(host16);
    const unsigned int host32 = 0x12345678;
    const unsigned int wire32 = be_uint32_t::convert(host32);
    EXPECT_EQ(test::hex(&wire16, sizeof(wire16)), "1234");
    EXPECT_EQ(test::hex(&wire32, sizeof(wire32)), "12345678");
    EXPECT_EQ(be_uint16_t::convert(wire16), host16);
    EXPECT_EQ(be_uint32_t::convert(wire32), host32);
}

TEST(EndianUint, ConvertKeepsASingleByte)
{
    for (unsigned int value = 0; value <= 0xFF; ++value) {
        ASSERT_EQ(be_uint8_t::convert(static_cast<unsigned char>(value)), value);
    }
}

TEST(EndianUint, ConvertWorksAtCompileTime)
{
    static_assert(be_uint32_t::convert(be_uint32_t::convert(0x12345678)) == 0x12345678, "its own inverse");
    SUCCEED();
}

} // namespace
} // namespace qel
