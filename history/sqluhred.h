// An entry in the work area, read and proven, from which its parts can be taken out. Shared by the
// sources that read entries.
//
// operation, in all of these, is the name under which failures are logged; null: they are not.
#pragma once

#include "history/sqluhFixedPart.h"

// Offsets are from the start of the record, which is in the work area.
struct sqluhProvenEntry {
    bool begun; // the file held something at its position
    sqluhFixedWords words;
    uint32_t objectNamesAt; // both lines, if the entry has any
    uint32_t tablespacesAt;
    uint32_t tablespacesEnd; // at most: what comes after them still fits
    uint32_t tailAt;         // the sqlca line; set by sqluhPassTablespaces
};

// Reads the entry at the file's position and proves its checksum, and that its sections lie inside
// it: the tablespace lines only by their number. *entry, and the numbers and letters of its data,
// are filled. Returns 0, END_OF_FILE, HISTORY_FILE_DAMAGED, a transfer code, a seek's or the
// allocation's code, as sqluhReadEntry does.
int sqluhProveEntry(SQLO_FHANDLE fh, SQLUH_ENTRY* entry, SQLUH_WORKAREA* workArea,
                    sqluhProvenEntry* proven, const char* operation);

// Proves the tablespace lines of a proven entry. Returns 0 or HISTORY_FILE_DAMAGED.
int sqluhPassTablespaces(const SQLUH_ENTRY* entry, const SQLUH_WORKAREA* workArea,
                         sqluhProvenEntry* proven, const char* operation);

// Reads and proves the whole entry at the file's position, and takes nothing out. Returns what
// sqluhReadEntry without filters does, but for TABLESPACE_LIST_TRUNCATED, and logs the same.
int sqluhCheckEntry(SQLO_FHANDLE fh, SQLUH_ENTRY* entry, SQLUH_WORKAREA* workArea);
