// OS-services calls that count themselves and fail where a test says. The program's own definitions
// stand before those of the shared library and forward to them.
#pragma once

#include <cstddef>

enum osCall {
    // clang-format off
    osNone, osOpen, osClose, osRead, osWrite, osSeek, osCopy, osAllocate, osReallocate, osCallCount
    // clang-format on
};

inline constexpr int failed = -99, mappedCode = -4242;

struct faultPlan {
    osCall call = osNone; // what fails
    unsigned int at = 1;  // at which of its calls, counted from 1
    int code = failed;    // what it returns
    long transferred = 0; // bytes that a failing read or write still moves
};

struct faultState {
    faultPlan plan;
    unsigned int calls[osCallCount];
    size_t largestReallocation;
    int lastMapped; // given to sqlzGetZRCInfo, which returns mappedCode while a fault is armed
};
extern faultState faults;

// Arms a fault for the calls to come; disarm with armFault({}).
void armFault(const faultPlan& plan);
