#pragma once

#include <functional>
#include <stdexcept>
#include <string>
#include <vector>

/// @file
/// What a conformance test consists of. A case is one requirement, the place where it is documented, and a function
/// that tries it on the peer.

namespace qel::tool::check {

class Trial;

/// Whom a requirement binds.
enum class Level {
    Wire,  ///< any peer: the bytes of frames and of the steps to TLS
    Rule,  ///< the conversation as docs/connection.md defines it
    Robust ///< a peer that is used for real: it survives what others do wrong
};

/// "wire", "rule", "robust"
const char* levelName(Level level);

/// What a case needs besides a peer. Values can be combined. A case whose needs are not met is skipped.
enum Need : unsigned {
    kNothing = 0,
    kTls = 1,              ///< the connection is to be protected by TLS
    kPlain = 2,            ///< it is not
    kPartition = 4,        ///< a partition that may be opened
    kEchoPartition = 8,    ///< a partition whose line sends back what it gets
    kEndingPartition = 16, ///< a partition whose command ends when it gets a line
    kDeadline = 32,        ///< the peer's deadline is known, and short
    kShared = 64,          ///< state that all consoles share, such as the mode: no other case of this kind meanwhile
    kAlone = 128           ///< no other case at all meanwhile
};

/// One requirement and how to try it. Thread safety: that of a plain value.
struct Case {
    std::string id;          ///< stable: "frame/length/9-is-a-frame"
    std::string requirement; ///< one sentence
    std::string anchor;      ///< where it is documented: "wire-format.md#header"
    Level level = Level::Wire;
    unsigned needs = kNothing; ///< of Need
    /// Returns when the requirement holds. @throws Failure, Skip
    std::function<void(Trial&)> run;
};

using Cases = std::vector<Case>;

/// Thrown by a case: the requirement does not hold. what() is both parts in one line.
class Failure : public std::runtime_error {
public:
    /// @param expected  what the peer had to do at this step @param seen  what it did
    Failure(std::string expected, std::string seen);
    ~Failure() override;

    const std::string& getExpected() const noexcept { return mExpected; }
    const std::string& getSeen() const noexcept { return mSeen; }

private:
    std::string mExpected;
    std::string mSeen;
};

/// Thrown by a case that cannot be tried on this peer. what() is the reason.
class Skip : public std::runtime_error {
public:
    explicit Skip(const std::string& reason);
    ~Skip() override;
};

} // namespace qel::tool::check
