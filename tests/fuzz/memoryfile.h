// A history file in memory, for the fuzz targets: the OS-services calls are defined here, so that a
// run costs no system call, and logging is silent.
#pragma once

#include <cstddef>
#include <cstdint>

#include "sqo/sqlo.h"

inline constexpr SQLO_FHANDLE memoryHandle = {3, 1};

// Makes these bytes the file, positioned at its start. They stay the caller's; the file is only
// read, but for the header, which is written to lastHeader.
void serveFile(const uint8_t* bytes, size_t size);

extern long long filePosition;
extern char lastHeader[1024];

// Ends the run when something does not hold.
#define REQUIRE(condition) ((condition) ? (void)0 : __builtin_trap())
