#pragma once

#include <qel/common/QelExport.hpp>

#include <string>
#include <typeinfo>

namespace qel {

/// Readable names of types, for exception texts and log lines.
/// A scope for its operations; never instantiated.
/// Thread safety: every operation may be called from any thread.
class QEL_EXPORT TypeInfo {
public:
    TypeInfo() = delete;

    /// Turns a compiler's type or symbol name into a readable one, through the platform's demangler
    /// (`__cxa_demangle` of the Itanium C++ ABI).
    /// @param symbol a zero-terminated name such as std::type_info::name() returns; borrowed for the call
    /// @return the readable name, or the text as it was when the demangler does not know it
    /// @throws std::invalid_argument "symbol" when `symbol` is null
    static std::string demangleSymbol(const char* symbol);

    /// @return the readable name of a type, such as "qel::PosixError"
    static std::string getTypeName(const std::type_info& type);

    /// @return the readable name of the object's type; of a polymorphic object, of its dynamic type
    template <typename T>
    static std::string getTypeName(const T& object)
    {
        return getTypeName(typeid(object));
    }
};

} // namespace qel
