// The library and the program are linked so that a memory error in them is hard to exploit. These tests read the files.

#include "meta/CommandOutput.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sstream>
#include <string>
#include <vector>

using qel::test::outputOf;
using testing::ElementsAre;
using testing::IsEmpty;

namespace {

bool hasLine(const std::string& text, const std::string& first, const std::string& second)
{
    std::istringstream lines(text);
    for (std::string line; std::getline(lines, line);)
        if (line.find(first) != std::string::npos && line.find(second) != std::string::npos) return true;
    return false;
}

/// What `readelf -W` prints of one file.
struct ElfView {
    std::string segments; ///< -l
    std::string dynamic;  ///< -d
    std::string symbols;  ///< --dyn-syms
};

ElfView viewOf(const std::string& file)
{
    const std::string readelf = QEL_READELF " -W ";
    return {outputOf(readelf + "-l " + file), outputOf(readelf + "-d " + file),
            outputOf(readelf + "--dyn-syms " + file)};
}

/// @return the protections that the file lacks
std::vector<std::string> lacking(const ElfView& view)
{
    std::vector<std::string> result;
    if (!hasLine(view.segments, "GNU_STACK", " RW ")) result.push_back("a stack that is not executable");
    if (!hasLine(view.segments, "GNU_RELRO", "")) result.push_back("read-only relocations");
    if (!hasLine(view.dynamic, "(FLAGS", "NOW")) result.push_back("immediate binding");
    if (!hasLine(view.symbols, "UND", "__stack_chk_fail")) result.push_back("the stack protector");
    if (!hasLine(view.symbols, "UND", "_chk@")) result.push_back("fortified functions");
    return result;
}

TEST(Hardening, ProtectsTheLibraries)
{
    EXPECT_THAT(lacking(viewOf(QEL_LIBRARY_FILE)), IsEmpty());
    EXPECT_THAT(lacking(viewOf(QEL_PROTOCOL_FILE)), IsEmpty());
}

#ifdef QEL_PROGRAM
TEST(Hardening, ProtectsTheProgram) { EXPECT_THAT(lacking(viewOf(QEL_PROGRAM)), IsEmpty()); }

TEST(Hardening, MakesTheProgramPositionIndependent)
{
    EXPECT_TRUE(hasLine(outputOf(QEL_READELF " -W -h " QEL_PROGRAM), "Type:", "DYN"));
}
#endif

// The check itself can fail.

const ElfView kProtected = {"  GNU_STACK      0x000000 0x0 0x0 0x000000 0x000000 RW  0x10\n"
                            "  GNU_RELRO      0x002de0 0x3de0 0x3de0 0x000220 0x000220 R   0x1\n",
                            " 0x000000000000001e (FLAGS)              BIND_NOW\n",
                            "  1: 0 0 FUNC GLOBAL DEFAULT  UND __stack_chk_fail@GLIBC_2.4 (2)\n"
                            "  2: 0 0 FUNC GLOBAL DEFAULT  UND __memcpy_chk@GLIBC_2.3.4 (3)\n"};

TEST(HardeningCheck, AcceptsAFileWithAllProtections) { EXPECT_THAT(lacking(kProtected), IsEmpty()); }

TEST(HardeningCheck, NamesEachProtectionThatIsMissing)
{
    EXPECT_THAT(lacking({"", "", ""}), ElementsAre("a stack that is not executable", "read-only relocations",
                                                   "immediate binding", "the stack protector", "fortified functions"));
}

TEST(HardeningCheck, RefusesAnExecutableStack)
{
    ElfView view = kProtected;
    view.segments.replace(view.segments.find("RW "), 3, "RWE");
    EXPECT_THAT(lacking(view), ElementsAre("a stack that is not executable"));
}

TEST(HardeningCheck, DoesNotTakeTheStackProtectorForAFortifiedFunction)
{
    ElfView view = kProtected;
    view.symbols.resize(view.symbols.find("  2:"));
    EXPECT_THAT(lacking(view), ElementsAre("fortified functions"));
}

} // namespace
