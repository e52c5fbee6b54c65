#include "check/server/ServerCases.hpp"

#include <iterator>

namespace qel::tool::check {

Cases serverCases()
{
    Cases all;
    for (const auto family : {frameHeaderCases, frameStreamCases}) {
        Cases cases = family();
        all.insert(all.end(), std::make_move_iterator(cases.begin()), std::make_move_iterator(cases.end()));
    }
    return all;
}

} // namespace qel::tool::check
