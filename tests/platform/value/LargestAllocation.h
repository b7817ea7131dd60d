#pragma once

// Watches the size of the largest single heap allocation, so that a test can
// show that a hostile length claim was refused before anything was allocated
// for it. Works by replacing the global operator new of the test program
// (LargestAllocation.cpp), which makes it a per-program facility: link it
// into one test program only.

#include <cstddef>

namespace tn::test {

// Forgets the allocations made so far.
void resetLargestAllocation();

// The size of the largest allocation since the last reset.
size_t largestAllocation();

}  // namespace tn::test
