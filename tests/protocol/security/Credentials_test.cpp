#include <qel/common/Utilities.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/Credentials.hpp>
#include <qel/protocol/MemoryStream.hpp>

#include "support/Authority.hpp"
#include "support/CredentialDirectory.hpp"
#include "support/Errors.hpp"

#include <gmock/gmock.h>
#include <sys/stat.h>
#include <thread>

namespace qel::test {

namespace {

using protocol::Credentials;
using protocol::CredentialsUnusable;
using protocol::KeyPermissions;
using testing::HasSubstr;
using testing::StrEq;
using Reason = CredentialsUnusable::Reason;

/// Whether two ends with these credentials accept each other.
bool shakeHands(const Credentials& console, const Credentials& hypervisor)
{
    auto streams = protocol::makeMemoryStreams();
    SSLStream client(*console.makeClientContext(), std::move(streams.first));
    SSLStream server(*hypervisor.makeServerContext(), std::move(streams.second));
    std::thread other([&server] { server.handshake(); });
    client.handshake();
    other.join();
    return client.getStatus() == SSLStream::STATUS_ENCRYPTED && server.getStatus() == SSLStream::STATUS_ENCRYPTED;
}

Reason reasonOf(const std::function<void()>& load)
{
    try {
        load();
    } catch (const CredentialsUnusable& error) {
        return error.getReason();
    }
    throw std::logic_error("they can be used");
}

class CredentialsTest : public testing::Test {
protected:
    Credentials load(const std::string& name) const { return Credentials::fromDirectory(directory.path(), name); }

    CredentialDirectory directory;
};

TEST_F(CredentialsTest, OfADirectoryServeBothEnds) { EXPECT_TRUE(shakeHands(load("client"), load("server"))); }

TEST_F(CredentialsTest, OfFilesAndOfTextsAreTheSame)
{
    const Credentials files = Credentials::fromFiles(
        {directory.file("client.crt"), directory.file("client.key"), directory.file("root.crt")});
    const Credentials texts = Credentials::fromTexts(Authority::trusted().serverCredentials());
    EXPECT_TRUE(shakeHands(files, texts));
}

TEST_F(CredentialsTest, CopiesAndMovedObjectsWork)
{
    Credentials original = load("client");
    Credentials copy = original;
    const Credentials moved = std::move(original);
    original = copy;
    copy = load("server");
    EXPECT_TRUE(shakeHands(moved, copy));
    EXPECT_TRUE(shakeHands(original, copy));
}

TEST_F(CredentialsTest, AMissingFileIsNamed)
{
    EXPECT_THAT([this] { load("nobody"); },
                testing::ThrowsMessage<FileIOError>(HasSubstr(directory.file("nobody.crt"))));
}

TEST_F(CredentialsTest, AKeyThatOthersMayReadIsRefusedUnlessAllowed)
{
    ASSERT_EQ(::chmod(directory.file("client.key").c_str(), 0644), 0);
    EXPECT_EQ(reasonOf([this] { load("client"); }), Reason::Permissions);
    EXPECT_NO_THROW(Credentials::fromDirectory(directory.path(), "client", KeyPermissions::Any));
}

TEST_F(CredentialsTest, AFileOfTheWrongKindIsNamed)
{
    Utilities::writeFile(directory.file("client.crt"), Utilities::readFile(directory.file("client.key")));
    EXPECT_THAT([this] { load("client"); },
                failsWith<CredentialsUnusable>(
                    StrEq(directory.file("client.crt") + " holds a private key, not a certificate")));
    EXPECT_EQ(reasonOf([this] { load("client"); }), Reason::Content);
}

TEST_F(CredentialsTest, ACertificateAndTheKeyOfAnotherAreRefused)
{
    SSLCredentials mixed = Authority::trusted().serverCredentials();
    mixed.mKey = Authority::trusted().clientCredentials().mKey;
    EXPECT_THAT([&] { Credentials::fromTexts(mixed); },
                failsWith<CredentialsUnusable>("the certificate and the key cannot be used: they do not belong "
                                               "together, or are too weak"));
}

TEST_F(CredentialsTest, AnExpiredCertificateIsRefused)
{
    const SSLCredentials expired = expiredCredentials(Authority::trusted().clientRequest());
    EXPECT_EQ(reasonOf([&] { Credentials::fromTexts(expired); }), Reason::Validity);
}

} // namespace

} // namespace qel::test
