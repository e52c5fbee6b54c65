#include "support/Bytes.hpp"
#include "support/GoldenFrame.hpp"

#include <cstddef>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sstream>
#include <stdexcept>
#include <string>

namespace qel::test {
namespace {

using testing::ElementsAreArray;
using testing::StrEq;
using testing::ThrowsMessage;

/// A small valid file: a response with an old header.
const char kGood[] = "name: Example\n"
                     "class: Example\n"
                     "function: 0x1234\n"
                     "operation: 22136\n"
                     "classification: Response\n"
                     "header.mHeaderVersion: 0x00\n"
                     "header.mMsgLength: 42\n"
                     "header.mCallerId: 0x01020304\n"
                     "header.mFlags: 0x40\n"
                     "header.mPadLength: 13\n"
                     "header.mDataLength: 5\n"
                     "header.mStatus: 0\n"
                     "payload.mCode: 0xFE\n"
                     "payload.mText: \"a\\x22\"\n"
                     "payload.mBytes: hex 00\n"
                     "payload.mBytes: hex 7F\n"
                     "frame:\n"
                     "0000  DE CA FF                 # mDesc\n"
                     "0003  00                       # mHeaderVersion\n"
                     "0004  00 00 00 2A              # mMsgLength: 42\n"
                     "0008  01 02 03 04              # mCallerId\n"
                     "000C  12 34                    # mFunction\n"
                     "000E  40                       # mFlags\n"
                     "000F  0D                       # mPadLength\n"
                     "0010  00 00 00 05              # mDataLength\n"
                     "0014  56 78                    # mOperation\n"
                     "0016  00 00                    # mStatus\n"
                     "0018  FE                       # mCode: and a remark: with a colon\n"
                     "0019  61                       # mText\n"
                     "001A  22                       # mText\n"
                     "001B  00 7F                    # mBytes\n"
                     "001D  00 00 00 00 00 00 00 00  # pad\n"
                     "0025  00 00 00 00 00           # pad\n";

GoldenFrame read(const std::string& content)
{
    std::istringstream in(content);
    return GoldenFrame::parse("Example", in);
}

std::string replaced(const std::string& what, const std::string& with)
{
    std::string content = kGood;
    const std::size_t at = content.find(what);
    if (at == std::string::npos) throw std::logic_error("the good file has no " + what);
    return content.replace(at, what.size(), with);
}

TEST(GoldenFrameReader, ReadsAllValuesOfAFile)
{
    const GoldenFrame golden = read(kGood);

    EXPECT_EQ(golden.fileName(), "Example");
    EXPECT_EQ(golden.name(), "Example");
    EXPECT_EQ(golden.className(), "Example");
    EXPECT_EQ(golden.function(), 0x1234);
    EXPECT_EQ(golden.operation(), 0x5678);
    EXPECT_EQ(golden.classification(), QelMessageClassification::Response);
    EXPECT_TRUE(golden.isBuilt());
    EXPECT_EQ(golden.number<unsigned int>("header.mCallerId"), 0x01020304U);
    EXPECT_EQ(golden.number<unsigned char>("payload.mCode"), 0xFE);
    EXPECT_EQ(golden.text("payload.mText"), "a\"");
    EXPECT_EQ(hex(golden.text("payload.mBytes")), "007F");
    EXPECT_THAT(golden.payloadKeys(), ElementsAreArray({"payload.mBytes", "payload.mCode", "payload.mText"}));
    EXPECT_EQ(hex(golden.bytes()), "DECAFF000000002A01020304123440"
                                   "0D0000000556780000FE6122007F"
                                   "00000000000000000000000000");
    const std::string whole = kGood;
    EXPECT_EQ(golden.frameText(), whole.substr(whole.find("0000  DE")));
    ASSERT_EQ(golden.places().size(), 14U);
    EXPECT_EQ(golden.places()[0].field, "header.mDesc");
    EXPECT_EQ(golden.places()[11].field, "payload.mText");
    EXPECT_EQ(golden.places()[11].offset, 25U);
    EXPECT_EQ(golden.places()[11].length, 2U);
    EXPECT_EQ(golden.places()[13].field, "pad");
    EXPECT_EQ(golden.places()[13].length, 13U);
}

TEST(GoldenFrameReader, RefusesTheWrongKindOfValue)
{
    const GoldenFrame golden = read(kGood);

    EXPECT_THAT([&] { golden.number<unsigned int>("payload.mNone"); },
                ThrowsMessage<std::runtime_error>(StrEq("Example.txt: no value: payload.mNone")));
    EXPECT_THAT([&] { golden.number<unsigned int>("payload.mText"); },
                ThrowsMessage<std::runtime_error>(StrEq("Example.txt: not a number: payload.mText")));
    EXPECT_THAT([&] { golden.text("payload.mCode"); },
                ThrowsMessage<std::runtime_error>(StrEq("Example.txt: not a text: payload.mCode")));
    EXPECT_THAT([&] { golden.number<unsigned short>("header.mCallerId"); },
                ThrowsMessage<std::runtime_error>(StrEq("Example.txt: number too large: header.mCallerId")));
}

TEST(GoldenFrameReader, NamesAMissingFile)
{
    EXPECT_THAT([] { GoldenFrame::load("Missing"); },
                ThrowsMessage<std::runtime_error>(StrEq("Missing.txt: cannot be read")));
}

/// A change that makes the good file malformed, and the error that it causes.
struct MalformedCase {
    const char* what;
    const char* with;
    const char* message;
};

template <std::size_t Count>
void expectErrors(const MalformedCase (&cases)[Count])
{
    for (const MalformedCase& wrong : cases) {
        SCOPED_TRACE(std::string(wrong.what) + " -> " + wrong.with);
        EXPECT_THAT([&] { read(replaced(wrong.what, wrong.with)); },
                    ThrowsMessage<std::runtime_error>(StrEq(wrong.message)));
    }
}

TEST(GoldenFrameReader, NamesTheErrorOfAMalformedKey)
{
    const MalformedCase cases[] = {
        {"name: Example", "name Example", "Example.txt:1: not \"key: value\""},
        {"name: Example", "name: ", "Example.txt:1: not \"key: value\""},
        {"name: Example", "", "Example.txt:1: not \"key: value\""},
        {"name: Example\n", "name: Example\nname: Example\n", "Example.txt:2: key \"name\" occurs twice"},
        {"name: Example\n", "", "Example.txt: no key \"name\""},
        {"class: Example\n", "", "Example.txt: no key \"class\""},
        {"class: Example\n", "class: Other\n", "Example.txt: the file is not named after its class"},
        {"function: 0x1234\n", "", "Example.txt: no key \"function\""},
        {"function: 0x1234", "function: 0x12345", "Example.txt:3: not a 16-bit number"},
        {"operation: 22136", "operation: 22l36", "Example.txt:4: not a 16-bit number"},
        {"operation: 22136", "operation: 2A", "Example.txt:4: not a 16-bit number"},
        {"operation: 22136\n", "", "Example.txt: no key \"operation\""},
        {"classification: Response\n", "", "Example.txt: no key \"classification\""},
        {"classification: Response", "classification: response",
         "Example.txt:5: classification is not Request, Response or Async"},
        {"classification: Response", "classification: Request",
         "Example.txt: the rows hold something else: header.mFlags"},
        {"classification: Response", "classification: Async",
         "Example.txt: the rows hold something else: header.mFlags"},
        {"name: Example\n", "name: Example\nbuilt: yes\n", "Example.txt:2: \"built\" is \"no\" or absent"},
        {"name: Example\n", "name: Example\ncolour: red\n", "Example.txt:2: unknown key \"colour\""},
        {"name: Example\n", "name: Example\ncapabilities: 0 32\n", "Example.txt:2: not a capability number: \"32\""},
        {"header.mStatus: 0\n", "header.mStatus: 0\nheader.mStatus: 0\n",
         "Example.txt:13: key \"header.mStatus\" occurs twice"},
        {"payload.mText: \"a\\x22\"\n", "payload.mText: \"a\\x22\"\npayload.mText: hex 00\n",
         "Example.txt:15: key \"payload.mText\" occurs twice"},
        {"payload.mText: \"a\\x22\"", "payload.mText: \"a\\x22", "Example.txt:14: not a text in quotes"},
        {"payload.mText: \"a\\x22\"", "payload.mText: \"", "Example.txt:14: not a text in quotes"},
        {"payload.mText: \"a\\x22\"", "payload.mText: \"a\"\"", "Example.txt:14: not a text in quotes"},
        {"payload.mText: \"a\\x22\"", "payload.mText: \"a\\n\"", "Example.txt:14: not a text in quotes"},
        {"payload.mText: \"a\\x22\"", "payload.mText: \"a\\x2\"", "Example.txt:14: not a text in quotes"},
        {"payload.mText: \"a\\x22\"", "payload.mText: \"a\\x2g\"", "Example.txt:14: not a text in quotes"},
        {"payload.mText: \"a\\x22\"", "payload.mText: \"\xC3\xA4\"", "Example.txt:14: not a text in quotes"},
        {"payload.mBytes: hex 00", "payload.mBytes: hex 0", "Example.txt:15: bytes are not \"hex 00 FF\""},
        {"payload.mBytes: hex 00", "payload.mBytes: hex 00-01", "Example.txt:15: bytes are not \"hex 00 FF\""},
        {"payload.mBytes: hex 00", "payload.mBytes: hex fe", "Example.txt:15: bytes are not \"hex 00 FF\""},
        {"payload.mCode: 0xFE", "payload.mCode: FE", "Example.txt:13: not a number, a text or bytes"},
        {"payload.mCode: 0xFE", "payload.mCode: 0x", "Example.txt:13: not a number, a text or bytes"},
        {"payload.mCode: 0xFE", "payload.mCode: 0x1FFFFFFFFFFFFFFFF", "Example.txt:13: not a number, a text or bytes"},
        {"payload.mCode: 0xFE", "payload.mCode: 0xFF", "Example.txt: the rows hold something else: payload.mCode"},
        {"payload.mCode: 0xFE", "payload.mCoda: 0xFE", "Example.txt: the rows hold something else: payload.mCode"},
        {"payload.mCode: 0xFE\n", "payload.mCode: 0xFE\npayload.mMore: 1\n",
         "Example.txt: a value without rows: payload.mMore"},
        {"payload.mText: \"a\\x22\"", "payload.mText: \"ab\"",
         "Example.txt: the rows hold something else: payload.mText"},
        {"payload.mText: \"a\\x22\"", "payload.mText: \"a\"",
         "Example.txt: the rows hold something else: payload.mText"},
        {"payload.mText: \"a\\x22\"", "payload.mText: \"a\\x22c\"",
         "Example.txt: the rows hold something else: payload.mText"},
    };
    expectErrors(cases);
}

TEST(GoldenFrameReader, NamesTheErrorOfAMalformedRow)
{
    const MalformedCase cases[] = {
        {"frame:\n", "", "Example.txt:17: not \"key: value\""},
        {"0000  DE CA FF                 # mDesc", "0000  DE CA FF",
         "Example.txt:18: not \"0000  DE CA FF                 # field\""},
        {"0000  DE CA FF                 # mDesc", "0000  DE CA FF                 # ",
         "Example.txt:18: not \"0000  DE CA FF                 # field\""},
        {"0000  DE CA FF                 # mDesc", "0000 DE CA FF                  # mDesc",
         "Example.txt:18: not \"0000  DE CA FF                 # field\""},
        {"0000  DE CA FF                 # mDesc", "0000  DE CA FF                # mDesc2",
         "Example.txt:18: not \"0000  DE CA FF                 # field\""},
        {"0000  DE CA FF                 # mDesc", "000x  DE CA FF                 # mDesc",
         "Example.txt:18: the offset is not four hexadecimal digits"},
        {"0000  DE CA FF                 # mDesc", "0001  DE CA FF                 # mDesc",
         "Example.txt:18: the row does not continue at offset 0"},
        {"0000  DE CA FF                 # mDesc", "0000  DE CA F                  # mDesc",
         "Example.txt:18: not one to eight bytes"},
        {"0000  DE CA FF                 # mDesc", "0000  de ca ff                 # mDesc",
         "Example.txt:18: not one to eight bytes"},
        {"0000  DE CA FF                 # mDesc", "0000                           # mDesc",
         "Example.txt:18: not one to eight bytes"},
        {"DE CA FF", "DE CA FE", "Example.txt: the rows hold something else: header.mDesc"},
        {"0003  00                       # mHeaderVersion\n", "",
         "Example.txt:19: the row does not continue at offset 3"},
        {"000C  12 34", "000C  34 12", "Example.txt: the rows hold something else: header.mFunction"},
        {"0014  56 78", "0014  78 56", "Example.txt: the rows hold something else: header.mOperation"},
        {"0025  00 00 00 00 00           # pad\n", "", "Example.txt: the frame is not mMsgLength bytes long"},
        {"0025  00 00 00 00 00 ", "0025  00 00 00 00 01 ", "Example.txt: the rows hold something else: pad"},
        {"0025  00 00 00 00 00           # pad", "0025  00 00 00 00 00           # gap",
         "Example.txt: the rows hold something else: gap"},
        {"000F  0D", "000F  0C", "Example.txt: header, payload and pad are not mMsgLength bytes long"},
        {"0010  00 00 00 05", "0010  00 00 00 04",
         "Example.txt: header, payload and pad are not mMsgLength bytes long"},
        {"0019  61                       # mText", "0019  61                       # mCode",
         "Example.txt: the rows hold something else: payload.mCode"},
        {"001A  22                       # mText", "001A  22                       # mCode",
         "Example.txt: the rows of a field are not together: payload.mCode"},
        {"001B  00 7F                    # mBytes\n001D  00 00 00 00 00 00 00 00  # pad\n",
         "001B  00 7F 00                 # mBytes\n001E  00 00 00 00 00 00 00     # pad\n",
         "Example.txt: a row crosses the end of the part it is in: payload.mBytes"},
        {"0003  00                       # mHeaderVersion", "0003  20                       # mHeaderVersion",
         "Example.txt: header, payload and pad are not mMsgLength bytes long"},
    };
    expectErrors(cases);
}

TEST(GoldenFrameReader, RefusesAFileThatEndsTooEarly)
{
    const std::string whole = kGood;
    EXPECT_THAT([] { read(""); }, ThrowsMessage<std::runtime_error>(StrEq("Example.txt: no line \"frame:\"")));
    EXPECT_THAT([&] { read(whole.substr(0, whole.find("frame:"))); },
                ThrowsMessage<std::runtime_error>(StrEq("Example.txt: no line \"frame:\"")));
    EXPECT_THAT([&] { read(whole.substr(0, whole.find("0000  DE"))); },
                ThrowsMessage<std::runtime_error>(StrEq("Example.txt: the frame is shorter than its header")));
    EXPECT_THAT([&] { read(whole.substr(0, whole.find("0016  00"))); },
                ThrowsMessage<std::runtime_error>(StrEq("Example.txt: the frame is shorter than its header")));
}

} // namespace
} // namespace qel::test
