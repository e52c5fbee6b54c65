#pragma once

#include <string>

namespace qel::test {

/// A fresh, empty directory for one test, removed with all that is in it at the end of the test, also when the test
/// took write permission away from it. Symbolic links in it are removed, never followed.
class TemporaryDirectory {
public:
    /// @throws std::system_error when no directory can be made
    TemporaryDirectory();
    ~TemporaryDirectory();
    TemporaryDirectory(const TemporaryDirectory&) = delete;
    TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;

    /// @return the absolute path of the directory, links resolved, without a separator at the end
    std::string path() const;

    /// @return the absolute path of a file of that name in the directory; the file is not made
    std::string file(const std::string& name) const;

private:
    std::string mPath;
};

} // namespace qel::test
