#pragma once

#include <string>

namespace qel::test {

/// A new, empty directory for one test. The destructor removes it and its content, even if the test removed the write
/// permission; it removes symbolic links and does not follow them.
class TemporaryDirectory {
public:
    /// @throws std::system_error  the directory cannot be created
    TemporaryDirectory();
    ~TemporaryDirectory();
    TemporaryDirectory(const TemporaryDirectory&) = delete;
    TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;

    /// @return the absolute path of the directory, with links resolved and without a separator at the end
    std::string path() const;

    /// @return the absolute path of a file of that name in the directory; does not create the file
    std::string file(const std::string& name) const;

private:
    std::string mPath;
};

} // namespace qel::test
