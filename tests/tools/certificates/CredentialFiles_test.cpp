#include <qel/common/Utilities.hpp>
#include <qel/common/util/PosixError.hpp>

#include "base/Failures.hpp"
#include "certificates/CredentialFiles.hpp"
#include "support/TemporaryDirectory.hpp"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <filesystem>
#include <gmock/gmock.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

namespace qel::test {

namespace {

namespace fs = std::filesystem;

using testing::AllOf;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::MatchesRegex;
using testing::Property;
using testing::StrEq;
using testing::Throws;
using testing::ThrowsMessage;
using tool::CommandFailure;
using tool::EndPostponed;
using tool::ExitStatus;
using tool::KeyPermissions;
using tool::NewFiles;
using Existing = tool::NewFiles::Existing;
using Readers = tool::NewFiles::Readers;

class CredentialFilesTest : public testing::Test {
protected:
    std::string file(const std::string& name) const { return mDirectory.file(name); }
    std::string path() const { return mDirectory.path(); }

    std::string write(const std::string& name, const std::string& content, mode_t mode = 0600) const
    {
        Utilities::writeFile(file(name), content);
        EXPECT_EQ(::chmod(file(name).c_str(), mode), 0);
        return file(name);
    }

    std::string read(const std::string& name) const { return Utilities::readFile(file(name)); }

    mode_t modeOf(const std::string& name) const
    {
        struct stat status {};
        EXPECT_EQ(::lstat(file(name).c_str(), &status), 0);
        return status.st_mode & 07777U;
    }

    std::vector<std::string> names() const
    {
        std::vector<std::string> all;
        for (const auto& entry : fs::directory_iterator(path()))
            all.push_back(entry.path().filename().string());
        std::sort(all.begin(), all.end());
        return all;
    }

private:
    TemporaryDirectory mDirectory;
};

class Umask {
public:
    explicit Umask(mode_t mask) : mBefore(::umask(mask)) {}
    ~Umask() { ::umask(mBefore); }
    Umask(const Umask&) = delete;
    Umask& operator=(const Umask&) = delete;

private:
    mode_t mBefore;
};

template <typename Exception>
auto refused(const std::string& text)
{
    return Throws<Exception>(
        AllOf(Property(&Exception::what, StrEq(text)), Property(&Exception::getExitStatus, ExitStatus::Refused)));
}

TEST_F(CredentialFilesTest, ANameIsAPlainFileName)
{
    const auto check = [](std::string name) { return tool::credentialNameValidator()(name); };
    for (const std::string& name : {std::string("a"), std::string("7"), std::string("Console-1.example_x"),
                                    std::string("root"), std::string(64, 'x')}) {
        EXPECT_EQ(check(name), "") << name;
    }
    for (const std::string& name :
         {std::string(), std::string("."), std::string(".."), std::string(".a"), std::string("-a"), std::string("_a"),
          std::string("a/b"), std::string("../a"), std::string("a b"), std::string("a\nb"), std::string("a\0b", 3),
          std::string("\xC3\xA9"), std::string("a*"), std::string(65, 'x')}) {
        EXPECT_EQ(check(name),
                  "'" + name +
                      "' is not a name for credentials: 1 to 64 letters, digits, '.', '_' and '-', the first a letter "
                      "or a digit");
    }
}

TEST_F(CredentialFilesTest, ADirectoryIsMadeForItsOwnerOnly)
{
    const Umask everything(0);
    tool::makeDirectory(file("new"));
    EXPECT_EQ(modeOf("new"), 0700U);
}

TEST_F(CredentialFilesTest, AnExistingDirectoryStaysUnchanged)
{
    ASSERT_EQ(::mkdir(file("there").c_str(), 0750), 0);
    ASSERT_EQ(::chmod(file("there").c_str(), 0755), 0);
    tool::makeDirectory(file("there"));
    EXPECT_EQ(modeOf("there"), 0755U);
}

TEST_F(CredentialFilesTest, ADirectoryThatCannotBeMadeIsAnError)
{
    write("file", "");
    EXPECT_THAT([&] { tool::makeDirectory(file("file")); },
                ThrowsMessage<FileIOError>(StrEq("cannot make the directory " + file("file") + ": 17 (File exists)")));
    EXPECT_THAT([&] { tool::makeDirectory(file("no/such")); },
                ThrowsMessage<FileIOError>(HasSubstr(": 2 (No such file or directory)")));
}

class NewFilesTest : public CredentialFilesTest {};

TEST_F(NewFilesTest, AppearTogetherAndWhole)
{
    const std::string large(100000, 'x');
    NewFiles files(path(), Existing::Keep);
    files.add("a", "one", Readers::Owner);
    files.add("b", large, Readers::Everybody);
    EXPECT_THAT(names(),
                ElementsAre(MatchesRegex("\\.a\\.[0-9a-f]{8}\\.tmp"), MatchesRegex("\\.b\\.[0-9a-f]{8}\\.tmp")));
    files.publish();
    EXPECT_THAT(names(), ElementsAre("a", "b"));
    EXPECT_EQ(read("a"), "one");
    EXPECT_EQ(read("b"), large);
}

TEST_F(NewFilesTest, AreGoneWithoutPublishing)
{
    {
        NewFiles files(path(), Existing::Keep);
        files.add("a", "one", Readers::Owner);
    }
    EXPECT_THAT(names(), IsEmpty());
}

TEST_F(NewFilesTest, AreCreatedWithTheirMode)
{
    struct Row {
        mode_t mask, owner, everybody;
    };
    for (const Row row : {Row{0, 0600, 0644}, Row{022, 0600, 0644}, Row{027, 0600, 0640}, Row{077, 0600, 0600}}) {
        SCOPED_TRACE(row.mask);
        const Umask mask(row.mask);
        NewFiles files(path(), Existing::Replace);
        files.add("o", "", Readers::Owner);
        EXPECT_EQ(modeOf(names().front()), row.owner); // already under its temporary name
        files.add("e", "", Readers::Everybody);
        files.publish();
        EXPECT_EQ(modeOf("o"), row.owner);
        EXPECT_EQ(modeOf("e"), row.everybody);
    }
}

TEST_F(NewFilesTest, KeepExistingFiles)
{
    write("b", "old");
    NewFiles files(path(), Existing::Keep);
    EXPECT_NO_THROW(files.checkFree({"a", "c"}));
    EXPECT_THAT(
        [&] {
            files.checkFree({"a", "b"});
        },
        refused<CommandFailure>(file("b") + " already exists; --force replaces it"));
}

TEST_F(NewFilesTest, ADanglingLinkCountsAsAnExistingFile)
{
    fs::create_symlink(file("nowhere"), file("a"));
    NewFiles files(path(), Existing::Keep);
    EXPECT_THROW(files.checkFree({"a"}), CommandFailure);
    files.add("a", "new", Readers::Owner);
    EXPECT_THROW(files.publish(), CommandFailure);
    EXPECT_FALSE(fs::exists(file("nowhere")));
}

// Another program made the file after it had been looked for.
TEST_F(NewFilesTest, KeepAFileThatAppearedMeanwhileAndRemoveTheOthers)
{
    {
        NewFiles files(path(), Existing::Keep);
        files.checkFree({"a", "b", "c"});
        files.add("a", "one", Readers::Owner);
        files.add("b", "two", Readers::Owner);
        files.add("c", "three", Readers::Owner);
        write("b", "another's");
        EXPECT_THAT([&] { files.publish(); },
                    refused<CommandFailure>(file("b") + " already exists; --force replaces it"));
    }
    EXPECT_THAT(names(), ElementsAre("b"));
    EXPECT_EQ(read("b"), "another's");
}

TEST_F(NewFilesTest, ReplaceExistingFilesOnRequest)
{
    write("a", "a long old text", 0644);
    NewFiles files(path(), Existing::Replace);
    EXPECT_NO_THROW(files.checkFree({"a"}));
    files.add("a", "new", Readers::Owner);
    EXPECT_EQ(read("a"), "a long old text");
    files.publish();
    EXPECT_EQ(read("a"), "new");
    EXPECT_EQ(modeOf("a"), 0600U);
    EXPECT_THAT(names(), ElementsAre("a"));
}

TEST_F(NewFilesTest, ReplaceALinkButNotItsTarget)
{
    write("target", "old");
    fs::create_symlink(file("target"), file("a"));
    NewFiles files(path(), Existing::Replace);
    files.add("a", "new", Readers::Owner);
    files.publish();
    EXPECT_EQ(read("target"), "old");
    EXPECT_FALSE(fs::is_symlink(file("a")));
    EXPECT_EQ(read("a"), "new");
}

TEST_F(NewFilesTest, ANameThatIsADirectoryIsNotReplaced)
{
    ASSERT_EQ(::mkdir(file("a").c_str(), 0700), 0);
    {
        NewFiles files(path(), Existing::Replace);
        files.add("a", "new", Readers::Owner);
        EXPECT_THAT([&] { files.publish(); },
                    ThrowsMessage<FileIOError>(StrEq("cannot name " + file("a") + ": 21 (Is a directory)")));
    }
    EXPECT_THAT(names(), ElementsAre("a"));
}

TEST_F(NewFilesTest, NeedADirectory)
{
    EXPECT_THAT([&] { NewFiles(file("missing"), Existing::Keep); },
                ThrowsMessage<FileIOError>(
                    StrEq("cannot open the directory " + file("missing") + ": 2 (No such file or directory)")));
    write("file", "");
    EXPECT_THAT([&] { NewFiles(file("file"), Existing::Keep); },
                ThrowsMessage<FileIOError>(HasSubstr(": 20 (Not a directory)")));
}

TEST_F(NewFilesTest, KeepTheDirectoryLocked)
{
    const UniqueFd other(::open(path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    ASSERT_GE(other.get(), 0);
    {
        const NewFiles files(path(), Existing::Keep);
        EXPECT_EQ(::flock(other.get(), LOCK_EX | LOCK_NB), -1);
        EXPECT_EQ(errno, EWOULDBLOCK);
    }
    EXPECT_EQ(::flock(other.get(), LOCK_EX | LOCK_NB), 0);
}

volatile std::sig_atomic_t sTaken = 0;

TEST_F(NewFilesTest, PostponeTheSignalsThatEndTheProcess)
{
    for (const int number : {SIGHUP, SIGINT, SIGQUIT, SIGTERM}) {
        SCOPED_TRACE(number);
        sTaken = 0;
        const auto before = std::signal(number, [](int) { sTaken = sTaken + 1; });
        {
            NewFiles files(path(), Existing::Replace);
            std::raise(number);
            files.add("a", "whole", Readers::Owner);
            files.publish();
            EXPECT_EQ(sTaken, 0);
        }
        EXPECT_EQ(sTaken, 1);
        std::signal(number, before);
    }
    EXPECT_EQ(read("a"), "whole");
}

TEST(EndPostponed, NestsAndLeavesOtherSignalsAlone)
{
    sTaken = 0;
    const auto beforeTerm = std::signal(SIGTERM, [](int) { sTaken = sTaken + 1; });
    const auto beforeUser = std::signal(SIGUSR1, [](int) { sTaken = sTaken + 10; });
    {
        const EndPostponed outer;
        {
            const EndPostponed inner;
            std::raise(SIGTERM);
            std::raise(SIGUSR1);
            EXPECT_EQ(sTaken, 10);
        }
        EXPECT_EQ(sTaken, 10);
    }
    EXPECT_EQ(sTaken, 11);
    std::signal(SIGTERM, beforeTerm);
    std::signal(SIGUSR1, beforeUser);
}

} // namespace

} // namespace qel::test
