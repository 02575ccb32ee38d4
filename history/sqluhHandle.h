// What the handle's source offers recovery and utilities, beside what sqluhist.h declares.
#pragma once

#include "history/sqluhist.h"

// Takes the lock of a new history file that was put in the place of the one whose lock the handle
// holds; the old lock is released only when the new one is held. operation: what it is logged
// under.
//
// The key is the file's, so whoever puts a new file there (fatal recovery, the first piece of a
// restore) changes it: others use the new key from then on, and those who waited for the old one
// wake up with the lock of a file that is gone. Hence the key is looked at again after every lock.
//
// Returns 0, also for a handle without a lock; or a lock code, and the handle may then still hold
// the lock of the file that stood there before.
int sqluhFollowLock(SQLUH_HANDLE* handle, const char* operation);
