#pragma once

#include <qel/common/QelCapabilities.hpp>
#include <qel/common/QelMessage.hpp>

#include "support/Bytes.hpp"
#include "support/GoldenFrame.hpp"

#include <gtest/gtest.h>
#include <memory>
#include <set>
#include <string>
#include <tuple>
#include <typeinfo>
#include <vector>

/// @file
/// How each message class is compared with its golden frames: the payload values that it returns, and the message that
/// its builder makes from the golden values.

namespace qel::test {

/// Compares the values that a message returns with those of its golden frame, and fails for each value of the frame
/// that was not compared.
class PayloadCheck {
public:
    explicit PayloadCheck(const GoldenFrame& golden) : mGolden(golden)
    {
        const std::vector<std::string> keys = golden.payloadKeys();
        mUnread.insert(keys.begin(), keys.end());
    }
    PayloadCheck(const PayloadCheck&) = delete;
    PayloadCheck& operator=(const PayloadCheck&) = delete;
    ~PayloadCheck()
    {
        for (const std::string& key : mUnread) {
            ADD_FAILURE() << "no accessor was compared with " << key;
        }
    }

    template <typename T>
    void number(const char* field, T actual)
    {
        EXPECT_EQ(actual, mGolden.number<T>(pRead(field))) << field;
    }

    void text(const char* field, const std::string& actual)
    {
        EXPECT_EQ(hex(actual), hex(mGolden.text(pRead(field)))) << field;
    }

    void bytes(const char* field, const char* actual, std::size_t length) { text(field, std::string(actual, length)); }

    void address(std::uint16_t lpId, std::uint16_t connection)
    {
        number("mLparId", lpId);
        number("mVssConnectionNumber", connection);
    }

private:
    std::string pRead(const char* field)
    {
        const std::string key = std::string("payload.") + field;
        mUnread.erase(key);
        return key;
    }

    const GoldenFrame& mGolden;
    std::set<std::string> mUnread;
};

/// The registry that parses the class.
enum class Home { Public, Internal, None };

struct MessageClass {
    std::string name;
    std::tuple<unsigned short, unsigned short, QelMessageClassification::Value> identity;
    Home home;
    const std::type_info* parsedAs;
    void (*check)(const QelMessage&, PayloadCheck&);
    std::unique_ptr<QelMessage> (*build)(const GoldenFrame&);
    QelCapabilities (*capabilities)(const QelMessage&); // null for other classes
};

/// The 36 message classes of the library.
const std::vector<MessageClass>& messageClasses();

/// @throws std::runtime_error the frame names a class that is not among them
const MessageClass& classOf(const GoldenFrame& golden);

unsigned int callerId(const GoldenFrame& golden);

/// The capability bits that a golden frame lists.
QelCapabilities capabilities(const GoldenFrame& golden);

/// The value of a field, for the arguments of a builder.
template <typename T>
T number(const GoldenFrame& golden, const char* field)
{
    return golden.number<T>(std::string("payload.") + field);
}

/// The bytes of a text field, likewise.
const std::string& text(const GoldenFrame& golden, const char* field);

} // namespace qel::test
