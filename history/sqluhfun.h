// What the library's primitives offer its other sources, beside what sqluhist.h declares.
#pragma once

#include <cstddef>

// Stores directory + name, terminated, in path, which holds capacity bytes. Returns 0 or
// sqluhPathTooLong.
int sqluhJoinPath(char* path, size_t capacity, const char* directory, const char* name);

// Returns 0 for a directory that ends with the path separator, or is the empty text;
// sqluhPathNoSeparator for another.
int sqluhCheckDirectory(const char* directory);
