// What the handle's source offers to those of recovery and of the utilities.
#pragma once

#include <cstddef>

#include "history/sqluhist.h"

// Stores directory + name, terminated, in path, which holds capacity bytes. Returns 0 or
// sqluhPathTooLong.
int sqluhJoinPath(char* path, size_t capacity, const char* directory, const char* name);

// Takes the lock of the history file that stands at the path. Without a lock at first, or with that
// of a file that stood there before, which is released only when the new one is held.
//
// The key is the file's, so whoever puts a new file there (fatal recovery, the first piece of a
// restore) changes it: others use the new key from then on, and those who waited for the old one
// wake up with the lock of a file that is gone. Hence the key is looked at again behind every lock.
//
// Returns 0 or a lock code; the handle may then still hold the lock of a file that stood there
// before.
int sqluhLockFileAtPath(SQLUH_HANDLE* handle);
