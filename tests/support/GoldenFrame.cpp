#include "support/GoldenFrame.hpp"

#include <fstream>
#include <istream>
#include <limits>
#include <set>
#include <sstream>
#include <stdexcept>
#include <utility>

namespace qel::test {

namespace {

constexpr std::size_t kBytesColumn = 6;    // "0000  "
constexpr std::size_t kCommentColumn = 31; // "# field"
constexpr std::size_t kMaxBytesInARow = 8;
constexpr std::size_t kOldHeaderLength = 24;
constexpr std::size_t kNewHeaderLength = 32;

bool startsWith(const std::string& text, const std::string& start) { return text.compare(0, start.size(), start) == 0; }

/// @return the value of an upper-case hexadecimal digit, or -1
int digitValue(char c)
{
    static const std::string kDigits = "0123456789ABCDEF";
    const std::size_t at = kDigits.find(c);
    return at == std::string::npos ? -1 : static_cast<int>(at);
}

/// Parses "DE CA FF". @return false for any other text and for an empty one
bool readBytes(const std::string& text, std::string& bytes)
{
    if (text.size() % 3 != 2) return false;
    for (std::size_t i = 0; i < text.size(); i += 3) {
        const int high = digitValue(text[i]);
        const int low = digitValue(text[i + 1]);
        if (high < 0 || low < 0) return false;
        if (i + 2 < text.size() && text[i + 2] != ' ') return false;
        bytes.push_back(static_cast<char>(high * 16 + low));
    }
    return true;
}

/// Parses "123" or "0x7B". @return false for any other text and for a number that does not fit
bool readNumber(const std::string& text, std::uint64_t& number)
{
    const bool isHex = startsWith(text, "0x");
    const std::uint64_t base = isHex ? 16 : 10;
    const std::string digits = text.substr(isHex ? 2 : 0);
    if (digits.empty()) return false;
    number = 0;
    for (const char c : digits) {
        const int value = digitValue(c);
        if (value < 0 || static_cast<std::uint64_t>(value) >= base) return false;
        const auto digit = static_cast<std::uint64_t>(value);
        if (number > (std::numeric_limits<std::uint64_t>::max() - digit) / base) return false;
        number = number * base + digit;
    }
    return true;
}

/// Parses "a text\x00" with its quotes. @return false for any other text
bool readText(const std::string& text, std::string& bytes)
{
    if (text.size() < 2 || text.front() != '"' || text.back() != '"') return false;
    const std::string inner = text.substr(1, text.size() - 2);
    for (std::size_t i = 0; i < inner.size(); ++i) {
        const char c = inner[i];
        if (c == '"' || c < ' ' || c > '~') return false;
        if (c != '\\') {
            bytes.push_back(c);
            continue;
        }
        if (i + 3 >= inner.size() || inner[i + 1] != 'x') return false;
        if (!readBytes(inner.substr(i + 2, 2), bytes)) return false;
        i += 3;
    }
    return true;
}

std::uint64_t bigEndian(const std::string& bytes)
{
    std::uint64_t number = 0;
    for (const char c : bytes) {
        number = number << 8 | static_cast<unsigned char>(c);
    }
    return number;
}

bool isZero(const std::string& bytes) { return bytes.find_first_not_of('\0') == std::string::npos; }

bool isReserved(const std::string& field)
{
    const std::string name = field.substr(field.find('.') + 1);
    return startsWith(name, "mReserved") || name == "mRsvd";
}

} // namespace

/// Parses one file line by line and checks the whole at the end.
class GoldenFrame::Parser {
public:
    Parser(GoldenFrame& frame, std::istream& in) : mFrame(frame), mIn(in) {}

    void run()
    {
        bool inFrame = false;
        for (std::string line; std::getline(mIn, line);) {
            ++mLine;
            if (inFrame) {
                pReadRow(line);
            } else if (line == "frame:") {
                inFrame = true;
            } else {
                pReadValue(line);
            }
        }
        if (!inFrame) pFailFile("no line \"frame:\"");
        pCheckIdentity();
        pCheckLengths();
        pCheckFields();
    }

private:
    [[noreturn]] void pFailLine(const std::string& what) const
    {
        throw std::runtime_error(mFrame.mFileName + ".txt:" + std::to_string(mLine) + ": " + what);
    }

    [[noreturn]] void pFailFile(const std::string& what) const
    {
        throw std::runtime_error(mFrame.mFileName + ".txt: " + what);
    }

    void pReadValue(const std::string& line)
    {
        const std::size_t colon = line.find(": ");
        if (colon == std::string::npos || colon == 0 || colon + 2 == line.size()) pFailLine("not \"key: value\"");
        const std::string key = line.substr(0, colon);
        const std::string value = line.substr(colon + 2);
        if (startsWith(key, "header.") || startsWith(key, "payload.")) {
            pReadField(key, value);
            return;
        }
        if (!mPlain.emplace(key, value).second) pFailLine("key \"" + key + "\" occurs twice");
        pReadPlain(key, value);
    }

    void pReadPlain(const std::string& key, const std::string& value)
    {
        if (key == "name") {
            mFrame.mName = value;
        } else if (key == "class") {
            mFrame.mClassName = value;
        } else if (key == "function") {
            mFrame.mFunction = pReadCode(value);
        } else if (key == "operation") {
            mFrame.mOperation = pReadCode(value);
        } else if (key == "classification") {
            mFrame.mClassification = pReadClassification(value);
        } else if (key == "built") {
            if (value != "no") pFailLine("\"built\" is \"no\" or absent");
            mFrame.mBuilt = false;
        } else if (key == "capabilities") {
            pReadCapabilities(value);
        } else {
            pFailLine("unknown key \"" + key + "\"");
        }
    }

    unsigned short pReadCode(const std::string& value) const
    {
        std::uint64_t number = 0;
        if (!readNumber(value, number) || number > 0xFFFF) pFailLine("not a 16-bit number");
        return static_cast<unsigned short>(number);
    }

    QelMessageClassification::Value pReadClassification(const std::string& value) const
    {
        if (value == "Request") return QelMessageClassification::Request;
        if (value == "Response") return QelMessageClassification::Response;
        if (value == "Async") return QelMessageClassification::Async;
        pFailLine("classification is not Request, Response or Async");
    }

    void pReadCapabilities(const std::string& value)
    {
        std::istringstream in(value);
        for (std::string word; in >> word;) {
            std::uint64_t number = 0;
            if (!readNumber(word, number) || number > 31) pFailLine("not a capability number: \"" + word + "\"");
            mFrame.mCapabilities.push_back(static_cast<unsigned int>(number));
        }
    }

    void pReadField(const std::string& key, const std::string& text)
    {
        Value value{false, 0, {}};
        const bool isBytes = startsWith(text, "hex ");
        if (isBytes) {
            if (!readBytes(text.substr(4), value.bytes)) pFailLine("bytes are not \"hex 00 FF\"");
        } else if (text.front() == '"') {
            if (!readText(text, value.bytes)) pFailLine("not a text in quotes");
        } else {
            value.isNumber = true;
            if (!readNumber(text, value.number)) pFailLine("not a number, a text or bytes");
        }

        const auto added = mFrame.mValues.emplace(key, value);
        if (added.second) {
            if (isBytes) mByteValues.insert(key);
            return;
        }
        if (!isBytes || mByteValues.count(key) == 0) pFailLine("key \"" + key + "\" occurs twice");
        added.first->second.bytes += value.bytes;
    }

    void pReadRow(const std::string& line)
    {
        if (line.size() < kCommentColumn + 3 || line.compare(4, 2, "  ") != 0 ||
            line.compare(kCommentColumn, 2, "# ") != 0) {
            pFailLine("not \"0000  DE CA FF                 # field\"");
        }
        std::uint64_t offset = 0;
        if (!readNumber("0x" + line.substr(0, 4), offset)) pFailLine("the offset is not four hexadecimal digits");
        if (offset != mFrame.mBytes.size()) {
            pFailLine("the row does not continue at offset " + std::to_string(mFrame.mBytes.size()));
        }
        std::string cells = line.substr(kBytesColumn, kCommentColumn - kBytesColumn);
        cells.erase(cells.find_last_not_of(' ') + 1);
        std::string bytes;
        if (!readBytes(cells, bytes) || bytes.size() > kMaxBytesInARow) pFailLine("not one to eight bytes");

        const std::string comment = line.substr(kCommentColumn + 2);
        pAddRow(comment.substr(0, comment.find(':')), bytes);
        mFrame.mFrameText += line + "\n";
    }

    /// Adds a row to its field. The part of the frame that it is in is known only after the header.
    void pAddRow(const std::string& field, const std::string& bytes)
    {
        const std::size_t offset = mFrame.mBytes.size();
        mFrame.mBytes += bytes;
        const std::string key = pPartAt(offset) + field;
        if (offset != 0 && mFrame.mPlaces.back().field == key) {
            mFrame.mPlaces.back().length += bytes.size();
            return;
        }
        mFrame.mPlaces.push_back({key, offset, bytes.size()});
    }

    std::size_t pHeaderLength() const { return mFrame.mBytes[3] == 0 ? kOldHeaderLength : kNewHeaderLength; }

    std::uint64_t pFromFrame(std::size_t offset, std::size_t length) const
    {
        return bigEndian(mFrame.mBytes.substr(offset, length));
    }

    /// @return "header.", "payload.", or "" for the pad. The rows of the first 24 bytes are always header.
    std::string pPartAt(std::size_t offset) const
    {
        if (offset < kOldHeaderLength || offset < pHeaderLength()) return "header.";
        if (offset < pHeaderLength() + pFromFrame(16, 4)) return "payload.";
        return "";
    }

    void pCheckIdentity() const
    {
        for (const char* key : {"name", "class", "function", "operation", "classification"}) {
            if (mPlain.count(key) == 0) pFailFile(std::string("no key \"") + key + "\"");
        }
        if (mFrame.mFileName.substr(0, mFrame.mFileName.find('-')) != mFrame.mClassName) {
            pFailFile("the file is not named after its class");
        }
    }

    void pCheckLengths() const
    {
        const std::size_t length = mFrame.mBytes.size();
        if (length < kOldHeaderLength || length < pHeaderLength()) pFailFile("the frame is shorter than its header");
        if (length != pFromFrame(4, 4)) pFailFile("the frame is not mMsgLength bytes long");
        if (length != pHeaderLength() + pFromFrame(16, 4) + pFromFrame(15, 1)) {
            pFailFile("header, payload and pad are not mMsgLength bytes long");
        }
        for (const Place& place : mFrame.mPlaces) {
            if (pPartAt(place.offset) != pPartAt(place.offset + place.length - 1)) {
                pFailFile("a row crosses the end of the part it is in: " + place.field);
            }
        }
    }

    void pCheckFields() const
    {
        std::set<std::string> seen;
        for (const Place& place : mFrame.mPlaces) {
            if (!seen.insert(place.field).second) pFailFile("the rows of a field are not together: " + place.field);
        }
        for (const Place& place : mFrame.mPlaces) {
            const std::string bytes = mFrame.mBytes.substr(place.offset, place.length);
            if (!pIsAsDescribed(place.field, bytes)) pFailFile("the rows hold something else: " + place.field);
        }
        for (const auto& value : mFrame.mValues) {
            const bool isEmpty = !value.second.isNumber && value.second.bytes.empty();
            if (seen.count(value.first) == 0 && !isEmpty) pFailFile("a value without rows: " + value.first);
        }
    }

    bool pIsAsDescribed(const std::string& field, const std::string& bytes) const
    {
        const auto value = mFrame.mValues.find(field);
        if (value != mFrame.mValues.end()) return pHolds(bytes, value->second) && pFlagsAgree(field, bytes);
        if (field == "header.mDesc") return bytes == "\xDE\xCA\xFF";
        if (field == "header.mFunction") return bytes.size() == 2 && bigEndian(bytes) == mFrame.mFunction;
        if (field == "header.mOperation") return bytes.size() == 2 && bigEndian(bytes) == mFrame.mOperation;
        return (isReserved(field) || field == "pad") && isZero(bytes);
    }

    static bool pHolds(const std::string& bytes, const Value& value)
    {
        if (value.isNumber) return bytes.size() <= 8 && bigEndian(bytes) == value.number;
        return startsWith(bytes, value.bytes) && isZero(bytes.substr(value.bytes.size()));
    }

    bool pFlagsAgree(const std::string& field, const std::string& bytes) const
    {
        if (field != "header.mFlags") return true;
        const std::uint64_t expected = mFrame.mClassification == QelMessageClassification::Request    ? 0x80
                                       : mFrame.mClassification == QelMessageClassification::Response ? 0x40
                                                                                                      : 0x00;
        return bigEndian(bytes) == expected;
    }

    GoldenFrame& mFrame;
    std::istream& mIn;
    std::size_t mLine = 0;
    std::map<std::string, std::string> mPlain;
    std::set<std::string> mByteValues; // the keys whose values may continue
};

const std::vector<std::string>& GoldenFrame::allNames()
{
    static const std::vector<std::string> kNames = {
        "QelMessageAbortHandshakeAsync",
        "QelMessageDaxBroadcastOutboundAsync",
        "QelMessageDaxBroadcastReq",
        "QelMessageDaxBroadcastRsp",
        "QelMessageExchIntCapabilitiesReq",
        "QelMessageExchIntCapabilitiesRsp",
        "QelMessageGetEnclTypeAndInterfaceVersionReq",
        "QelMessageGetEnclTypeAndInterfaceVersionRsp",
        "QelMessageGetGlobalModeAttributeReq",
        "QelMessageGetGlobalModeAttributeRsp",
        "QelMessageGetGlobalSaveAreaMetadataReq",
        "QelMessageGetGlobalSaveAreaMetadataRsp",
        "QelMessageGetInterfaceLimitsReq",
        "QelMessageGetInterfaceLimitsRsp",
        "QelMessageGetQelTodReq",
        "QelMessageGetQelTodRsp",
        "QelMessageInterfaceCmpCloseKrogSessionReq",
        "QelMessageInterfaceCmpCloseKrogSessionRsp",
        "QelMessageInterfaceCmpOpenKrogSessionReq",
        "QelMessageInterfaceCmpOpenKrogSessionRsp",
        "QelMessageKrogConnectionClosedAsync",
        "QelMessageSetGlobalModeAttributeReq",
        "QelMessageSetGlobalSaveAreaMetadataReq",
        "QelMessageSetGlobalSaveAreaMetadataRsp",
        "QelMessageUpgradeConnectionAsync",
        "QelMessageVirtualSerialCloseReq",
        "QelMessageVirtualSerialCloseRsp",
        "QelMessageVirtualSerialDataToDaxAsync",
        "QelMessageVirtualSerialDataToOsAsync",
        "QelMessageVirtualSerialGetMaxSessionsReq",
        "QelMessageVirtualSerialGetMaxSessionsRsp",
        "QelMessageVirtualSerialOpenReq",
        "QelMessageVirtualSerialOpenRsp",
        "QelMessageVirtualSerialSessionClosedAsync",
        "QelMessageVirtualSerialSetupSessionReq",
        "QelMessageVirtualSerialSetupSessionRsp",
        "QelMessageDaxBroadcastOutboundAsync-grown",
        "QelMessageDaxBroadcastReq-grown",
        "QelMessageGetEnclTypeAndInterfaceVersionReq-short",
        "QelMessageInterfaceCmpOpenKrogSessionReq-old-header",
        "QelMessageInterfaceCmpOpenKrogSessionRsp-status",
        "QelMessageVirtualSerialDataToOsAsync-old-header",
        "QelMessageVirtualSerialGetMaxSessionsRsp-old-header",
        "QelMessageVirtualSerialOpenReq-old-header",
        "QelMessageVirtualSerialOpenRsp-status",
        "QelMessageVirtualSerialSessionClosedAsync-padded",
    };
    return kNames;
}

GoldenFrame GoldenFrame::load(const std::string& name)
{
    std::ifstream in(std::string(QEL_SOURCE_DIR "/vectors/") + name + ".txt", std::ios::binary);
    if (!in) throw std::runtime_error(name + ".txt: cannot be read");
    return parse(name, in);
}

GoldenFrame GoldenFrame::parse(const std::string& name, std::istream& in)
{
    GoldenFrame frame;
    frame.mFileName = name;
    Parser(frame, in).run();
    return frame;
}

const std::string& GoldenFrame::text(const std::string& key) const
{
    const Value& value = pValue(key);
    if (value.isNumber) throw std::runtime_error(mFileName + ".txt: not a text: " + key);
    return value.bytes;
}

std::vector<std::string> GoldenFrame::payloadKeys() const
{
    std::vector<std::string> keys;
    for (const auto& value : mValues) {
        if (startsWith(value.first, "payload.")) keys.push_back(value.first);
    }
    return keys;
}

std::uint64_t GoldenFrame::pNumber(const std::string& key, std::uint64_t largest) const
{
    const Value& value = pValue(key);
    if (!value.isNumber) throw std::runtime_error(mFileName + ".txt: not a number: " + key);
    if (value.number > largest) throw std::runtime_error(mFileName + ".txt: number too large: " + key);
    return value.number;
}

const GoldenFrame::Value& GoldenFrame::pValue(const std::string& key) const
{
    const auto value = mValues.find(key);
    if (value == mValues.end()) throw std::runtime_error(mFileName + ".txt: no value: " + key);
    return value->second;
}

} // namespace qel::test
