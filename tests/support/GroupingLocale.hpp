#pragma once

#include <locale>
#include <string>

namespace qel::test {

/// Makes the process print numbers as some countries write them, 4711 as 4.711 and 0.5 as 0,5: the global locale, for
/// the length of a test. Streams that exist already keep theirs.
class GroupingLocale {
public:
    GroupingLocale() : mPrevious(std::locale::global(std::locale(std::locale::classic(), new Numbers))) {}
    ~GroupingLocale() { std::locale::global(mPrevious); }
    GroupingLocale(const GroupingLocale&) = delete;
    GroupingLocale& operator=(const GroupingLocale&) = delete;

private:
    class Numbers : public std::numpunct<char> {
    protected:
        char do_decimal_point() const override { return ','; }
        char do_thousands_sep() const override { return '.'; }
        std::string do_grouping() const override { return "\3"; }
    };

    const std::locale mPrevious;
};

} // namespace qel::test
