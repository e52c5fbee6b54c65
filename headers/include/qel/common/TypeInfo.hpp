#pragma once

#include <qel/common/QelExport.hpp>

#include <string>
#include <typeinfo>

namespace qel {

/// Readable names of types, for exception texts and log lines.
/// A scope for its operations; it has no instances.
/// Thread safety: any thread may call every operation.
/// Each operation throws std::bad_alloc if there is no memory for its result.
class QEL_EXPORT TypeInfo {
public:
    TypeInfo() = delete;

    /// Demangles the name of a type or symbol, with `__cxa_demangle` of the Itanium C++ ABI.
    /// @param symbol a zero-terminated name such as std::type_info::name() returns; borrowed for the call
    /// @return the readable name, or the text unchanged if the demangler refuses it
    /// @throws std::invalid_argument  with the text "symbol": `symbol` is null
    static std::string demangleSymbol(const char* symbol);

    /// @return the readable name of a type, such as "qel::PosixError"
    static std::string getTypeName(const std::type_info& type);

    /// @return the readable name of the object's type, for a polymorphic object of its dynamic type
    template <typename T>
    static std::string getTypeName(const T& object)
    {
        return getTypeName(typeid(object));
    }
};

} // namespace qel
