#include <qel/protocol/NameText.hpp>

#include "certificates/SubjectText.hpp"

#include <gmock/gmock.h>
#include <stdexcept>

namespace qel::test {

namespace {

using protocol::nameText;
using testing::StrEq;
using testing::ThrowsMessage;
using tool::parseSubject;

TEST(SubjectText, FieldsAreSeparatedByCommas)
{
    EXPECT_EQ(parseSubject("CN=console"), (SSLSubject{{"CN", "console"}}));
    EXPECT_EQ(parseSubject("CN=console,O=Example,C=DE"),
              (SSLSubject{{"CN", "console"}, {"O", "Example"}, {"C", "DE"}}));
}

TEST(SubjectText, AFieldMayBeNamedByShortNameLongNameOrNumber)
{
    for (const char* text : {"CN=x", "commonName=x", "2.5.4.3=x"}) {
        SCOPED_TRACE(text);
        EXPECT_EQ(parseSubject(text), (SSLSubject{{"CN", "x"}}));
    }
    EXPECT_EQ(parseSubject("1.2.3.4=x"), (SSLSubject{{"1.2.3.4", "x"}})); // has no name
}

TEST(SubjectText, BlanksAroundNamesAndValuesAreRemoved)
{
    EXPECT_EQ(parseSubject(" CN = a b , O =  c "), (SSLSubject{{"CN", "a b"}, {"O", "c"}}));
}

TEST(SubjectText, CommaAndBackslashAreEscapedByABackslash)
{
    EXPECT_EQ(parseSubject("CN=a\\,b,O=c\\\\"), (SSLSubject{{"CN", "a,b"}, {"O", "c\\"}}));
    EXPECT_EQ(parseSubject("CN=\\,,O=\\\\\\,"), (SSLSubject{{"CN", ","}, {"O", "\\,"}}));
}

TEST(SubjectText, OnlyTheFirstEqualsSignSeparates)
{
    EXPECT_EQ(parseSubject("CN=a=b"), (SSLSubject{{"CN", "a=b"}}));
    EXPECT_EQ(parseSubject("CN=="), (SSLSubject{{"CN", "="}}));
}

TEST(SubjectText, EnforcesTheLimitsOfTheFields)
{
    EXPECT_EQ(parseSubject("CN=" + std::string(64, 'x')), (SSLSubject{{"CN", std::string(64, 'x')}}));
    EXPECT_EQ(parseSubject("C=DE"), (SSLSubject{{"C", "DE"}}));
    EXPECT_THAT([] { parseSubject("CN=" + std::string(65, 'x')); },
                ThrowsMessage<std::invalid_argument>(
                    StrEq("\"" + std::string(65, 'x') + "\" is not a value for CN: string too long")));
}

TEST(SubjectText, RefusalsNameTheReason)
{
    struct Row {
        const char* text;
        const char* reason;
    };
    const std::vector<Row> rows{
        {"", "\"\" is not a field: a subject is NAME=VALUE,NAME=VALUE,..."},
        {"console", "\"console\" is not a field: a subject is NAME=VALUE,NAME=VALUE,..."},
        {"CN=a,", "\"\" is not a field: a subject is NAME=VALUE,NAME=VALUE,..."},
        {",CN=a", "\"\" is not a field: a subject is NAME=VALUE,NAME=VALUE,..."},
        {"CN=a,b", "\"b\" is not a field: a subject is NAME=VALUE,NAME=VALUE,..."},
        {"CN=", "CN has no value"},
        {"CN= ", "CN has no value"},
        {"commonName=", "CN has no value"},
        {"CN=a,O=", "O has no value"},
        {"=a", "\"\" is not an attribute of a name, such as CN, O, OU, C, ST or L"},
        {"cn=a", "\"cn\" is not an attribute of a name, such as CN, O, OU, C, ST or L"},
        {"Nonsense=a", "\"Nonsense\" is not an attribute of a name, such as CN, O, OU, C, ST or L"},
        {"9.9.9=a", "\"9.9.9\" is not an attribute of a name, such as CN, O, OU, C, ST or L"},
        {"C\x1BN=a", "\"C\\x1bN\" is not an attribute of a name, such as CN, O, OU, C, ST or L"},
        {"subjectAltName=DNS:a", "\"subjectAltName\" is an extension, not an attribute of a name: certificates from "
                                 "here have no extensions"},
        {"CN=a,2.5.29.17=DNS:a", "\"2.5.29.17\" is an extension, not an attribute of a name: certificates from here "
                                 "have no extensions"},
        {"X509v3 Subject Alternative Name=", "\"X509v3 Subject Alternative Name\" is an extension, not an attribute of "
                                             "a name: certificates from here have no extensions"},
        {"authorityInfoAccess=a", "\"authorityInfoAccess\" is an extension, not an attribute of a name: certificates "
                                  "from here have no extensions"},
        {"CN=a,CN=b", "CN is given twice"},
        {"CN=a,CN=a", "CN is given twice"},
        {"CN=a,commonName=b", "CN is given twice"},
        {"CN=a,2.5.4.3=b", "CN is given twice"},
        {"C=D", "\"D\" is not a value for C: string too short"},
        {"C=DEU", "\"DEU\" is not a value for C: string too long"},
        {"C=D*", "\"D*\" is not a value for C: illegal characters"},
        {"CN=a\\b", "a backslash may only precede a comma or another backslash"},
        {"CN=a\\", "a backslash may only precede a comma or another backslash"},
        {"CN=\xC3\xA9", "the value of CN is not printable ASCII"},
        {"CN=a\nb", "the value of CN is not printable ASCII"},
        {"CN=a\x7F", "the value of CN is not printable ASCII"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.text);
        EXPECT_THAT([&] { parseSubject(row.text); }, ThrowsMessage<std::invalid_argument>(StrEq(row.reason)));
    }
}

TEST(SubjectText, ANulInAValueIsRefused)
{
    EXPECT_THAT([] { parseSubject(std::string("CN=a\0b", 6)); },
                ThrowsMessage<std::invalid_argument>(StrEq("the value of CN is not printable ASCII")));
}

TEST(SubjectText, ANameIsPrintedInItsOwnOrderAndParsesAgain)
{
    const std::string text = "O=a\\,b,CN=c\\\\d=e";
    EXPECT_EQ(nameText({{"O", "a,b"}, {"CN", "c\\d=e"}}), text);
    EXPECT_EQ(parseSubject(text), (SSLSubject{{"O", "a,b"}, {"CN", "c\\d=e"}}));
    EXPECT_EQ(nameText({}), "");
    EXPECT_EQ(nameText({{"OU", "a"}, {"OU", "b"}}), "OU=a,OU=b");
}

TEST(SubjectText, TerminalControlBytesArePrintedInHex)
{
    EXPECT_EQ(nameText({{"CN", std::string("\x1B[2J\0\xC3\xA9", 7)}}), "CN=\\x1b[2J\\x00\\xc3\\xa9");
}

} // namespace

} // namespace qel::test
