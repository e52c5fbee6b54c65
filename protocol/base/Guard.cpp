#include "base/Guard.hpp"

#include <qel/protocol/Error.hpp>

#include <exception>

namespace qel::protocol {

std::string explainCurrent()
{
    try {
        throw;
    } catch (const std::exception& error) {
        return explain(error);
    } catch (...) {
        return "an exception that is not a std::exception";
    }
}

} // namespace qel::protocol
