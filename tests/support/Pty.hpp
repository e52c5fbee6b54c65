#pragma once

#include <cstddef>
#include <string>
#include <termios.h>

namespace qel::test {

/// A pseudo-terminal: what a program sees as its terminal (the slave), and the side from which a test types and looks
/// at the screen (the master). Both stay open, so that the terminal outlives the programs on it.
class Pty {
public:
    /// @throws std::runtime_error  there is none to be had
    Pty();
    ~Pty();
    Pty(const Pty&) = delete;
    Pty& operator=(const Pty&) = delete;

    int master() const { return mMaster; }
    int slave() const { return mSlave; }
    /// The path of the slave.
    const std::string& name() const { return mName; }

    /// Of the slave.
    termios attributes() const;
    void setAttributes(const termios& attributes) const;

    /// Types, as a person would.
    void type(const std::string& text) const;

    /// Reads from the screen: exactly so many bytes, which must come within 20 s.
    std::string read(std::size_t length) const;

    /// The terminal is gone for the programs on it.
    void hangUp();

    /// Gives up this process's hold on the slave: reading the master fails once no program holds it and everything has
    /// been read.
    void closeSlave();

private:
    int mMaster = -1;
    int mSlave = -1;
    std::string mName;
};

/// True when a program gets every key as it is typed.
bool isRaw(const termios& attributes);

/// All that can be set.
bool operator==(const termios& left, const termios& right);

} // namespace qel::test
