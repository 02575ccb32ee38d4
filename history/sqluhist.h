// The recovery-history library: file format, records, codes and entry points.
//
// A history directory holds the history file and its shadow, two files of one format: a header of
// 1024 bytes, then entry records back to back to the end of the file. Directories are given as
// strings that end with the path separator.
//
// Texts are terminated, and whatever a pointer leads to stays the caller's, unless a comment says
// otherwise. Lengths, sizes and offsets are in bytes.
//
// A code is 0, a negative failure, or a positive warning that still delivers. The comments name all
// that can come back; of those passed up,
//   a call's code   is what the OS-services call returned (sqo/sqlo.h), unchanged;
//   path code       is sqluhPathTooLong or sqluhPathNoSeparator;
//   transfer code   is that of a failed or short read or write as sqlzGetZRCInfo maps it,
//                   HISTORY_FILE_DAMAGED where it maps it to 0;
//   lock code       is sqloNLCKKeyFailure, sqloNLCKKeyConflict, sqloNLCKOwnerDied,
//                   sqloNLCKDeadlock, or sqloSystemError with the errno (sqo/sqlonlck.h).
#pragma once

#include <cstddef>
#include <cstdint>

#include "sqo/sqlo.h"
#include "sqo/sqlonlck.h"
#include "zq3.h"

enum : int {
    HISTORY_FILE_DAMAGED = -2161,     // a record is damaged, incomplete or cannot be formatted
    HISTORY_FILE_MISSING = -2036,     // the directory holds no history file
    HISTORY_FILE_RECREATED = 2160,    // both files were unusable: moved aside, an empty pair made
    HISTORY_READ_FROM_SHADOW = 2162,  // the shadow was read: the history file cannot be used
    HISTORY_READ_PAST_DAMAGE = 2163,  // one copy has a damaged entry: the other one was read
    TABLESPACE_LIST_TRUNCATED = 2165, // more tablespaces than the caller's buffers hold
    HISTORY_WARNING = 2172,           // an error turned into a warning by sqluh_build_warning
};

// What a path is refused with.
enum : int {
    sqluhPathTooLong = sqloSystemError | 36,     // ENAMETOOLONG: it does not fit the path buffers
    sqluhPathNoSeparator = sqloSystemError | 22, // EINVAL: a directory without its last separator,
                                                 // whose files would stand beside it
};

// --- The files -----------------------------------------------------------------------------------

#define SQLUH_HISTORY_NAME "zq3rhist.asc"
#define SQLUH_SHADOW_NAME "zq3rhist.bak"
#define SQLUH_SAVED_HISTORY_NAME "zq3rhist.a" // a damaged history file, moved aside
#define SQLUH_SAVED_SHADOW_NAME "zq3rhist.b"  // a damaged shadow, moved aside

enum : unsigned int {
    pathCapacity = 1024,
    maxDirectoryLength = pathCapacity - sizeof SQLUH_HISTORY_NAME, // 1011
    createPathCapacity = 256,
    maxCreateDirectoryLength = createPathCapacity - sizeof SQLUH_HISTORY_NAME, // 243
};

// Format versions from which a header reads differently; what this library writes is the last.
enum : uint32_t {
    versionWithNumber15 = 6010000,
    versionWithTimestamp = 7020200, // its checksum covers less, until
    versionWithWholeChecksum = 8010000,
    currentVersion = 9010300,
};

// Operation-type letters of backup images; every other letter is a full image.
enum : char {
    typeIncremental = 'I',
    typeIncrementalOther = 'O',
    typeDelta = 'D',
    typeDeltaOther = 'E',
};

// Header status letters. A file is usable when its header reads and its status is blank or 'C'.
enum : char {
    statusConsistent = ' ', // nothing is unfinished
    statusPending = 'P', // history: a batch is in progress; shadow: the history is rebuilt from it
    statusCommitted = 'C', // the history file holds a complete batch that the shadow may lack
};

#define SQLUH_EMPTY_TIMESTAMP "00000101000000"
#define SQLUH_EMPTY_WORD "-"

// --- The header record ---------------------------------------------------------------------------

enum : uint32_t { headerLength = 1024 };

// Offsets in the header's text of the fields that are read by position.
enum : uint32_t {
    headerVersionAt = 134,
    headerNumber15At = 143,
    headerTimestampAt = 152,
    headerMaxCommandAt = 167,
    headerMaxCommandAtNoTimestamp = 153, // field 16 shrank to "-"
    headerMaxCommandAt7020200 = 152,     // versions without a timestamp
    headerMaxCommandAt6010000 = 143,     // versions without number15 either
    headerNumberWidth = 8,
    timestampWidth = 14,
};

static constexpr char headerFormat[] =
    "%8.8X:%16.16llX:%16.16llX:%16.16llX:%8.8X:%8.8X:%8.8X:%8.8X:%8.8X:%8.8X:%8.8X:%8.8hX:%c:"
    "%8.8u:%8.8X:%-14.14s:%8.8X:%79.79s\n%255.255s\n%255.255s\n%255.255s\n";
static constexpr char headerScanFormat[] =
    "%8x:%16llx :%16llx :%16llx :%8x:%8x:%8x:%8x:%8x:%8x:%8x:%8hx:%c:";

// The header in memory. Its 92 bytes, integers little-endian, are what the header's checksum is
// taken over, so the layout is part of the file format; packing keeps the size at 92 where 64-bit
// integers are aligned to 8 bytes. Members named by a number are fields whose meaning belongs to
// the code that adds entries: this library carries them.
#pragma pack(push, 4)
struct SQLUH_HEADER {
    uint32_t checksum;
    uint32_t reserved1;
    uint64_t offset1;
    uint64_t offset2;
    uint64_t offset3; // of an entry record; 0: none
    uint32_t version;
    uint32_t entryCount;
    uint32_t number6;
    uint32_t number7;
    uint32_t number15;
    uint32_t number8; // bounds the tablespaces of an entry
    uint32_t number9;
    uint32_t number10;
    uint32_t number11;
    uint16_t nodeNumber;
    char status;
    char reserved2;
    char timestamp[14]; // no terminator
    char reserved3[2];
    uint32_t maxCommandLength; // of any entry, in characters
};
#pragma pack(pop)
enum : uint32_t {
    headerImageLength = 92,
    headerImageLength7020200 = 72, // checksum coverage of versions 7020200 to below 8010000
    headerImageLengthShort = 88,   // second chance for every version
};
static_assert(sizeof(SQLUH_HEADER) == headerImageLength);
static_assert(offsetof(SQLUH_HEADER, offset1) == 8 && offsetof(SQLUH_HEADER, version) == 32);
static_assert(offsetof(SQLUH_HEADER, entryCount) == 36 && offsetof(SQLUH_HEADER, number15) == 48);
static_assert(offsetof(SQLUH_HEADER, nodeNumber) == 68 && offsetof(SQLUH_HEADER, status) == 70);
static_assert(offsetof(SQLUH_HEADER, timestamp) == 72);
static_assert(offsetof(SQLUH_HEADER, maxCommandLength) == 88);

// --- The entry record ----------------------------------------------------------------------------

enum : uint32_t {
    lineLength = 256,
    lineTextLength = 255, // characters of a line before its line feed
    entryFixedLength = 512,
    entryMinLength = 768, // the fixed part and the note line
    entryNoteAt = 512,
    entryLongTextAt = 768,
    tablespaceNameAt = 9,     // the name's place in its line, after eight digits and a colon
    tablespaceLineExtra = 10, // what a line is longer than its name
    sqlcaLineLength = 194,
    commandPieceLength = 255,
    maxNoteLength = 30, // what a reader keeps
    maxLongTextLength = 255,
    defaultWorkAreaSize = 2107648,
    workAreaPerTablespace = 28, // line length of a tablespace with an 18-character name
};

enum : uint32_t { entryReserved1At = 106, entryReserved1Length = 149 };

static constexpr char entryFormat[] =
    "%8.8X:%4.4hX:%8.8X:%8.8X:%8.8u:%c:%8.8X:%8.8X:%8.8X:%8.8X:%8.8X:%8.8X:%8.8X:%149.149s\n"
    "%c:%c:%c:%-17.17s:%-14.14s:%-12.12s:%-12.12s:%-12.12s:%-24.24s:%c:%150.150s\n";
static constexpr char entryScanFormat[] = "%8x:%4hx:%8x:%8x:%8u:%c:%8x:%8x:%8x:%8x:%8x:%8x:%8x:\n"
                                          "%c:%c:%c:%17s :%14s :%12s :%12s :%12s :%24s :%c:\n";
static constexpr char logPositionFormat[] = "%2.2X%2.2X%2.2X%2.2X%2.2X%2.2X";
static constexpr char lineFormat[] = "%-255.255s\n";
static constexpr char objectNamesFormat[] = "%-*.*s\n%-*.*s\n";
static constexpr char tablespaceFormat[] = "%8.8X:%-*.*s\n";
static constexpr char commandPieceFormat[] = "%-*.*s\n";
static constexpr char sqlcaFormat[] = "%-8.8s%10.10i%+10.10i%4.4hX%-70.70s%-8.8s"
                                      "%+10.10i%+10.10i%+10.10i%+10.10i%+10.10i%+10.10i"
                                      "%c%c%c%c%c%c%c%c%c%c%c%-5.5s\n";
static constexpr char checksumFormat[] = "%8.8X";

// Members of the sqlca line: where each stands, how wide it is.
struct sqluhField {
    uint16_t at;
    uint16_t width;
};
static constexpr sqluhField sqlcaIdField = {0, 8}, sqlcaBcField = {8, 10},
                            sqlcaCodeField = {18, 11}, sqlcaErrmlField = {29, 4},
                            sqlcaErrmcField = {33, 70}, sqlcaErrpField = {103, 8},
                            sqlcaErrdField = {111, 11}, // six of them
    sqlcaWarnField = {177, 11}, sqlcaStateField = {188, 5};

// One entry: the numbers of its fixed part, and its contents.
struct SQLUH_ENTRY {
    uint32_t checksum;
    uint32_t size; // of the whole record in bytes
    uint32_t version;
    uint32_t noteLength;
    uint32_t longTextLength;
    uint32_t qualifierLength;
    uint32_t nameLength;
    uint32_t sqlcaLength;   // 0 or 194
    uint32_t commandLength; // in characters
    zq3HistoryData* data;   // the caller's
};

// Fields 1 to 23 of the fixed part in order; a colon stands after each.
enum : unsigned int {
    fieldChecksum,
    fieldNode,
    fieldNumber,
    fieldSize,
    fieldVersion,
    fieldStatus,
    fieldNoteLength,
    fieldLongTextLength,
    fieldQualifierLength,
    fieldNameLength,
    fieldNumTablespaces,
    fieldSqlcaLength,
    fieldCommandLength,
    fieldOperation,
    fieldObject,
    fieldOperationType,
    fieldObjectPart,
    fieldSecondTimestamp,
    fieldFirstText,
    fieldLastText,
    fieldLogPosition,
    fieldIdText,
    fieldAuxCode,
    entryFieldCount
};
enum sqluhFieldKind : uint8_t {
    kindHex,            // uint32_t
    kindHex16,          // uint16_t
    kindDecimal,        // uint32_t
    kindLetter,         // char
    kindOptionalLetter, // char; "-" is the absent one
    kindTimestamp,      // textBuffer, one word; SQLUH_EMPTY_TIMESTAMP is the empty one
    kindWord,           // textBuffer, one word; SQLUH_EMPTY_WORD is the empty one
    kindLogPosition,    // bytes, one word of two hexadecimal digits each
};
enum sqluhFieldOwner : uint8_t { ownerEntry, ownerData }; // SQLUH_ENTRY, zq3HistoryData

// Where a field stands, how wide it is, what it is, and the member that holds it.
struct sqluhEntryField {
    uint16_t at;
    uint16_t width;
    sqluhFieldKind kind;
    sqluhFieldOwner owner;
    uint16_t member; // its offset in the owner
};
static constexpr sqluhEntryField entryFields[entryFieldCount] = {
    {0, 8, kindHex, ownerEntry, offsetof(SQLUH_ENTRY, checksum)},
    {9, 4, kindHex16, ownerData, offsetof(zq3HistoryData, entryNode)},
    {14, 8, kindHex, ownerData, offsetof(zq3HistoryData, entryNumber)},
    {23, 8, kindHex, ownerEntry, offsetof(SQLUH_ENTRY, size)},
    {32, 8, kindDecimal, ownerEntry, offsetof(SQLUH_ENTRY, version)},
    {41, 1, kindLetter, ownerData, offsetof(zq3HistoryData, status)},
    {43, 8, kindHex, ownerEntry, offsetof(SQLUH_ENTRY, noteLength)},
    {52, 8, kindHex, ownerEntry, offsetof(SQLUH_ENTRY, longTextLength)},
    {61, 8, kindHex, ownerEntry, offsetof(SQLUH_ENTRY, qualifierLength)},
    {70, 8, kindHex, ownerEntry, offsetof(SQLUH_ENTRY, nameLength)},
    {79, 8, kindHex, ownerData, offsetof(zq3HistoryData, numTablespaces)},
    {88, 8, kindHex, ownerEntry, offsetof(SQLUH_ENTRY, sqlcaLength)},
    {97, 8, kindHex, ownerEntry, offsetof(SQLUH_ENTRY, commandLength)},
    {256, 1, kindLetter, ownerData, offsetof(zq3HistoryData, operation)},
    {258, 1, kindOptionalLetter, ownerData, offsetof(zq3HistoryData, object)},
    {260, 1, kindOptionalLetter, ownerData, offsetof(zq3HistoryData, operationType)},
    {262, 17, kindTimestamp, ownerData, offsetof(zq3HistoryData, objectPart)},
    {280, 14, kindTimestamp, ownerData, offsetof(zq3HistoryData, secondTimestamp)},
    {295, 12, kindWord, ownerData, offsetof(zq3HistoryData, firstText)},
    {308, 12, kindWord, ownerData, offsetof(zq3HistoryData, lastText)},
    {321, 12, kindLogPosition, ownerData, offsetof(zq3HistoryData, logPosition)},
    {334, 24, kindWord, ownerData, offsetof(zq3HistoryData, idText)},
    {359, 1, kindOptionalLetter, ownerData, offsetof(zq3HistoryData, auxCode)},
};

// The buffer that entry records are read into. size is always the capacity of buffer.
struct SQLUH_WORKAREA {
    char* buffer; // from sqlogmblkEx; the owner releases it with sqlofmblkEx
    uint32_t size;
};

// Bits of the reader's match flags.
enum : unsigned int {
    matchQualifier = 0x01,
    matchName = 0x02,
    matchTablespace = 0x04,
    matchFilterLater = 0x08, // the timestamp filter is greater than the entry's timestamp
    matchFilterEqual = 0x10,
    matchFilterEarlier = 0x20,
    matchSqlcodeSet = 0x40, // the entry's sqlca line holds an sqlcode that is not 0
};

// Returns the checksum of both record kinds: the exclusive-or of the buffer's 32-bit little-endian
// words, the last partial word padded with zeros. The buffer need not be aligned.
uint32_t sqluhChecksum(void* buffer, unsigned int length);

// sprintf under the "C" locale: returns the number of characters formatted, the terminator not
// counted; negative when formatting failed. buffer has room for all of it. The locale of the
// process, and that of the calling thread, are afterwards what they were.
int sqluhSprintf(char* buffer, const char* format, ...) __attribute__((format(printf, 2, 3)));

// --- Reading and writing records -----------------------------------------------------------------
// fh is an open history file; these functions neither open nor close it.

// Writes the header at offset 0 and leaves the file at 1024. Sets the record's version to the
// current one and its checksum. Returns 0; HISTORY_FILE_DAMAGED when it could not be formed or
// fewer bytes were written; a transfer code; the allocation's or the seek's code.
int sqluhWriteHeader(SQLO_FHANDLE fh, SQLUH_HEADER* header);

// Reads the header into *header, converting those of older versions, and leaves the file at 1024.
// The record's checksum is 0 afterwards. Returns 0; END_OF_FILE for a file of 0 bytes, and when the
// entry that an older header names lies at or past the end of the file; HISTORY_FILE_DAMAGED; a
// transfer code; an allocation's or a seek's code. After a failure *header may hold part of a
// header and must not be used, and the file may stand anywhere.
int sqluhReadHeader(SQLO_FHANDLE fh, SQLUH_HEADER* header);

// Tells whether the checksum in the record, which still has the version of its file, matches;
// leaves the member 0.
bool sqluhCheckHeaderChecksum(SQLUH_HEADER* header);

// Stores the length in characters of the longest command text of all entries (on failure: of those
// read so far) and leaves the file at 1024. Returns 0; a failure of sqluhReadEntry other than
// END_OF_FILE; a seek's or the allocation's code.
int sqluhFindMaxCommandLen(SQLO_FHANDLE fh, uint32_t* maxLength);

// Positions the file at its first entry; newOffset, unless null, receives the offset. Returns 0 or
// the seek's code.
int sqluhRewind(SQLO_FHANDLE fh, long long* newOffset);

// Allocates a work area of size bytes, zero-filled; its buffer is the caller's to release. Returns
// 0, or the allocation's code with the record as it was.
int sqluhInitWorkArea(SQLUH_WORKAREA* workArea, uint32_t size);

// Reads the entry at the file's position and leaves the file after it.
//
// entry: its data member points to the record to fill, whose buffers are the caller's. workArea: at
// least 512 bytes; grown, and kept so, when an entry is larger. The filters may be null; of
// timestampFilter 14 characters count. matchFlags receives the bits above. A text is cut to its
// buffer and terminated; its length member tells the length in the file, a note's at most 30.
// Returns 0; TABLESPACE_LIST_TRUNCATED, as 0 but names beyond maxTablespaces were not stored;
// END_OF_FILE when no entry is left, or the file ends right after a fixed part;
// HISTORY_FILE_DAMAGED; a transfer code; a seek's or the allocation's code when the work area could
// not be grown. After a failure *entry and its data may be filled in part, and the file stands
// where the last read left it.
int sqluhReadEntry(SQLO_FHANDLE fh, SQLUH_ENTRY* entry, SQLUH_WORKAREA* workArea,
                   const char* timestampFilter, const char* qualifierFilter, const char* nameFilter,
                   const char* tablespaceFilter, unsigned int* matchFlags);

// A walk over the entries of an open file, from its position on. Starts with entry (its data set
// up), workArea and file given.
struct SQLUH_ENTRYWALK {
    SQLO_FHANDLE file;
    SQLUH_ENTRY* entry;       // as for sqluhReadEntry
    SQLUH_WORKAREA* workArea; // as for sqluhReadEntry
    long long offset;         // where the entry that was read last, or could not be read, begins
    bool cutShort;            // the file ends inside that entry
};

// Reads the next entry of the walk without filters. Returns 0, also when names did not fit;
// END_OF_FILE, with cutShort telling whether the file ends inside an entry after all; or another
// code of sqluhReadEntry or of a seek.
int sqluhNextEntry(SQLUH_ENTRYWALK* walk);

// --- The handle ----------------------------------------------------------------------------------

// One write of a batch, to be repeated in the shadow.
struct SQLUH_REPLAYENTRY {
    long long offset; // in the file
    uint32_t length;  // bytes
    char* copy;       // the bytes; kept for the first element only
};

struct SQLUH_REPLAYAREA {
    SQLUH_REPLAYENTRY* replayEntries; // in the order they were written
    uint32_t numReplayEntries;
    uint32_t maxReplayEntries; // elements allocated
    uint32_t maxReplayLength;  // largest length recorded
    uint8_t replayDisabled;    // recording stopped: the shadow needs a whole-file copy
};
enum : uint32_t { replayGrowth = 10 }; // elements that the array grows by

// One open use of a history directory. Owns its work area's buffer, the replay array and the first
// element's copy.
struct SQLUH_HANDLE {
    SQLO_FHANDLE fileHandle; // the history file; descriptor -1 exactly when none is open
    SQLUH_HEADER header;     // as read at open; the caller of a batch keeps its counts
    SQLUH_WORKAREA workArea;
    SQLO_NLCK namedLock;
    bool isLocked;
    char directory[pathCapacity];
    char historyPath[pathCapacity];
    char shadowPath[pathCapacity];
    SQLUH_REPLAYAREA replayArea;
    bool restoredFromImage; // rewritten from a backup image; the close copies it over the shadow
    bool restoreMarked;     // its file is marked until the whole image is there
    int restoreCode;        // of the first piece of the image that failed
};

// Allocates and initialises a handle, the caller's until sqluhHandleFree; opens and locks nothing.
// directory: at most 1011 bytes; copied. Returns 0, or with null stored sqluhPathTooLong or an
// allocation's code.
int sqluhHandleAllocAndInit(char* directory, SQLUH_HANDLE** handleOut);

// Releases the handle and what it owns and sets the caller's pointer to null; null is accepted.
// Neither closes the file nor releases the lock.
void sqluhHandleFree(SQLUH_HANDLE** handle);

// Access modes of sqluhOpen; every value but 4 opens for reading and writing.
enum : unsigned int { SQLUH_OPEN_READ = 4, SQLUH_OPEN_UPDATE = 12 };

// Takes the directory's lock, checks and repairs the two files, opens the history file and reads
// its header. Waits without limit for the lock; whoever holds a handle on the directory must not
// open it again in another thread. A file that cannot be opened or read counts as damaged, whatever
// the reason, but two are not given up while one of them may be sound. Returns 0 or
// HISTORY_FILE_RECREATED with an open handle, to be released by sqluhClose; or with null stored
// HISTORY_FILE_DAMAGED; a path code; a lock code; an allocation's code; what kept a file from
// being looked at; a failure of sqluhCreate.
int sqluhOpen(SQLUH_HANDLE** handleOut, char* directory, unsigned int accessMode);

// Closes the file, puts a restored image in force and copies it over the shadow, releases the lock
// and frees the handle, whatever fails on the way; the caller's pointer, which may have been null,
// is null afterwards. 0 after a restore means that the image is in place. Returns 0 or the first
// failure: with the old history in force, the code of the piece that failed, sqloNLCKLost, or what
// kept the image from being put in force; the close's code, the copy's, or a code of sqluhUnlock.
int sqluhClose(SQLUH_HANDLE** handle);

// Takes the directory's lock for the handle, without limit of time; puts an empty history file
// where there is none to make the key from. Returns 0, or a lock code with no lock held.
int sqluhLock(SQLUH_HANDLE* handle);

// Releases the lock if the handle holds it. Returns 0, or sqloSystemError with the errno and the
// handle still locked.
int sqluhUnlock(SQLUH_HANDLE* handle);

// --- Creation, recovery, verification ------------------------------------------------------------

// Makes a new, empty pair of files in place of what is there, under the caller's lock. directory:
// at most 243 bytes. Returns 0; sqluhPathTooLong; the open's, the close's or the copy's code; a
// code of sqluhWriteHeader.
int sqluhCreate(char* directory);

// Allocates a handle, takes the lock, examines both files and, if optToRecover, repairs them. The
// handle is the caller's to unlock and free, also after a failure, unless null is stored; no file
// is open through it. Returns 0; HISTORY_FILE_RECREATED; HISTORY_FILE_DAMAGED when neither file can
// be used and none may be repaired, or a repair failed; sqluhPathNoSeparator or a code of
// sqluhHandleAllocAndInit, with null stored; a lock code; a failure of sqluhRecoverFromFatalError.
int sqluhAllocateHandleVerifyHistoryFilesAndOptToRecover(SQLUH_HANDLE** handleOut, char* directory,
                                                         bool optToRecover);

// What the examination of a file of the pair found.
struct SQLUH_FILESTATE {
    bool usable; // the header reads and its status is blank or 'C'
    char status; // of the header; zero when it could not be read
};

SQLUH_FILESTATE sqluhStateOfFile(int rc, const SQLUH_HEADER* header); // rc: of reading the header

// Tells the repair that the states of history file and shadow ask for. Files that need none, or
// that a repair has been made of, must agree in size and both have a readable header, or the shadow
// is rebuilt.
enum sqluhRepair {
    sqluhRepairNone,
    sqluhRepairShadow,  // the shadow is rebuilt from the history file
    sqluhRepairHistory, // the history file is rebuilt from the shadow
    sqluhRepairAnew,    // neither can be used: both are moved aside and an empty pair is made
};
sqluhRepair sqluhDecideRepair(SQLUH_FILESTATE history, SQLUH_FILESTATE shadow);

// Tells whether the directory's history can be used; repairs nothing, but takes the lock, for which
// it creates an empty history file where there is none.
bool sqluhCheckIfHistoryFilesAreUseable(char* directory);

// Tells whether the two files have one size and readable headers. Contents are not compared. No
// file is open through the handle; its header is overwritten.
bool sqluhVerifyHistFilesAreIndentical(SQLUH_HANDLE* handle);

// Make one file a copy of the other. The lock is held and no file is open through the handle.
// Return 0, the copy's code, or a code of sqluhUpdateHeaderStatus.
int sqluhRecoverHistoryFromShadow(SQLUH_HANDLE* handle);
int sqluhRecoverShadowFromHistory(SQLUH_HANDLE* handle);

// Moves both files aside, as far as they can be moved, and makes an empty pair, or keeps the one
// that somebody else made meanwhile; a handle that is locked then holds the new file's lock. No
// file is open through it. Returns 0; sqluhPathTooLong for a directory of more than 243 bytes, and
// nothing moved; a lock code; a code of sqluhCreate.
int sqluhRecoverFromFatalError(SQLUH_HANDLE* handle);

// Rewrites the status letter in the header of the file at path, which nobody has open; does not
// wait for the disk. Returns 0; the open's or the close's code; a code of sqluhReadHeader or
// sqluhWriteHeader.
int sqluhUpdateHeaderStatus(char* path, char status);

// Stores the size of directory + fileName. Returns 0, or with *size as it was sqluhPathTooLong or
// the file query's code.
int sqluh_history_file_get_size(char* directory, char* fileName, unsigned long long* size);

// Verification reads entries and repairs nothing. workArea: as for sqluhReadEntry.
//
// Checks the entry at the file's position and leaves the file after it. Returns 0 or a failure of
// sqluhReadEntry: END_OF_FILE when no entry is left.
int sqluhVerifyOneEntry(SQLO_FHANDLE fileHandle, SQLUH_WORKAREA* workArea);

// Checks the entries from the file's position to its end. Returns 0, or the first failure of
// sqluhReadEntry other than END_OF_FILE.
int sqluhVerifyHistoryEntries(SQLO_FHANDLE fileHandle, SQLUH_WORKAREA* workArea);

// Checks the header and all entries of the file at path. Returns 0; the open's or the close's code;
// a code of sqluhReadHeader (END_OF_FILE for an empty file) or of sqluhVerifyHistoryEntries.
int sqluhVerifyUnopenedHistoryFile(char* path, SQLUH_WORKAREA* workArea);

// sqluhVerifyHistoryEntries for the handle's open file, with its work area: same results.
int sqluh_verify_history_files(SQLUH_HANDLE* handle);

// sqluhVerifyOneEntry, but leaves the position as it was. Returns its codes or a seek's.
int sqluhVerifyCurrentEntry(SQLO_FHANDLE fileHandle, SQLUH_WORKAREA* workArea);

// Checks that offset is not past the end of the file and leaves the position as it was. Returns
// 0; END_OF_FILE when it is; a seek's code. A file whose end cannot be told passes.
int sqluhVerifySeekOffsetNotPastEOF(SQLO_FHANDLE fileHandle, long long offset);

// --- Writing and batches -------------------------------------------------------------------------

// Writes entry at the history file's position and records the write for replay. The caller holds
// the handle of a batch, positions the file and keeps the header's counts. Sets the entry's size,
// version and checksum, and the length of tablespace names given with 0. A text that is missing or
// shorter than its length is padded with blanks. Returns 0; HISTORY_FILE_DAMAGED when the lengths
// do not agree with the contents or come to 2 GiB or more, and nothing was written; the
// allocation's or the seek's code, and nothing was written; a transfer code, after which part of
// the record may be in the file.
int sqluhWriteEntry(SQLUH_HANDLE* handle, SQLUH_ENTRY* entry);

// Records a write of length bytes at offset for replay; keeps a copy of the bytes where it needs
// one. entryCount: the header's at the time of the write. Returns 0 when it was recorded or
// recording has stopped; an allocation's code when that failed (replayDisabled is then set).
int sqluhAddReplayEntry(SQLUH_REPLAYAREA* area, long long offset, unsigned int length,
                        const char* bytes, unsigned int entryCount);

// Brings the shadow up to date with a batch that is complete in the history file, durably. Returns
// 0; the first failing call's code (a read's or write's unmapped; a short write's transfer code); a
// code of sqluhWriteHeader. After a failure the handle's file may be closed.
int sqluhReplayWorkInShadow(SQLUH_HANDLE* handle);

enum : unsigned int { sqluhAbandon = 0, sqluhCommit = 1 }; // flags of sqluhEndBatch

extern "C" {

// Opens the directory for a batch: on success the handle, to be released by sqluhEndBatch, is open
// and locked and the history file durably says 'P'. Returns 0 (also on files that the open had to
// make anew), or with null stored a failure of sqluhOpen, a code of sqluhWriteHeader, or the sync's
// code.
int sqluhBeginBatch(SQLUH_HANDLE** handle, char* directory);

// Commits (bit 0 of flags set) or abandons the batch, and closes the handle in every case; null is
// accepted. Returns 0 or the first failure: a code of sqluhWriteHeader, of
// sqluhReplayWorkInShadow or of sqluhClose, a sync's code, or sqloNLCKLost, and nothing of the
// batch stays, when the lock was taken away during it. After a failed commit the next open
// settles whether the batch survived. A handle without an open file or without the lock is only
// closed: nothing is committed, and 0 does not mean that it was.
int sqluhEndBatch(SQLUH_HANDLE** handle, unsigned int flags);

// Copies the history file of one directory over that of another, whose lock is not taken and which
// has no shadow afterwards; each directory: at most 1011 bytes. Stopped at any moment, the target
// holds its old or the new history. Returns 0; HISTORY_FILE_RECREATED, and nothing copied, when the
// source was unusable; a path code; a failure of sqluhOpen or sqluhClose; the copy's or the
// deletion's code; what kept a file of the target from being looked at or marked.
int sqluhCopyHistoryFile(char* sourceDirectory, char* targetDirectory);

} // extern "C"

// --- The committed history, only looked at -------------------------------------------------------

// The history of a directory as the last commit left it, in memory.
struct SQLUH_COMMITTED {
    uint32_t numRows;        // entries
    uint32_t maxTablespaces; // largest number of names that one of them lists
    int failure;             // what ended the rows early; 0: nothing did
    bool fromShadow;         // they are the shadow's
    // The damaged entry that ended the rows or, if the other copy was read instead, the damaged one
    // there: its offset, and its number counted from 1. 0: there is none.
    long long damagedAt;
    uint32_t damagedEntry;
    SQLUH_FILESTATE history, shadow; // what the two headers said
    SQLUH_HEADER header;             // of the copy that was read
    struct sqluhRows* rows;          // the library's
};

// Reads the committed history of a directory. It opens for reading only, creates, repairs and moves
// nothing, and takes the directory's lock, for as long as it reads, only where a writer leaves it
// no quiet moment; it does not wait for a writer that does nothing.
//
// directory: with its last separator, at most 1011 bytes. Stores what was read, the caller's until
// sqluhFreeCommitted, and returns 0; HISTORY_READ_FROM_SHADOW; HISTORY_READ_PAST_DAMAGE. Or stores
// null and returns HISTORY_FILE_MISSING when neither file is there; HISTORY_FILE_DAMAGED when
// neither can be used; a path code; sqloNLCKBusy, or another lock code, when writers kept it
// off for some seconds; an allocation's code; sqloSystemError with the errno of what kept it from
// opening or reading a file that may be sound.
int sqluhReadCommitted(const char* directory, SQLUH_COMMITTED** out);

// Copies a row, counted from 0, into the entry and its data, as sqluhReadEntry would. asWritten:
// object, operation type, aux code, note and long text as they stand in the file, so that writing
// the entry gives the same bytes. Returns 0 or TABLESPACE_LIST_TRUNCATED; past the last row
// END_OF_FILE or the failure that ended them, with the entry as it was.
int sqluhGetCommitted(const SQLUH_COMMITTED* committed, uint32_t row, SQLUH_ENTRY* entry,
                      bool asWritten);

// Releases it and sets the caller's pointer to null, which it may have been.
void sqluhFreeCommitted(SQLUH_COMMITTED** committed);

// --- Utilities -----------------------------------------------------------------------------------

// Allocates one block with a scan record, its sqlca, numTablespaces name buffers of 19 bytes and
// its text buffers; the command text's holds commandTextLength characters and exists only when
// asked for. pool: null for the default one. The block is the caller's until sqluhFreeHistoryData,
// which accepts a pointer to null and leaves one. Returns 0, or the allocation's code with nothing
// stored.
int sqluhAllocateHistoryData(zq3HistoryData** dataOut, SMemPool* pool, unsigned int numTablespaces,
                             bool withCommandText, unsigned int commandTextLength);
void sqluhFreeHistoryData(zq3HistoryData** data);

// Reads a piece of the open history file for a backup image: up to bufferSize bytes from offset
// into buffer, their number into *bytesRead. Fewer than asked for mean the end of the file. Returns
// 0, or the seek's or the read's code; *bytesRead then means nothing.
int sqluh_fill_backup_buffer(SQLUH_HANDLE* handle, unsigned int offset, unsigned int bufferSize,
                             unsigned char* buffer, unsigned int* bytesRead);

// Writes a piece of a backup image, length bytes for offset, over the open history file; the piece
// at offset 0 comes first and replaces the file, which nobody can open until sqluhClose has found
// every piece written, puts it in force and copies it over the shadow. Until then, and after any
// failure, the old history is in force. An image whose own header says 'P' is safe only when the
// close has returned. Returns 0; the code of the failing close, delete, open, mark, seek or write,
// unmapped; a lock code, of the new file's lock.
int sqluh_write_restore_buffer(SQLUH_HANDLE* handle, unsigned int offset, unsigned char* buffer,
                               unsigned int length);

// Tells whether the directory's history holds no entry, by its header's count. Returns 0 (also on
// files that the open had to make anew); HISTORY_FILE_MISSING; sqluhPathTooLong; a failure of
// sqluhOpen or sqluhClose. *isEmpty is false unless 0 comes back.
int sqluhIsHistoryFileEmpty(char* directory, bool* isEmpty);

// Turns the error in *ca into the warning HISTORY_WARNING with the old code, in decimal, as its
// token.
void sqluh_build_warning(sqlca* ca);

// Tests of a backup's operation-type letter; a letter of neither kind is a full image.
bool sqluhIsHistEntryIncr(char operationType);
bool sqluhIsHistEntryDelta(char operationType);
bool sqluhIsHistEntryIncrOrDelta(char operationType);
