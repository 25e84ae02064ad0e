// sr_i_allocation.cpp - the C library's malloc and realloc behind
// Sr_Allocation, the door through which a table's row index and change
// entry blocks are allocated.

#include "tables/sr_i_allocation.h"

#include <cstdlib>

namespace {

// Known when the program is compiled, so that both tables below are filled
// before any other initialiser of the library can reach the door.
constexpr sr_i_allocation_calls_t C_Library_Calls = {
    .allocate = std::malloc,
    .reallocate = std::realloc,
};

}  // namespace

const sr_i_allocation_calls_t Sr_Default_Allocation = C_Library_Calls;
sr_i_allocation_calls_t Sr_Allocation = C_Library_Calls;
