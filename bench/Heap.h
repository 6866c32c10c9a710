// What is asked of the heap.
#pragma once

#include <cstddef>

// Calls of malloc, calloc and realloc by any thread since it was set to 0; counted only while it is not negative.
extern long heapCalls;
// Bytes in use.
std::size_t heapInUse();
