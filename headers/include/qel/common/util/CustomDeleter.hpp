#pragma once

namespace qel {

/// Makes a unique pointer release its object through a C library's own function:
/// @code
/// using FilePtr = std::unique_ptr<FILE, CustomDeleter<FILE, int, &fclose>>;
/// @endcode
/// Stateless, so that such a unique pointer is as small as a plain pointer.
/// @tparam T    the type of the object
/// @tparam R    the result type of the function; the result is dropped, since nobody is left to act on it
/// @tparam Free the function that releases the object; it must not throw
template <class T, class R, R (*Free)(T*)>
struct CustomDeleter {
    void operator()(T* object) const noexcept { static_cast<void>(Free(object)); }
};

} // namespace qel
