#include <qel/common/Utilities.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/CredentialFiles.hpp>

#include "support/Errors.hpp"
#include "support/TemporaryDirectory.hpp"

#include <cstdio>
#include <filesystem>
#include <gmock/gmock.h>
#include <sys/stat.h>
#include <unistd.h>

namespace qel::test {

namespace {

namespace fs = std::filesystem;

using protocol::CredentialsUnusable;
using protocol::KeyPermissions;
using testing::StrEq;
using testing::ThrowsMessage;

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

private:
    TemporaryDirectory mDirectory;
};

TEST_F(CredentialFilesTest, LieInADirectoryByName)
{
    const auto paths = protocol::credentialPaths("/etc/qel", "server");
    EXPECT_EQ(paths.certificate, "/etc/qel/server.crt");
    EXPECT_EQ(paths.key, "/etc/qel/server.key");
    EXPECT_EQ(paths.root, "/etc/qel/root.crt");
    EXPECT_EQ(protocol::requestFile("server"), "server.csr");
    EXPECT_EQ(protocol::credentialPaths("dir/", "x").key, "dir/x.key");
    EXPECT_EQ(protocol::credentialPaths("/", "x").key, "/x.key");
    EXPECT_EQ(protocol::credentialPaths("", "x").key, "x.key");
}

TEST_F(CredentialFilesTest, AKeyThatOthersMayReadOrWriteIsRefused)
{
    for (const mode_t mode : {0600U, 0400U, 0700U, 0200U, 0711U}) {
        SCOPED_TRACE(mode);
        if ((mode & 0400U) == 0 && ::geteuid() != 0) continue; // only the superuser reads it then
        EXPECT_EQ(protocol::readKeyFile(write("k", "key", mode), KeyPermissions::OwnerOnly), "key");
    }
    for (const mode_t mode : {0640U, 0604U, 0620U, 0602U, 0644U, 0666U, 0777U}) {
        char text[8];
        std::snprintf(text, sizeof(text), "%04o", mode);
        SCOPED_TRACE(text);
        const std::string key = write("k", "key", mode);
        EXPECT_THAT([&] { protocol::readKeyFile(key, KeyPermissions::OwnerOnly); },
                    failsWith<CredentialsUnusable>("others may read or write the private key " + key + " (mode " +
                                                   text + "): use chmod 600"));
        EXPECT_EQ(protocol::readKeyFile(key, KeyPermissions::Any), "key");
    }
}

TEST_F(CredentialFilesTest, ACertificateGivenAsAKeyIsNotRefusedForItsPermissions)
{
    const std::string pem = "-----BEGIN CERTIFICATE-----\nAAAA\n-----END CERTIFICATE-----\n";
    EXPECT_EQ(protocol::readKeyFile(write("c", pem, 0644), KeyPermissions::OwnerOnly), pem);
}

TEST_F(CredentialFilesTest, ThePermissionsOfALinkedKeyAreThoseOfItsTarget)
{
    const std::string key = write("target", "key", 0644);
    fs::create_symlink(key, file("link"));
    EXPECT_THROW(protocol::readKeyFile(file("link"), KeyPermissions::OwnerOnly), CredentialsUnusable);
    write("target", "key", 0600);
    EXPECT_EQ(protocol::readKeyFile(file("link"), KeyPermissions::OwnerOnly), "key");
}

TEST_F(CredentialFilesTest, CertificatesMayBeReadByEverybody)
{
    EXPECT_EQ(protocol::readPemFile(write("c", "certificate", 0644)), "certificate");
    EXPECT_EQ(protocol::readPemFile(write("e", "", 0644)), "");
}

TEST_F(CredentialFilesTest, OnlyRegularFilesAreRead)
{
    ASSERT_EQ(::mkfifo(file("fifo").c_str(), 0600), 0);
    for (const std::string& name : {file("fifo"), path(), std::string("/dev/zero")}) {
        EXPECT_THAT([&] { protocol::readPemFile(name); },
                    failsWith<CredentialsUnusable>(name + " is not a regular file"));
        EXPECT_THAT([&] { protocol::readKeyFile(name, KeyPermissions::OwnerOnly); },
                    failsWith<CredentialsUnusable>(name + " is not a regular file"));
    }
}

TEST_F(CredentialFilesTest, AtMostAMebibyteIsRead)
{
    const std::string most(1024 * 1024, 'x');
    EXPECT_EQ(protocol::readPemFile(write("most", most)), most);
    const std::string over = write("over", most + "x");
    EXPECT_THAT([&] { protocol::readPemFile(over); }, failsWith<CredentialsUnusable>(over + " is larger than 1 MiB"));
}

TEST_F(CredentialFilesTest, AFileThatIsMissingIsNamed)
{
    EXPECT_THAT(
        [&] { protocol::readPemFile(file("missing")); },
        ThrowsMessage<FileIOError>(StrEq("cannot open " + file("missing") + ": 2 (No such file or directory)")));
}

TEST_F(CredentialFilesTest, AKeyOfAnotherUserIsRefused)
{
    if (::geteuid() != 0) GTEST_SKIP() << "only root can give a file to another user";
    const std::string key = write("k", "key");
    ASSERT_EQ(::chown(key.c_str(), 12345, static_cast<gid_t>(-1)), 0);
    EXPECT_THAT([&] { protocol::readKeyFile(key, KeyPermissions::OwnerOnly); },
                failsWith<CredentialsUnusable>("the private key " + key +
                                               " belongs to another user (uid 12345): make it a file of this user"));
    EXPECT_EQ(protocol::readKeyFile(key, KeyPermissions::Any), "key");
}

TEST(Wipe, LeavesNothingOfTheSecret)
{
    std::string secret = "a secret that is longer than any short string";
    const char* const place = secret.data();
    const std::size_t length = secret.size();
    protocol::wipe(secret);
    EXPECT_EQ(secret, "");
    EXPECT_EQ(std::string(place, length), std::string(length, '\0')) << "the block is still the string's own";
}

} // namespace

} // namespace qel::test
