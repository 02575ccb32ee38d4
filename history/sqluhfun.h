// What the library's primitives offer its other sources, beside what sqluhist.h declares.
#pragma once

#include <cstddef>

// Stores directory + name, terminated, in path, which holds capacity bytes. Returns 0 or
// sqluhPathTooLong.
int sqluhJoinPath(char* path, size_t capacity, const char* directory, const char* name);
