// The text of a private key does not stay in the memory of "qel serve".

#include <qel/common/Utilities.hpp>

#include "integration/TlsConsole.hpp"
#include "integration/TlsTest.hpp"

#include <csignal>
#include <cstdio>
#include <fcntl.h>
#include <fstream>
#include <gmock/gmock.h>
#include <sstream>
#include <sys/stat.h>
#include <unistd.h>

namespace qel::test {

namespace {

using ::testing::HasSubstr;

/// The lines of the text of a key that hold the key.
std::vector<std::string> secretLines(const std::string& pem)
{
    std::istringstream lines(pem);
    std::vector<std::string> secret;
    for (std::string line; std::getline(lines, line);) {
        constexpr std::size_t kWholeLine = 64;
        if (line.size() == kWholeLine) secret.push_back(line);
    }
    return secret;
}

/// A mapping of more bytes is the bookkeeping of a sanitizer, which reserves terabytes.
constexpr unsigned long kShadow = 1024UL * 1024 * 1024;

/// The writable memory of a process, one mapping at a time.
class MemoryOf {
public:
    explicit MemoryOf(pid_t process)
        : mMaps("/proc/" + std::to_string(process) + "/maps"),
          mMemory(::open(("/proc/" + std::to_string(process) + "/mem").c_str(), O_RDONLY | O_CLOEXEC))
    {}
    ~MemoryOf() { ::close(mMemory); }
    MemoryOf(const MemoryOf&) = delete;
    MemoryOf& operator=(const MemoryOf&) = delete;

    /// @return false: there is no further mapping
    bool next(std::string& bytes)
    {
        for (std::string line; std::getline(mMaps, line);) {
            unsigned long begin = 0;
            unsigned long end = 0;
            char writable = '-';
            if (std::sscanf(line.c_str(), "%lx-%lx r%c", &begin, &end, &writable) != 3 || writable != 'w') continue;
            if (end - begin > kShadow) continue;
            read(begin, end, bytes);
            return true;
        }
        return false;
    }

private:
    void read(unsigned long begin, unsigned long end, std::string& bytes) const
    {
        bytes.resize(end - begin);
        std::size_t have = 0;
        while (have < bytes.size()) {
            const ssize_t count = ::pread(mMemory, &bytes[have], bytes.size() - have, static_cast<off_t>(begin + have));
            if (count <= 0) break; // the mapping is gone
            have += static_cast<std::size_t>(count);
        }
        bytes.resize(have);
    }

    std::ifstream mMaps;
    const int mMemory;
};

/// @return which of the texts are in the memory of a process
std::vector<std::string> foundIn(pid_t process, const std::vector<std::string>& texts)
{
    std::vector<std::string> found;
    MemoryOf memory(process);
    for (std::string bytes; memory.next(bytes);) {
        for (const std::string& text : texts) {
            if (bytes.find(text) != std::string::npos) found.push_back(text);
        }
    }
    return found;
}

TEST_F(Tls, ThisTestFindsATextInTheMemoryOfTheServer)
{
    const auto server = serve({"--system-serial", "find me in here"});
    EXPECT_THAT(foundIn(server->process().pid(), {"find me in here"}), ::testing::Not(::testing::IsEmpty()));
    EXPECT_THAT(foundIn(server->process().pid(), {"not in there at all"}), ::testing::IsEmpty());
    server->stop();
}

TEST_F(Tls, TheTextOfTheKeyIsNotInMemory)
{
    const std::vector<std::string> first = secretLines(Utilities::readFile(directory.file("server.key")));
    ASSERT_GT(first.size(), 10U);
    const auto server = serve();
    EXPECT_EQ(call(*server).exitStatus, 0);
    EXPECT_THAT(foundIn(server->process().pid(), first), ::testing::IsEmpty());

    directory.put("server", Authority::trusted().clientCredentials());
    const std::vector<std::string> second = secretLines(Utilities::readFile(directory.file("server.key")));
    ASSERT_NE(first, second);
    server->process().signal(SIGHUP);
    server->process().awaitErrors("SIGHUP: loaded ");
    EXPECT_EQ(call(*server).exitStatus, 0);
    EXPECT_THAT(foundIn(server->process().pid(), first), ::testing::IsEmpty());
    EXPECT_THAT(foundIn(server->process().pid(), second), ::testing::IsEmpty());
    server->stop();
}

TEST_F(Tls, AfterARefusedKeyItsTextIsNotInMemory)
{
    const auto server = serve();
    directory.put("server", Authority::stranger().serverCredentials()); // not of the root
    const std::vector<std::string> refused = secretLines(Utilities::readFile(directory.file("server.key")));
    Utilities::writeFile(directory.file("server.crt"), Authority::trusted().server().getPEM());
    server->process().signal(SIGHUP);
    server->process().awaitErrors("SIGHUP: the credentials stay as they were: ");
    EXPECT_THAT(foundIn(server->process().pid(), refused), ::testing::IsEmpty());
    server->stop();
}

TEST_F(Tls, AKeyOfAnotherUserIsRefused)
{
    if (::geteuid() != 0) GTEST_SKIP() << "only root can give a file away";
    const auto server = serve();
    const std::string key = directory.file("server.key");
    ASSERT_EQ(::chown(key.c_str(), 4711, 0), 0);
    server->process().signal(SIGHUP);
    server->process().awaitErrors("SIGHUP: the credentials stay as they were: the private key " + key +
                                  " belongs to another user (uid 4711): make it a file of this user, or "
                                  "--insecure-permissions to allow it\n");
    EXPECT_EQ(call(*server).exitStatus, 0); // with the old ones
    server->stop();

    const auto refused = runQel(Arguments{"serve", "--listen", "127.0.0.1:0"} + directory.options("server"));
    EXPECT_EQ(refused.exitStatus, 1);
    EXPECT_THAT(refused.errors, HasSubstr("belongs to another user (uid 4711)"));
    const auto allowed = serve({"--insecure-permissions"});
    allowed->stop();
}

} // namespace

} // namespace qel::test
