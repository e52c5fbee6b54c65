// "qel decode" as a program: files, pipes and exit statuses. What it prints is tested with DecodeCommand.

#include <qel/common/Utilities.hpp>

#include "integration/TestConsole.hpp"
#include "support/GoldenFrame.hpp"
#include "support/TemporaryDirectory.hpp"

#include <fstream>
#include <gmock/gmock.h>
#include <sys/stat.h>

namespace qel::test {

namespace {

using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StartsWith;

const std::string& goldenFrames()
{
    static const std::string all = [] {
        std::string bytes;
        for (const std::string& name : GoldenFrame::allNames())
            bytes += GoldenFrame::load(name).bytes();
        return bytes;
    }();
    return all;
}

std::size_t count(const std::string& text, const std::string& part)
{
    std::size_t found = 0;
    for (std::size_t at = text.find(part); at != std::string::npos; at = text.find(part, at + 1))
        ++found;
    return found;
}

Process::Result decode(const std::string& input, const std::vector<std::string>& options = {})
{
    std::vector<std::string> arguments = qelCommand({"decode"});
    arguments.insert(arguments.end(), options.begin(), options.end());
    return run(arguments, input);
}

Process::Result runShell(const std::string& script) { return run({"/bin/sh", "-c", script}); }

class DecodeTest : public ::testing::Test {
protected:
    std::string fileWith(const std::string& bytes) const
    {
        const std::string path = directory.file("frames");
        std::ofstream(path, std::ios::binary) << bytes;
        return path;
    }

    const TemporaryDirectory directory;
};

TEST_F(DecodeTest, StandardInputIsReadUnlessAFileIsNamed)
{
    for (const std::vector<std::string>& options : {std::vector<std::string>{}, {"-"}, {"--raw"}, {"--raw", "-"}}) {
        const auto result = decode(goldenFrames(), options);
        EXPECT_EQ(result.exitStatus, 0);
        EXPECT_EQ(count(result.output, "frame at offset "), GoldenFrame::allNames().size());
        EXPECT_THAT(result.errors, IsEmpty());
    }
}

TEST_F(DecodeTest, AFileIsRead)
{
    const auto result = runQel({"decode", fileWith(goldenFrames())});
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.output, decode(goldenFrames()).output);
    EXPECT_THAT(result.errors, IsEmpty());
}

TEST_F(DecodeTest, HexadecimalTextIsRead)
{
    std::string text = "# all of them\n";
    for (std::size_t i = 0; i < goldenFrames().size(); ++i) {
        char digits[8];
        std::snprintf(digits, sizeof(digits), "%02x%s", static_cast<unsigned char>(goldenFrames()[i]),
                      i % 16 == 15 ? "\n" : " ");
        text += digits;
    }
    for (const std::vector<std::string>& options : {std::vector<std::string>{}, {"--hex"}}) {
        const auto result = decode(text, options);
        EXPECT_EQ(result.exitStatus, 0);
        EXPECT_EQ(result.output, decode(goldenFrames()).output);
    }
}

TEST_F(DecodeTest, TheFilesOfGoldenFramesAreRead)
{
    std::string together;
    for (const std::string& name : GoldenFrame::allNames()) {
        SCOPED_TRACE(name);
        const std::string path = std::string(QEL_SOURCE_DIR "/vectors/") + name + ".txt";
        const auto result = runQel({"decode", path});
        EXPECT_EQ(result.exitStatus, 0);
        EXPECT_EQ(result.output, decode(GoldenFrame::load(name).bytes()).output);
        EXPECT_THAT(result.errors, IsEmpty());
        together += Utilities::readFile(path);
    }
    EXPECT_EQ(decode(together).output, decode(goldenFrames()).output);
}

TEST_F(DecodeTest, ABadFrameIsExitStatusOne)
{
    const auto result = decode(goldenFrames() + "x");
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.output, decode(goldenFrames()).output);
    EXPECT_EQ(result.errors,
              "qel: bad frame at offset " + std::to_string(goldenFrames().size()) + ": i_buffer bad eyecatcher\n");
}

TEST_F(DecodeTest, EmptyInputIsDone)
{
    const auto result = decode("");
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.output, IsEmpty());
    EXPECT_EQ(runQel({"decode", fileWith("")}).exitStatus, 0);
    EXPECT_EQ(runQel({"decode", "/dev/null"}).exitStatus, 0);
}

TEST_F(DecodeTest, JsonIsOneDocument)
{
    const auto result = decode(goldenFrames() + "x", {"--json"});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_THAT(result.output, StartsWith("{\n  \"frames\": [\n"));
    EXPECT_EQ(count(result.output, "\n      \"offset\": "), GoldenFrame::allNames().size() + 1);
    EXPECT_THAT(result.output, HasSubstr("\"reason\": \"i_buffer bad eyecatcher\""));
}

TEST_F(DecodeTest, LibraryLogIsWrittenOnRequest)
{
    std::string bad = GoldenFrame::load("QelMessageGetQelTodReq").bytes();
    bad[3] = '\x21';
    EXPECT_EQ(decode(bad).errors, "qel: bad frame at offset 0: i_buffer bad header version\n");
    EXPECT_THAT(decode(bad, {"--log-level", "error"}).errors, HasSubstr(" (E): "));
}

TEST_F(DecodeTest, AMissingFileIsUsage)
{
    const auto result = runQel({"decode", directory.file("none")});
    EXPECT_EQ(result.exitStatus, 2);
    EXPECT_THAT(result.errors, HasSubstr("\"" + directory.file("none") + "\" does not exist"));
}

TEST_F(DecodeTest, ConflictingOptionsAreUsage)
{
    EXPECT_EQ(decode("", {"--raw", "--hex"}).exitStatus, 2);
    EXPECT_EQ(decode("", {"--unknown"}).exitStatus, 2);
    EXPECT_EQ(decode("", {"-", "-"}).exitStatus, 2);
}

TEST_F(DecodeTest, AFileThatCannotBeReadIsAFailure)
{
    const auto result = runQel({"decode", directory.path()});
    EXPECT_EQ(result.exitStatus, 4);
    EXPECT_EQ(result.errors, "qel: cannot read the input\n");
    EXPECT_THAT(result.output, IsEmpty());
}

TEST_F(DecodeTest, AFileThatCannotBeOpenedIsAFailure)
{
    // Opening a socket file fails for everybody: see open(2), ENXIO.
    const std::string path = directory.file("socket");
    ASSERT_EQ(::mknod(path.c_str(), S_IFSOCK | 0600, 0), 0);
    const auto result = runQel({"decode", path});
    EXPECT_EQ(result.exitStatus, 4);
    EXPECT_EQ(result.errors, "qel: cannot open " + path + ": 6 (No such device or address)\n");
}

TEST_F(DecodeTest, StandardInputThatCannotBeReadIsAFailure)
{
    const std::string program = qelCommand({})[0];
    for (const std::string redirection : {"<&-", "</"}) {
        const auto result = runShell("'" + program + "' decode " + redirection);
        EXPECT_EQ(result.exitStatus, 4) << redirection;
        EXPECT_EQ(result.errors, "qel: cannot read the input\n") << redirection;
    }
}

TEST_F(DecodeTest, OutputThatCannotBeWrittenIsAFailure)
{
    const std::string command = "'" + qelCommand({})[0] + "' decode '" + fileWith(goldenFrames()) + "' ";
    for (const std::string redirection : {">&-", ">/dev/full", "--json >/dev/full"}) {
        const auto result = runShell(command + redirection);
        EXPECT_EQ(result.exitStatus, 4) << redirection;
        EXPECT_EQ(result.errors, "qel: cannot write to standard output\n") << redirection;
    }
}

TEST_F(DecodeTest, TheReaderOfTheOutputMayClose)
{
    std::string much;
    while (much.size() < 500000)
        much += goldenFrames();
    const auto result = runShell("'" + qelCommand({})[0] + "' decode '" + fileWith(much) + "' | head -n 1");
    EXPECT_EQ(result.output, "frame at offset 0, 32 bytes\n");
    EXPECT_THAT(result.errors, IsEmpty());
}

} // namespace

} // namespace qel::test
