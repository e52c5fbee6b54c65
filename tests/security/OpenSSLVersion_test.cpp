// Which OpenSSL these tests run with. A build against another version than the system's could still load the system's,
// and the other tests would then pass without testing that version.

#include <qel/common/security/SSLContext.hpp>

#include <cstddef>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <link.h>
#include <openssl/crypto.h>
#include <openssl/opensslv.h>
#include <string>
#include <vector>

using testing::Le;
using testing::SizeIs;
using testing::StartsWith;

namespace {

// "OpenSSL 3.0" of "OpenSSL 3.0.20 1 Jan 2030": compatible versions share these two numbers.
std::string release(const std::string& version) { return version.substr(0, version.find('.', version.find('.') + 1)); }

/// @param name  of a library, without a version: "libssl.so"
/// @return the files of that name which this process has loaded
std::vector<std::string> loadedLibraries(const std::string& name)
{
    struct Search {
        std::string name;
        std::vector<std::string> files;
    } search = {"/" + name, {}};
    ::dl_iterate_phdr(
        [](dl_phdr_info* info, std::size_t, void* data) {
            Search& wanted = *static_cast<Search*>(data);
            const std::string file = info->dlpi_name;
            if (file.find(wanted.name) != std::string::npos) wanted.files.push_back(file);
            return 0;
        },
        &search);
    return search.files;
}

TEST(OpenSSLVersion, TheLoadedReleaseIsThatOfTheHeaders)
{
    EXPECT_EQ(release(OpenSSL_version(OPENSSL_VERSION)), release(OPENSSL_VERSION_TEXT));
}

TEST(OpenSSLVersion, TheLoadedVersionIsTheRequestedOne)
{
    const std::string asked = std::string("OpenSSL ") + QEL_EXPECTED_OPENSSL; // nothing: any version will do
    EXPECT_THAT(std::string(OPENSSL_VERSION_TEXT), StartsWith(asked));
    EXPECT_THAT(std::string(OpenSSL_version(OPENSSL_VERSION)), StartsWith(asked));
}

// The library and its tests are linked separately, so each might load a different one.
TEST(OpenSSLVersion, IsLoadedOnce)
{
    const qel::SSLClientContext context; // the library is in use
    EXPECT_THAT(loadedLibraries("libssl.so"), SizeIs(Le(1U)));
    EXPECT_THAT(loadedLibraries("libcrypto.so"), SizeIs(Le(1U)));
}

} // namespace
