// A private copy of one history file, as it was while its directory was locked.
#pragma once

#include "history/sqluhist.h"

struct historySnapshot {
    SQLO_FHANDLE file;       // the copy, at its first entry; no name leads to it
    uint32_t numRows;        // entries, with the damaged one that ends them, if any
    uint32_t maxTablespaces; // largest number of names that one entry lists
};

// Opens the history in directory, repairs it if it must, copies its file and lets go of it.
// *snapshot is filled unless the result is negative; its file is then the caller's to close.
// Returns 0, HISTORY_FILE_RECREATED, or a negative code of sqluhOpen, of sqluhClose or of the
// copying.
int takeSnapshot(char* directory, SQLUH_WORKAREA* workArea, historySnapshot* snapshot);
