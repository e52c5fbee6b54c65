#pragma once

#include <locale>
#include <string>

namespace qel::test {

/// Sets a global locale that prints 4711 as 4.711 and 0.5 as 0,5, for the length of a test. Existing streams keep their
/// locale.
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
