// The client library's interface: the history scan.
//
// libzq3.so.1 provides the three calls. The same zq3HistoryData record carries one entry of the
// recovery history through the whole system: a scan fills it, the planner reads it, the
// history-file library reads entries into it and writes them from it.
//
// The header is C11 as well as C++.
#pragma once

#include <assert.h>
#include <stddef.h>
#include <stdint.h>

#include "sqo/sqlca.h"

// The type of an enumeration's members, where the language can tell it.
#ifdef __cplusplus
#define ZQ3_OF(type) : type
#else
#define ZQ3_OF(type)
#endif

// The interface version that every scan call passes as its first argument.
enum ZQ3_OF(unsigned int) { zq3Version = 6010000 };

// A text in a buffer of the caller's.
typedef struct textBuffer {
    char* data;        // the caller's buffer; null: the caller does not want this text
    uint32_t capacity; // bytes in the buffer, room for the terminator included
    uint32_t length;   // length of the text; may exceed what the buffer could take
} textBuffer;

// Room that holds every text of an entry, terminators included.
enum ZQ3_OF(uint32_t) {
    zq3ObjectPartCapacity = 18,
    zq3SecondTimestampCapacity = 15,
    zq3LogNameCapacity = 13, // firstText, lastText
    zq3IdTextCapacity = 25,
    zq3QualifierTextCapacity = 31,
    zq3NameTextCapacity = 129,
    zq3LongTextCapacity = 256,
    zq3NoteTextCapacity = 31,
    zq3TablespaceNameCapacity = 19,
};

// Letters of an entry; others occur, and mean nothing to this system.
enum ZQ3_OF(char) {
    zq3OperationBackup = 'B',
    zq3OperationRestore = 'R',
    zq3OperationCreate = 'A', // of a tablespace
    zq3OperationRename = 'N', // of a tablespace
    zq3OperationOther = 'O',

    zq3ObjectDatabase = 'D',
    zq3ObjectTablespace = 'P', // one or more tablespaces

    zq3StatusActive = 'A',
    zq3StatusActiveLower = 'a',
    zq3StatusInactive = 'I',
    zq3StatusInactiveLower = 'i',
};

// One entry of the recovery history. Every buffer it points to belongs to whoever set it up.
typedef struct zq3HistoryData {
    char eyecatcher[8];
    textBuffer objectPart;      // 14-digit timestamp and 3-digit sequence number
    textBuffer secondTimestamp; // 14-digit timestamp
    textBuffer firstText;       // up to 12 characters
    textBuffer lastText;        // up to 12 characters
    textBuffer idText;          // up to 24 characters; a restore's: timestamp of the image used
    textBuffer qualifierText;   // first object name
    textBuffer nameText;        // second object name
    textBuffer longText;        // up to 255 characters
    textBuffer noteText;        // up to 30 characters
    textBuffer commandText;     // the command, any length
    uint8_t logPosition[6];
    uint16_t entryNode;
    uint32_t entryNumber;
    uint32_t reserved1;
    sqlca* eventSqlca;             // outcome of the operation
    textBuffer* tablespaceBuffers; // maxTablespaces elements
    uint32_t maxTablespaces;       // capacity of the array, set by the caller
    uint32_t numTablespaces;       // names that the entry lists, also when fewer were delivered
    char operation;
    char object;
    char operationType;
    char status;
    char auxCode;
    char reserved2[3];
} zq3HistoryData;

// Argument of zq3HistoryOpenScan.
typedef struct zq3HistoryOpenStruct {
    char* databaseAlias;     // plain name of 1 to 8 characters, terminated
    char* timestamp;         // null: every entry; nothing else is taken
    char* objectName;        // null: every entry; nothing else is taken
    uint32_t numRows;        // out: number of entries that the scan will return
    uint32_t maxTablespaces; // out: largest number of names that one entry of the scan lists
    uint16_t callerAction;   // 0
    uint16_t handle;         // out: the scan, for the two other calls
} zq3HistoryOpenStruct;

// Argument of zq3HistoryGetEntry.
typedef struct zq3HistoryFetchStruct {
    zq3HistoryData* historyRecord; // filled by the call; its buffers are the caller's
    uint16_t handle;               // from zq3HistoryOpenStruct
    uint16_t callerAction;         // 2: the next entry
} zq3HistoryFetchStruct;

static_assert(offsetof(zq3HistoryData, commandText) == 8 + 9 * sizeof(textBuffer), "layout");
static_assert(offsetof(zq3HistoryData, logPosition) == 8 + 10 * sizeof(textBuffer), "layout");
static_assert(offsetof(zq3HistoryData, eventSqlca) == 8 + 10 * sizeof(textBuffer) + 16, "layout");
static_assert(sizeof(void*) != 4 ||
                  (sizeof(textBuffer) == 12 && sizeof(zq3HistoryData) == 168 &&
                   sizeof(zq3HistoryOpenStruct) == 24 && sizeof(zq3HistoryFetchStruct) == 8),
              "layout");
static_assert(sizeof(void*) != 4 || (offsetof(zq3HistoryData, tablespaceBuffers) == 148 &&
                                     offsetof(zq3HistoryData, operation) == 160),
              "layout");
static_assert(sizeof(void*) != 8 ||
                  (sizeof(textBuffer) == 16 && sizeof(zq3HistoryData) == 216 &&
                   sizeof(zq3HistoryOpenStruct) == 40 && sizeof(zq3HistoryFetchStruct) == 16),
              "layout");

#ifdef __cplusplus
extern "C" {
#endif

// All three: version is zq3Version, the record and ca are the caller's. Returns 0 when the call
// could be made; the outcome is then ca->sqlcode: 0, a negative failure or a positive warning. Any
// other result means that the call itself was wrong; ca, unless null, then holds an SQLCODE too:
// -2040 the version is not zq3Version, -2041 a record is null or a member has no such value, -2042
// no scan is open under the handle (not from the open). A negative SQLCODE that is not listed here
// is the code of what failed underneath: the lock, a file, memory.

// Opens a scan of one database's recovery history and fills numRows, maxTablespaces and handle.
//
// The history is only read: no lock is left, nothing is repaired. A writer is waited for only where
// reads cannot be proven (he commits without pause, or the file system is foreign), some seconds.
//
// openStruct: a zq3HistoryOpenStruct. SQLCODEs: 0; 2162 the history file could not be used and its
// shadow was read; 2163 one of the two has a damaged entry and the other one was read; or, with no
// scan open and *openStruct as it was, -2036 the alias is no plain name or has no history, -2161
// neither file can be used, -2043 too many scans are open, -2044 no memory, or another negative
// code of reading the history.
int zq3HistoryOpenScan(unsigned int version, void* openStruct, sqlca* ca);

// Delivers the next entry of an open scan into the record.
//
// fetchStruct: a zq3HistoryFetchStruct. SQLCODEs: 0; 2165 the entry lists more tablespaces than the
// record has room for, the rest was delivered; 100 there was no further entry; -2161 the entry is
// damaged, or another negative code of reading it. After 100 or a failure the record is empty, and
// after a failure every further get fails with its code.
int zq3HistoryGetEntry(unsigned int version, void* fetchStruct, sqlca* ca);

// Ends a scan. handle: points at the 16-bit handle. SQLCODE: 0.
int zq3HistoryCloseScan(unsigned int version, void* handle, sqlca* ca);

#ifdef __cplusplus
} // extern "C"
#endif
