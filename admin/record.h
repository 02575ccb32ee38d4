// One entry of a history with room for all it can hold.
#pragma once

#include "history/sqluhist.h"

struct historyRecord {
    SQLUH_ENTRY entry;   // its data member points at data
    zq3HistoryData data; // owns its texts; each is terminated and length tells its true length
    sqlca event;        // what data.eventSqlca points at; counts only if entry.sqlcaLength is not 0
    bool numberByPlace; // the entry's number is that of its place in the history

    // The two parts of data.objectPart, terminated.
    char timestamp[timestampWidth + 1];
    char sequence[4];
};

struct historyList {
    historyRecord** records;
    size_t count;
    size_t capacity;
};

// Allocates an empty record; null without memory. freeRecord accepts null.
historyRecord* newRecord(void);
void freeRecord(historyRecord* record);

// Replaces a text of a record, or appends a tablespace name. False without memory.
bool setText(textBuffer* text, const char* bytes, size_t length);
bool addTablespace(historyRecord* record, const char* bytes, size_t length);

// Bring the two parts of data.objectPart and the whole into step. joinObjectPart: false without
// memory.
void splitObjectPart(historyRecord* record);
bool joinObjectPart(historyRecord* record);

// Appends a record, which is the list's from then on. False without memory.
bool addRecord(historyList* list, historyRecord* record);
void freeList(historyList* list);

// Takes a row of a committed history in full, so that writing the record gives the same bytes
// again. Returns 0 or, past the last row, END_OF_FILE or what ended the rows; or sqloSystemError
// with ENOMEM.
int takeRow(const SQLUH_COMMITTED* committed, uint32_t row, historyRecord* record);
