#include <qel/common/LogLevel.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/Utilities.hpp>

#include <istream>
#include <ostream>
#include <stdexcept>

namespace qel::LogLevel {

namespace {

// Indexed by level + 1. Constant data, so that constructors of static objects may log.
constexpr const char* kNames[] = {"INHERIT", "DEBUG", "INFO", "WARN", "ERROR", "CRITICAL"};
static_assert(sizeof(kNames) / sizeof(kNames[0]) == Max - Min + 1, "one name for each level");

const char* fullName(Level level) { return kNames[level - Min]; }

} // namespace

std::string getName(Level level)
{
    if (!isValid(level)) return std::to_string(static_cast<int>(level));
    return fullName(level);
}

char getAbbreviatedName(Level level) noexcept
{
    if (!isValid(level)) return '?';
    if (level == Inherit) return '^';
    return fullName(level)[0];
}

Level parse(const std::string& text)
{
    const std::string name = Utilities::uppercase(text);
    for (int number = Min; number <= Max; ++number) {
        const Level level = static_cast<Level>(number);
        if (name.size() == 1 && name[0] == getAbbreviatedName(level)) return level;
        if (name == fullName(level)) return level;
    }
    const Level level = static_cast<Level>(std::stoi(name));
    if (!isValid(level)) throw std::invalid_argument("name");
    return level;
}

std::ostream& operator<<(std::ostream& os, Level level) { return os << getName(level); }

std::istream& operator>>(std::istream& is, Level& level)
{
    std::string word;
    if (is >> word) level = parse(word);
    return is;
}

void setLogLevel(Level level) { QelLogger::get().setLevel(level); }

} // namespace qel::LogLevel
