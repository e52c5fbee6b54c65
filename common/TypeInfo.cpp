#include <qel/common/TypeInfo.hpp>

#include <cstdlib>
#include <cxxabi.h>
#include <memory>
#include <stdexcept>

namespace qel {

std::string TypeInfo::demangleSymbol(const char* symbol)
{
    if (symbol == nullptr) throw std::invalid_argument("symbol");
    int status = 0;
    const std::unique_ptr<char, decltype(&std::free)> readable(abi::__cxa_demangle(symbol, nullptr, nullptr, &status),
                                                               &std::free);
    return readable ? readable.get() : symbol;
}

std::string TypeInfo::getTypeName(const std::type_info& type) { return demangleSymbol(type.name()); }

} // namespace qel
