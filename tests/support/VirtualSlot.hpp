#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>

namespace qel::test {

/// @return the slot of a virtual operation in the virtual table of its class, counted from 0. A virtual destructor
/// takes two slots. Programs that were compiled against an older header call by this number, so it must not change.
///
/// In the Itanium C++ ABI, the first word of a pointer to a virtual member function is the offset of its slot in bytes,
/// on most processors plus 1.
template <typename MemberFunction>
std::size_t virtualSlot(MemberFunction function)
{
    std::uintptr_t word = 0;
    std::memcpy(&word, &function, sizeof(word));
    return word / sizeof(void*);
}

} // namespace qel::test
