#pragma once

#include <qel/common/QelMessageIdentifiers.hpp>

#include <cstddef>
#include <cstdint>
#include <iosfwd>
#include <map>
#include <string>
#include <vector>

namespace qel::test {

/// A frame of vectors/: its description, the values of its fields, and its bytes. vectors/README.md describes the
/// files.
///
/// A file must be consistent: the rows follow each other without a gap, every field with a value has rows and holds
/// that value big-endian, and every other byte has its only valid value (eyecatcher, identity, zero for reserved
/// fields, pad and unused tails). These checks do not use the library. Keys are written as in the file:
/// "header.mCallerId", "payload.mToolId". Thread safety: immutable; any thread.
class GoldenFrame {
public:
    /// The names of all files of vectors/ without ".txt", plain cases first.
    static const std::vector<std::string>& allNames();

    /// Reads vectors/<name>.txt. @throws std::runtime_error as parse() does, or "<name>.txt: cannot be read"
    static GoldenFrame load(const std::string& name);

    /// @param name  the name of the file without ".txt"; begins the text of every failure
    /// @throws std::runtime_error "<name>.txt:<line>: what is wrong" or "<name>.txt: what is wrong"
    static GoldenFrame parse(const std::string& name, std::istream& in);

    /// The name of the file without ".txt".
    const std::string& fileName() const { return mFileName; }
    /// The description of the frame.
    const std::string& name() const { return mName; }
    const std::string& className() const { return mClassName; }
    unsigned short function() const { return mFunction; }
    unsigned short operation() const { return mOperation; }
    QelMessageClassification::Value classification() const { return mClassification; }

    /// False if the library accepts the frame but never builds it.
    bool isBuilt() const { return mBuilt; }

    /// The whole frame.
    const std::string& bytes() const { return mBytes; }

    /// The rows of the frame as in the file, each with its line end.
    const std::string& frameText() const { return mFrameText; }

    /// @throws std::runtime_error there is no such key, or its value is not a number or does not fit `T`
    template <typename T>
    T number(const std::string& key) const
    {
        return static_cast<T>(pNumber(key, std::uint64_t{static_cast<T>(-1)}));
    }

    /// The bytes of a text or byte value. @throws std::runtime_error there is no such key, or its value is a number
    const std::string& text(const std::string& key) const;

    bool has(const std::string& key) const { return mValues.count(key) != 0; }

    /// The keys of the payload's fields, in alphabetical order.
    std::vector<std::string> payloadKeys() const;

    /// The numbers of the capability bits that are set; empty without such a line.
    const std::vector<unsigned int>& capabilities() const { return mCapabilities; }

    /// The position of a field in the frame.
    struct Place {
        std::string field; ///< its key
        std::size_t offset;
        std::size_t length;
    };

    /// The fields of the frame in their order, reserved ones and the pad included.
    const std::vector<Place>& places() const { return mPlaces; }

private:
    struct Value {
        bool isNumber;
        std::uint64_t number;
        std::string bytes;
    };

    class Parser;

    GoldenFrame() = default;

    std::uint64_t pNumber(const std::string& key, std::uint64_t largest) const;
    const Value& pValue(const std::string& key) const;

    std::string mFileName;
    std::string mName;
    std::string mClassName;
    unsigned short mFunction = 0;
    unsigned short mOperation = 0;
    QelMessageClassification::Value mClassification = QelMessageClassification::Unknown;
    bool mBuilt = true;
    std::vector<unsigned int> mCapabilities;
    std::map<std::string, Value> mValues;
    std::string mBytes;
    std::string mFrameText;
    std::vector<Place> mPlaces;
};

} // namespace qel::test
