// What the shared library offers to the programs that link it: namespace qel and nothing else.

#include "meta/CommandOutput.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <regex>
#include <sstream>
#include <string>
#include <vector>

using qel::test::outputOf;
using testing::Contains;
using testing::Each;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::ResultOf;

namespace {

// The names in the output of `nm -D --defined-only`: the last word of each line ("0000abcd T name", "name@@VERSION").
std::vector<std::string> namesIn(const std::string& listing)
{
    std::vector<std::string> names;
    std::istringstream lines(listing);
    for (std::string line; std::getline(lines, line);) {
        const std::string last = line.substr(line.find_last_of(' ') + 1);
        if (!last.empty()) names.push_back(last.substr(0, last.find('@')));
    }
    return names;
}

// Functions and data of the namespace, and what the compiler makes of its classes: type information, tables of virtual
// functions, thunks, guards.
const std::string kSpecial = "_Z(T[ISVT]|TC|GV|Thn?[0-9]+_|Tvn?[0-9]+_n?[0-9]+_)?NK?";

bool isOurs(const std::string& name)
{
    static const std::regex ours(kSpecial + "3qel.*");
    return std::regex_match(name, ours);
}

bool isOfProtocol(const std::string& name)
{
    static const std::regex ours(kSpecial + "3qel8protocol.*");
    return std::regex_match(name, ours);
}

std::vector<std::string> foreign(const std::vector<std::string>& names)
{
    std::vector<std::string> result;
    for (const std::string& name : names)
        if (!isOurs(name)) result.push_back(name);
    return result;
}

std::vector<std::string> exportedNames(const std::string& library)
{
    return namesIn(outputOf(std::string(QEL_NM) + " -D --defined-only '" + library + "'"));
}

TEST(ExportedSymbols, AreAllOfOurNamespace) { EXPECT_THAT(foreign(exportedNames(QEL_LIBRARY_FILE)), IsEmpty()); }

TEST(ExportedSymbols, IncludeWhatUsersCallCatchAndDeriveFrom)
{
    const std::vector<std::string> names = exportedNames(QEL_LIBRARY_FILE);
    EXPECT_THAT(names, Contains("_ZN3qel7versionEv"));                              // a free function
    EXPECT_THAT(names, Contains("_ZTIN3qel17StreamIOExceptionE"));                  // an exception
    EXPECT_THAT(names, Contains("_ZTVN3qel6StreamE"));                              // a base class
    EXPECT_THAT(names, Contains("_ZTTN3qel6StreamE"));                              // with a virtual base
    EXPECT_THAT(names, Contains("_ZN3qel16QelMessageStream4readEv"));               // a member function
    EXPECT_THAT(names, Contains("_ZNK3qel18QelMessageRegistry11deserializeEPKcj")); // a const one
}

TEST(ExportedSymbols, OfTheProtocolLibraryAreAllOfItsNamespace)
{
    const std::vector<std::string> names = exportedNames(QEL_PROTOCOL_FILE);
    EXPECT_THAT(names, Each(ResultOf("is of qel::protocol", isOfProtocol, true)));
    EXPECT_THAT(names, Contains("_ZTIN3qel8protocol11StatusErrorE")); // an exception
    EXPECT_THAT(
        names,
        Contains("_ZN3qel8protocol7resolveERKNS0_13ServerAddressE" // a free function
                 "NSt6chrono10time_pointINS4_3_V212steady_clockENS4_8durationIlSt5ratioILl1ELl1000000000EEEEEE"));
}

// The check itself can fail.

TEST(ExportedSymbolsCheck, FindsNamesOfOthers)
{
    const std::vector<std::string> strangers = {"_ZNSt6vectorIN3qel10QelMessageESaIS1_EED1Ev",
                                                "_ZNSt6vectorIcSaIcEE17_M_realloc_insertIJcEEEvPc",
                                                "_ZTISt9exception",
                                                "_ZN4qelx1fEv",
                                                "_Z7versionv",
                                                "qel_version",
                                                "_init"};
    EXPECT_EQ(foreign(strangers), strangers);
    EXPECT_FALSE(isOfProtocol("_ZN3qel7versionEv"));
}

TEST(ExportedSymbolsCheck, KnowsItsOwn)
{
    EXPECT_THAT(
        foreign({"_ZN3qel7versionEv", "_ZNK3qel10QelMessage7getDataEv", "_ZTIN3qel6StreamE", "_ZTSN3qel6StreamE",
                 "_ZTVN3qel6StreamE", "_ZTTN3qel6StreamE", "_ZTCN3qel6StreamE0_NS_11InputStreamE",
                 "_ZThn8_N3qel6StreamD0Ev", "_ZTv0_n24_N3qel6StreamD1Ev", "_ZGVN3qel6Stream1sE"}),
        IsEmpty());
}

TEST(ExportedSymbolsCheck, ReadsTheListing)
{
    EXPECT_THAT(namesIn("0000000000001120 T _ZN3qel7versionEv\n0000000000004010 W other@@NODE_1\n"),
                ElementsAre("_ZN3qel7versionEv", "other"));
}

} // namespace
