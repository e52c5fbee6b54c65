#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/UniqueFd.hpp>
#include <qel/protocol/CredentialFiles.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/PemContent.hpp>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <utility>

namespace qel::protocol {

namespace {

constexpr std::size_t kMaxBytes = 1024 * 1024; // a certificate or a key has a few thousand
constexpr mode_t kOthersReadOrWrite = S_IRGRP | S_IWGRP | S_IROTH | S_IWOTH;

std::string octal(mode_t mode)
{
    std::array<char, 16> text{};
    std::snprintf(text.data(), text.size(), "%04o", static_cast<unsigned int>(mode & 07777U));
    return text.data();
}

/// Opens a regular file; anything else could wait for ever or never end.
UniqueFd openFile(const std::string& path, struct stat& status)
{
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
    if (fd.get() < 0 || ::fstat(fd.get(), &status) != 0) {
        const int error = errno;
        throw FileIOError(error, "cannot open " + path);
    }
    if (!S_ISREG(status.st_mode)) throw CredentialsUnusable(path + " is not a regular file");
    return fd;
}

/// Reads a file of known size without leaving copies of its content in memory.
class SecretReader {
public:
    explicit SecretReader(std::size_t bytes) { mContent.reserve(bytes); }
    ~SecretReader() { wipe(mContent); }
    SecretReader(const SecretReader&) = delete;
    SecretReader& operator=(const SecretReader&) = delete;

    /// @return false at the end of the file
    bool readSome(int fd, const std::string& path)
    {
        const std::size_t before = mContent.size();
        if (before > kMaxBytes) throw CredentialsUnusable(path + " is larger than 1 MiB");
        if (mContent.capacity() == before) pGrow();
        mContent.resize(mContent.capacity());
        const ssize_t count = ::read(fd, mContent.data() + before, mContent.size() - before);
        const int error = errno;
        mContent.resize(before + static_cast<std::size_t>(count > 0 ? count : 0));
        if (count < 0 && error != EINTR) throw FileIOError(error, "cannot read " + path);
        return count != 0;
    }

    std::string take() { return std::move(mContent); }

private:
    /// std::string would leave the old block behind as it is.
    void pGrow()
    {
        std::string larger;
        larger.reserve(2 * mContent.size() + 1024);
        larger = mContent;
        wipe(mContent);
        mContent = std::move(larger);
    }

    std::string mContent;
};

std::string readAll(const UniqueFd& fd, const std::string& path, const struct stat& status)
{
    SecretReader reader(static_cast<std::size_t>(std::min<off_t>(status.st_size, kMaxBytes)) + 1);
    while (reader.readSome(fd.get(), path))
        continue;
    return reader.take();
}

/// @throws CredentialsUnusable  the file's owner or permissions let others at the key
void requirePrivate(const std::string& path, const struct stat& status)
{
    constexpr uid_t kRoot = 0;
    using Reason = CredentialsUnusable::Reason;
    if (status.st_uid != ::geteuid() && status.st_uid != kRoot) {
        throw CredentialsUnusable("the private key " + path + " belongs to another user (uid " +
                                      std::to_string(status.st_uid) + "): make it a file of this user",
                                  Reason::Permissions);
    }
    if ((status.st_mode & kOthersReadOrWrite) == 0) return;
    throw CredentialsUnusable("others may read or write the private key " + path + " (mode " + octal(status.st_mode) +
                                  "): use chmod 600",
                              Reason::Permissions);
}

} // namespace

std::string certificateFile(const std::string& name) { return name + ".crt"; }

std::string keyFile(const std::string& name) { return name + ".key"; }

std::string requestFile(const std::string& name) { return name + ".csr"; }

std::string pathIn(const std::string& directory, const std::string& file)
{
    const bool needsSeparator = !directory.empty() && directory.back() != '/';
    return directory + (needsSeparator ? "/" : "") + file;
}

std::string readPemFile(const std::string& path)
{
    struct stat status;
    const UniqueFd fd = openFile(path, status);
    return readAll(fd, path, status);
}

std::string readKeyFile(const std::string& path, KeyPermissions permissions)
{
    struct stat status;
    const UniqueFd fd = openFile(path, status);
    std::string content = readAll(fd, path, status);
    // A certificate given as a key is nothing to hide; it is refused by its kind when it is parsed.
    if (permissions == KeyPermissions::Any || holdsNoKey(content)) return content;
    try {
        requirePrivate(path, status);
    } catch (...) {
        wipe(content);
        throw;
    }
    return content;
}

void wipe(std::string& secret) noexcept
{
    ::explicit_bzero(secret.data(), secret.capacity());
    secret.clear();
}

CredentialPaths credentialPaths(const std::string& directory, const std::string& name)
{
    return {pathIn(directory, certificateFile(name)), pathIn(directory, keyFile(name)),
            pathIn(directory, certificateFile(kRootName))};
}

} // namespace qel::protocol
