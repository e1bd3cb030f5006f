// The place of a virtual operation in the table of its class.
#pragma once

#include <array>
#include <bit>
#include <cstddef>

// An overloaded operation is told apart by its signature: SlotOf<bool(int)>(&Class::Operation). Destructors take two
// places. In the C++ ABI of this platform a pointer to a virtual operation holds its place in bytes, plus one; what is
// not virtual gives a number that is no place.
template <typename Signature, typename Class>
std::size_t SlotOf(Signature Class::*operation) {
    return std::bit_cast<std::array<std::size_t, 2>>(operation)[0] / sizeof(void*);
}
