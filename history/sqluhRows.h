// Entries decoded and kept packed in memory, in the order they were added.
#pragma once

#include "history/sqluhred.h"

struct sqluhRow;
struct sqluhNameList;
struct sqluhChunk;

enum : unsigned int { recentLists = 64 };

struct sqluhRows {
    sqluhRow** rows;
    uint32_t count;
    uint32_t capacity;
    uint32_t maxTablespaces; // largest number of names that one row lists
    sqluhChunk* chunks;      // what the rows stand in
    // What neighbouring entries share, most often: the list of names and the event.
    const sqluhNameList* lastNames;
    const sqluhNameList* lists[recentLists]; // those met of late, by the checksum of their lines
    const sqlca* lastEvent;
    char lastEventLine[sqlcaLineLength];
};

// Adds the proven entry whose record is in the work area, when its tablespace lines are sound, too.
// Returns 0, HISTORY_FILE_DAMAGED, or an allocation's code; nothing is added then, and nothing is
// logged. Starts with a zero-filled record.
int sqluhAddRow(sqluhRows* rows, const SQLUH_ENTRY* entry, const SQLUH_WORKAREA* workArea,
                sqluhProvenEntry* proven);

// Copies a row out, as sqluhReadEntry would have read the entry.
// asWritten: letters, note and long text as they stand in the file, so that writing them gives the
// same bytes. Returns 0 or TABLESPACE_LIST_TRUNCATED.
int sqluhTakeRow(const sqluhRow* row, SQLUH_ENTRY* entry, bool asWritten);

// Releases all rows; the record is zero-filled afterwards.
void sqluhFreeRows(sqluhRows* rows);
