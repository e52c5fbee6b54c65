#pragma once

namespace qel {

/// A deleter for std::unique_ptr that calls a C library's own release function:
/// @code
/// using FilePtr = std::unique_ptr<FILE, CustomDeleter<FILE, int, &fclose>>;
/// @endcode
/// Stateless, so that such a unique pointer has the size of a plain pointer.
/// Thread safety: that of the release function.
/// @tparam T    the type of the object
/// @tparam R    the result type of the function; the result is ignored
/// @tparam Free the function that releases the object; it must not throw and is not called for null
template <class T, class R, R (*Free)(T*)>
struct CustomDeleter {
    void operator()(T* object) const noexcept { static_cast<void>(Free(object)); }
};

} // namespace qel
