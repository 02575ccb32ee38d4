// The restore planner: its records, its messages, and the stages of a run in the order they run.
//
// A stage returns 0 or one of the negative codes below; what there is to say of a failure it leaves
// in lastFailure, for the program to say in its own way. All memory of a run hangs on one
// restorePlan and is released by freePlan.
#pragma once

#include <cstddef>
#include <cstdint>

#include "zq3.h"

// --- Codes and messages --------------------------------------------------------------------------

enum : int {
    aliasInvalid = -1,
    timestampInvalid = -2,
    scanOpenFailed = -3,
    scanGetFailed = -4,
    scanCloseFailed = -5,
    outOfMemory = -6,
    imageNotFound = -8,
    requiredImageMissing = -10,
    argumentMissing = -11,
    restoreTypeInvalid = -12,
    tablespaceImageRefused = -13,
};

enum : int { reportNotWritten = 1 }; // exit status of a run whose stages all succeeded

// One message of a failure. The site number is part of the text that support asks for.
struct planMessage {
    const char* text; // at most one %s; of a scan call: its short name
    int code;
    unsigned int site;
};

inline constexpr planMessage
    msgAlias = {"Invalid database alias", aliasInvalid, 454},
    msgTimestamp = {"Invalid timestamp", timestampInvalid, 469},
    msgRestoreType = {"Invalid restore type", restoreTypeInvalid, 495},
    msgNoRestoreType = {"Invalid restore type", restoreTypeInvalid, 502},
    msgNoNames = {"Missing list of tablespace names", argumentMissing, 524},
    msgNoAliasOrTimestamp = {"Missing either database alias or timestamp", argumentMissing, 554},
    msgTablespaceImage = {"Database restore from a tablespace image detected.\n"
                          "Can only restore such an image either at a tablespace level\n"
                          "or with REBUILD WITH option. But please be aware that\n"
                          "currently this utility is not supported for rebuild.\n"
                          "Please re-issue utility with \"TABLESPACE\" option.\n",
                          tablespaceImageRefused, 597},
    msgNoImage = {"No image found for timestamp %s", imageNotFound, 1316},
    msgNoValidNames = {"Invalid list of tablespace names specified", argumentMissing, 748},
    msgMissingImage = {"Missing required backup image for\ntablespace %s", requiredImageMissing,
                       1487},
    msgMissingFullImage = {"Missing required full backup image for\ntablespace %s",
                           requiredImageMissing, 1642},
    msgNoMemoryList = {"Memory allocation", outOfMemory, 286},
    msgNoMemoryImages = {"Memory allocation", outOfMemory, 627},
    msgNoMemoryMatrix = {"Memory allocation", outOfMemory, 782},
    msgNoMemorySelected = {"Memory allocation", outOfMemory, 892},
    msgNoMemoryCommandText = {"Memory allocation", outOfMemory, 1096},
    msgNoMemoryBuffers = {"Memory allocation", outOfMemory, 1111},
    msgNoMemoryNameBlock = {"Memory allocation", outOfMemory, 1121},
    msgNoMemoryEntries = {"Memory allocation", outOfMemory, 1196},
    msgNoMemoryNames = {"Memory allocation", outOfMemory, 1224};

inline constexpr planMessage msgOpenScan = {"OpenScan", scanOpenFailed, 1064},
                             msgGetEntry = {"GetEntry", scanGetFailed, 1159},
                             msgCloseScan = {"CloseScan", scanCloseFailed, 1303};

// What a failed stage has to say.
struct planFailure {
    const planMessage* message;
    const char* argument; // what %s stands for: a text of the plan's, or what the caller passed in
    int sqlcode;          // of a scan call; 0: it failed without one
};
extern planFailure lastFailure;

// Set lastFailure and return the message's code.
int failStage(const planMessage& message, const char* argument = "");
int failScan(const planMessage& message, int sqlcode);

// --- Records -------------------------------------------------------------------------------------

enum : size_t {
    timestampLength = 14,
    aliasLength = 8,
    nameSize = zq3TablespaceNameCapacity, // a name's slot: the name, then zeros to the end
};

// The names of an entry. Most entries of a history list the same tablespaces, and share a list;
// whoever wants other names in an entry gives it another list.
struct nameList {
    uint32_t uses; // entries that have the list; the last one to let go frees it
    uint32_t count;
    int renamedBy;     // of the pass under way: the renames that were applied last
    nameList* renamed; // what they made of it: another list, or this one
};

// One kept entry of the history.
struct historyEntry {
    uint32_t index; // its place among the kept entries as the scan returned them
    char timestamp[timestampLength + 1];
    char backupId[timestampLength + 1]; // of a restore: timestamp of the image that it used
    char operation;                     // zq3Operation...
    char object;                        // zq3Object...
    char operationType;                 // of a backup: full, incremental or delta
    uint32_t numTablespaces;
    char (*tablespaceNames)[nameSize]; // numTablespaces slots, after a nameList; null: none
};

// The kept entries, in ascending order of their timestamps after a successful fetch.
struct historyData {
    int numEntries;
    int backupIndex; // position of the target image; -1 before a successful fetch
    int renameIndex; // position of the first rename before the target; -1: none
    historyEntry* entries;
};

// A record's place among records that are found by name (nameindex.h). Numbers are counted from 1;
// 0: none.
struct nameLinks {
    uint32_t first; // record of the bucket that this record heads
    uint32_t next;  // record after this one in its own bucket
};

// One tablespace to be restored: a column of the timeline matrix.
struct tablespaceInfo {
    int id;              // the column, equal to the position in the list
    char deleted;        // 0
    char tracking;       // 1 while images are taken, 0 while waiting for the restored image
    char* restoredImage; // timestamp of the image waited for; an entry's backupId
    char lastImageType;  // cell of the image taken last, or chainComplete
    nameLinks links;
    char name[nameSize];
};

// One backup image: a row of the timeline matrix, the oldest first and the target last.
struct backupImage {
    char timestamp[timestampLength + 1];
    int numTablespaces;
};

// Cells of the timeline matrix, row after row, one column for each tablespace of the list.
enum : char { cellUnused = 'X', cellFull = 'F', cellIncremental = 'I', cellDelta = 'D' };
inline constexpr char chainComplete = '*'; // in place of a cell: nothing older counts

enum restoreKind { restoreDatabase, restoreTablespace };

// Everything that a run allocates. Starts zero-filled; the indexes are set by fetchHistoryEntries'
// caller.
struct restorePlan {
    historyData histData;
    int numBackups; // rows
    backupImage* images;
    tablespaceInfo* list;
    int numTablespaces; // columns
    char* matrix;       // null when the list is empty
    char* selected;     // a flag for each column: needed from the row being printed
};

// Frees what the plan holds, in whatever state a run has left it.
void freePlan(restorePlan* plan);

// Stands in an entry for a name that another tablespace took; a slot like any other.
extern const char DELETED_RENAMED[nameSize];

// --- Lists of names (plan.cpp) -------------------------------------------------------------------

// Makes a list of names that no entry has yet. names: count slots with zeros after the names.
// Returns null when there is no memory.
nameList* makeNameList(const char (*names)[nameSize], uint32_t count);

// Gives the entry a list, and lets go of the one that it had; list null: of none. Its number of
// names is left alone.
void giveNames(historyEntry* entry, nameList* list);

// The entry's list; null when it has none.
nameList* namesOfEntry(const historyEntry* entry);

// --- Fetching the history (fetch.cpp, scan.cpp) --------------------------------------------------

// Where entries come from: calls like those of the scan interface (zq3.h), with the same results
// and SQLCODEs. context is theirs.
struct historySource {
    void* context;
    int (*openScan)(void* context, zq3HistoryOpenStruct* open, sqlca* ca);
    int (*getEntry)(void* context, zq3HistoryFetchStruct* fetch, sqlca* ca);
    int (*closeScan)(void* context, uint16_t* handle, sqlca* ca);
};

// Reads a history into *data: the entries that matter, sorted, with the target image located.
// timestamp: of the target, 14 characters. *numBackups is 0 before and the number of backup images
// up to and with the target afterwards; data->backupIndex and renameIndex are -1 before. Returns 0,
// scanOpenFailed, scanGetFailed, scanCloseFailed, outOfMemory or imageNotFound; the entries read so
// far stay in *data after a failure, too. Without a timestamp (null) no target is looked for: the
// entries are read and sorted.
int fetchFromSource(const historySource* source, const char* timestamp, historyData* data,
                    int* numBackups);

// The same with the scan interface's entries of a database.
int fetchHistoryEntries(char* alias, char* timestamp, historyData* data, int* numBackups);

// qsort's comparator of historyEntry records: by timestamp, then in the order of the scan.
int sortHistoryEntries(const void* first, const void* second);

// Tells whether a command creates a temporary tablespace, judging by its first 35 characters.
bool isCreateTempspace(char* commandText);

// Print one entry and all entries on standard output, with a mark below the target.
void showinfo(historyEntry* entry);
void showEntries(historyData* data);

// --- Tablespaces (tablespaces.cpp) ---------------------------------------------------------------

// Upper-cases a string in place.
void str2upper(char* text);

// Grows the list that *list points at (null: none yet) from current to current + increment records;
// the new ones are zero-filled. Returns 0, or outOfMemory with the list as it was.
int increaseTablespaceList(int current, int increment, tablespaceInfo** list);

// Look a name up among the first count records of the list, or among an entry's names. index may be
// null; it receives the position of the first match or -1.
bool isTablespaceInList(tablespaceInfo* list, char* name, int count, int* index);
bool isTablespaceInHistoryEntry(historyEntry* entry, char* name, int* index);

// Appends the names of the entry that the list does not hold yet. The list has room for all of
// them.
void addTablespacesFromHistEntryToList(tablespaceInfo* list, historyEntry* entry, int* count);

// Makes the list of all tablespaces of the target image. An empty list is no failure. Returns 0 or
// outOfMemory.
int listTargetTablespaces(restorePlan* plan);

// Makes the list of those of the given names that the target image holds. The names are upper-cased
// in place. Returns 0, outOfMemory, or argumentMissing when none is left.
int listNamedTablespaces(restorePlan* plan, char** names, int numNames);

// Tells, right after that, whether one of the names got into the list.
bool isNameListed(const restorePlan* plan, const char* name);

// Tells whether the first rename is young enough to concern a backup image of the plan.
bool isRenamePassDue(restorePlan* plan);

// Gives the tablespaces in all entries before the target the names that they have at the target.
// Returns 0, or outOfMemory with some entries as they were.
int updateHistoryEntriesforRename(historyData* data);

// --- Timeline (timeline.cpp) ---------------------------------------------------------------------

// Makes the plan's rows out of the fetched entries. Returns 0 or outOfMemory.
int listBackupImages(restorePlan* plan);

// Makes the plan's matrix, all cells unused; none for an empty list. Returns 0 or outOfMemory.
int allocateTimelineMatrix(restorePlan* plan);

// Marks, for each tablespace, every image from the target back to its newest full image, following
// restores and stopping at its creation. Returns 0, or requiredImageMissing when an image that a
// restore used is not in the history.
int fillTimelineMatrix(char* matrix, historyData* data, tablespaceInfo* list, int numTablespaces,
                       int numBackups);

// Clears the marks of images that a restore to the target does not need. Returns 0, or
// requiredImageMissing when the chain of a tablespace does not start with a full image.
int scanAndUpdateTimelineMatrix(char* matrix, tablespaceInfo* list, int numTablespaces,
                                int numBackups);

// The same two passes by column: each returns the first column that fails, or -1. After the fill, a
// column that waits in vain has tracking 0, the timestamp of the missing image in restoredImage,
// and a lastImageType other than chainComplete.
int fillColumns(char* matrix, historyData* data, tablespaceInfo* list, int numTablespaces,
                int numBackups);
int scanColumns(char* matrix, int numTablespaces, int numBackups);

// Print the timeline on standard output as it is after the fill and after the scan.
void showBeginningTimeline(restorePlan* plan);
void showNewTimeline(restorePlan* plan);

// --- Report (report.cpp) -------------------------------------------------------------------------

// Prints the suggested sequence of restore commands on standard output. Returns 0 or outOfMemory.
int printRestoreOrder(restorePlan* plan, const char* alias, const char* timestamp,
                      restoreKind kind);
