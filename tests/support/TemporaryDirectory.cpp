#include "support/TemporaryDirectory.hpp"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <ftw.h>
#include <memory>
#include <sys/stat.h>
#include <system_error>
#include <unistd.h>

namespace qel::test {

namespace {

constexpr int kOpenDirectories = 16; // the maximum that nftw holds open

int makeAccessible(const char* path, const struct stat*, int type, struct FTW*)
{
    if (type == FTW_D || type == FTW_DNR) ::chmod(path, S_IRWXU);
    return 0;
}

int removeEntry(const char* path, const struct stat*, int, struct FTW*)
{
    ::remove(path);
    return 0;
}

std::string resolved(const std::string& path)
{
    const std::unique_ptr<char, decltype(&std::free)> real(::realpath(path.c_str(), nullptr), &std::free);
    return real ? std::string(real.get()) : path;
}

} // namespace

TemporaryDirectory::TemporaryDirectory()
{
    const char* parent = std::getenv("TMPDIR");
    mPath = (parent != nullptr && *parent != '\0') ? parent : "/tmp";
    mPath += "/qel-test-XXXXXX";
    if (::mkdtemp(&mPath[0]) == nullptr) {
        const int error = errno;
        throw std::system_error(error, std::generic_category(), "mkdtemp " + mPath);
    }
    mPath = resolved(mPath);
}

TemporaryDirectory::~TemporaryDirectory()
{
    ::chmod(mPath.c_str(), S_IRWXU);
    ::nftw(mPath.c_str(), makeAccessible, kOpenDirectories, FTW_PHYS);
    ::nftw(mPath.c_str(), removeEntry, kOpenDirectories, FTW_DEPTH | FTW_PHYS);
}

std::string TemporaryDirectory::path() const { return mPath; }

std::string TemporaryDirectory::file(const std::string& name) const { return mPath + "/" + name; }

} // namespace qel::test
