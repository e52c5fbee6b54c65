#include "base/Failures.hpp"
#include "base/HomePath.hpp"
#include "base/OptionChecks.hpp"
#include "console/Profiles.hpp"
#include "support/TemporaryDirectory.hpp"

#include <CLI/CLI.hpp>
#include <fstream>
#include <functional>
#include <gmock/gmock.h>
#include <string>
#include <vector>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Pair;
using tool::Profile;

constexpr const char* kLab = "[profile.lab]\n"
                             "connect = \"host:1\"\n"
                             "plain = true\n"
                             "retries = 3\n"
                             "peer-name = [\"a\", \"b\"]\n"
                             "partitions = { web1 = 1, db = 65535 }\n";

class ProfilesTest : public ::testing::Test {
protected:
    ProfilesTest()
    {
        command.add_option("--connect", connect);
        command.add_flag("--plain", plain);
        command.add_option("--retries", retries)->transform(tool::integerIn(0, 10));
        command.add_option("--peer-name", names);
    }

    std::vector<Profile> profiles(const std::string& text) const
    {
        std::ofstream(path) << text;
        return tool::readProfiles(path);
    }
    std::uint16_t apply(const std::string& target, const std::string& text)
    {
        return tool::applyProfile(target, profiles(text), command);
    }
    static std::string failureOf(const std::function<void()>& action)
    {
        try {
            action();
        } catch (const tool::CommandFailure& error) {
            EXPECT_EQ(error.getExitStatus(), tool::ExitStatus::Usage);
            return error.what();
        }
        return "no error";
    }

    const TemporaryDirectory directory;
    const std::string path = directory.file("config.toml");
    CLI::App command;
    std::string connect;
    bool plain = false;
    unsigned int retries = 0;
    std::vector<std::string> names;
};

TEST_F(ProfilesTest, AFileThatIsNotThereHasNone) { EXPECT_THAT(tool::readProfiles(path), IsEmpty()); }

TEST_F(ProfilesTest, ProfilesHaveNamesOptionsAndPartitions)
{
    const auto all = profiles(kLab + std::string("[profile.other]\n"));
    ASSERT_EQ(all.size(), 2U);
    EXPECT_EQ(all[0].name, "lab");
    EXPECT_EQ(all[0].option("connect"), "host:1");
    EXPECT_EQ(all[0].option("none"), "");
    EXPECT_THAT(all[0].partitions, ElementsAre(Pair("web1", 1), Pair("db", 65535)));
    EXPECT_THAT(all[1].partitions, IsEmpty());
}

TEST_F(ProfilesTest, AProfileSetsTheOptions)
{
    EXPECT_EQ(apply("lab/web1", kLab), 1);
    EXPECT_EQ(connect, "host:1");
    EXPECT_TRUE(plain);
    EXPECT_EQ(retries, 3U);
    EXPECT_THAT(names, ElementsAre("a", "b"));
}

TEST_F(ProfilesTest, ThePartitionMayBeANumber) { EXPECT_EQ(apply("lab/7", kLab), 7); }

TEST_F(ProfilesTest, TheCommandLineComesFirst)
{
    command.parse("--connect other:2");
    EXPECT_EQ(apply("lab/db", kLab), 65535);
    EXPECT_EQ(connect, "other:2");
    EXPECT_EQ(retries, 3U);
}

TEST_F(ProfilesTest, AFlagMayBeFalse)
{
    apply("lab/1", "[profile.lab]\nplain = false\n");
    EXPECT_FALSE(plain);
}

TEST_F(ProfilesTest, UnknownNamesAreAnsweredWithTheNearestOne)
{
    EXPECT_EQ(failureOf([&] { apply("lap/web1", kLab); }), "there is no profile \"lap\"; did you mean \"lab\"?");
    EXPECT_EQ(failureOf([&] { apply("lab/web", kLab); }),
              "there is no partition \"lab/web\"; did you mean \"lab/web1\"?");
    EXPECT_EQ(failureOf([&] { apply("lab/65536", kLab); }),
              "there is no partition \"lab/65536\"; qel list shows what there is");
}

TEST_F(ProfilesTest, MistakesInTheFileAreNamedWithTheirPlace)
{
    EXPECT_THAT(failureOf([&] { apply("lab/1", "[profile.lab]\nconect = \"x\"\n"); }),
                EndsWith("config.toml:2:1: unknown key \"conect\"; did you mean \"connect\"?"));
    EXPECT_THAT(failureOf([&] { apply("lab/1", "[profile.lab]\nretries = 11\n"); }),
                EndsWith("config.toml:2:1: --retries: \"11\" is not an integer in [0, 10]"));
    EXPECT_THAT(failureOf([&] { profiles("[profil.lab]\n"); }),
                EndsWith("unknown key \"profil\"; did you mean \"profile\"?"));
    EXPECT_THAT(failureOf([&] { profiles("[profile.\"a/b\"]\n"); }),
                EndsWith("the name of a profile must not contain a slash"));
    EXPECT_NE(failureOf([&] { profiles("[profile.lab.partitions]\nx = 65536\n"); }), "no error");
}

TEST_F(ProfilesTest, TheHomeDirectoryMayBeATilde)
{
    apply("lab/1", "[profile.lab]\nconnect = \"~/x\"\npeer-name = [\"~\", \"a~/b\"]\n");
    EXPECT_EQ(connect, tool::environmentValue("HOME") + "/x");
    EXPECT_THAT(names, ElementsAre("~", "a~/b"));
}

TEST_F(ProfilesTest, StepsOfAScriptAreNoOptionsOfAProfile)
{
    std::string steps;
    for (const char* const name : {"send", "expect", "exec"}) {
        command.add_option(std::string("--") + name, steps);
        EXPECT_THAT(failureOf([&] { apply("lab/1", std::string("[profile.lab]\n") + name + " = \"x\"\n"); }),
                    HasSubstr(std::string("unknown key \"") + name + "\""));
    }
}

TEST_F(ProfilesTest, AWordThatIsNoPartitionIsAnsweredWithTheNearestName)
{
    const auto answer = [&](const std::string& word) {
        return failureOf([&] { tool::failNoPartition(word, profiles(kLab)); });
    };
    const std::string text = " is no partition id from 0 to 65535 and no PROFILE/PARTITION; ";
    EXPECT_EQ(answer("web1"), "\"web1\"" + text + "did you mean \"lab/web1\"?");
    EXPECT_EQ(answer("web"), "\"web\"" + text + "did you mean \"lab/web1\"?");
    EXPECT_EQ(answer("lab"), "\"lab\"" + text + "did you mean \"lab/PARTITION\"?");
    EXPECT_EQ(answer("something"), "\"something\"" + text + "qel list shows what there is");
}

} // namespace

} // namespace qel::test
