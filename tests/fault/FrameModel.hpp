#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageRegistry.hpp>

#include <cstddef>
#include <cstdint>
#include <map>
#include <string>
#include <tuple>
#include <vector>

/// @file
/// A model of the wire format for the tests of broken frames. It decides from the bytes alone, without the parsers of
/// the library, what a registry must return for them.

namespace qel::test {

/// @return `length` bytes from `offset` as a big-endian integer
/// @throws std::out_of_range they are not there
std::uint64_t numberAt(const std::string& bytes, std::size_t offset, std::size_t length);

/// Writes an integer over `length` bytes, big-endian.
/// @throws std::out_of_range they are not there
void setNumberAt(std::string& bytes, std::size_t offset, std::size_t length, std::uint64_t number);

/// @return "0x" and at least `digits` upper-case hexadecimal digits
std::string hexNumber(std::uint64_t number, int digits);

/// @return 24 or 32, by the version byte
std::size_t headerLength(const std::string& bytes);

/// The values that the accessors of a message return, in the order in which model and message list them.
class Reading {
public:
    Reading& number(std::uint64_t value)
    {
        mText += std::to_string(value) + ' ';
        return *this;
    }
    Reading& bytes(const std::string& value);
    Reading& text(const std::string& value)
    {
        mText += value + ' ';
        return *this;
    }
    const std::string& str() const { return mText; }

private:
    std::string mText;
};

/// How a class treats its payload.
struct PayloadRules {
    std::string (*judge)(const std::string& payload); ///< the phrase of the refusal; empty if the class accepts it
    Reading (*expected)(const std::string& payload);  ///< the values, from the bytes
    Reading (*actual)(const QelMessage& message);     ///< the values, from the accessors
};

/// @return the rules of a class; a class without an entry has no payload and accepts any
const PayloadRules& rulesOf(const std::string& className);

using Identity = std::tuple<std::uint64_t, std::uint64_t, std::uint64_t>; // function, operation, upper two flag bits

/// A registry, and the classes that it is expected to know.
struct Receiver {
    const QelMessageRegistry& registry;
    std::map<Identity, std::string> classes;
};

const Receiver& publicReceiver();
const Receiver& internalReceiver();

/// What the model says about some bytes.
struct Verdict {
    std::string thrown;             ///< the phrase of the exception; empty when a message results
    std::string className;          ///< of the message
    std::string payload;            ///< of the message
    std::vector<std::string> lines; ///< how each line in the log begins
};

Verdict judge(const Receiver& receiver, const std::string& bytes);

} // namespace qel::test
